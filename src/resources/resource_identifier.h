// Resource identifiers and the URL readings the download manager makes.
//
// A resource's identifier is a bag key and becomes a file name in the caches folder, so it comes
// from the server and must be checked before it touches a path. Resource URLs are compared with
// the "key" query item left out: the server rotates that item with every bag, and a rotation
// alone must not cause a download.
//
// Pure functions over text: safe from any thread.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tavix {

// The two look-up hints resources (bag keys), kept only while look-up is enabled.
inline constexpr const char* kTVXLookupHintsWeekly = "lookup_hints_weekly";
inline constexpr const char* kTVXLookupHintsMonthly = "lookup_hints_monthly";

// True for the weekly or the monthly hints key.
bool isLookupResource(std::string_view identifier);

// Whether `identifier` may name a file in the caches folder: not empty, at most 255 bytes, no
// "/" or NUL, and not starting with "." (which also rules out "." and "..", and keeps the
// manager's own temporary files, which start with ".", out of reach). `why` says what failed.
bool isValidResourceIdentifier(std::string_view identifier, std::string* why = nullptr);

// The URL with every query item named "key" removed, and no query at all when none remains.
// Empty when `url` is not an absolute URL.
std::optional<std::string> urlForCompare(std::string_view url);

// Whether two URLs differ in path or query (the rest is not compared). A URL that does not parse
// differs from everything.
bool differsInPathOrQuery(std::string_view a, std::string_view b);

// The decoded value of the first query item named `name` (empty text for an item without "=").
// Empty when there is no such item or the URL does not parse.
std::optional<std::string> queryItemValue(std::string_view url, std::string_view name);

// The URL's decoded path ("/" for none). Empty when the URL does not parse.
std::optional<std::string> urlPath(std::string_view url);

}  // namespace tavix
