// URL: an absolute URL with a host, parsed and taken apart by libcurl's URL API, and the percent
// coding every request and reply in the daemon uses. One parser for all, so that the URL a request
// is built from, the URL the session fetches and the URL a cache keys on agree on what they mean.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace tavix::platform::http {

class URL {
 public:
  // "scheme://host[:port][/path][?query][#fragment]", any scheme. Refused: no host, unescaped
  // blanks or control characters, a port out of range.
  static std::optional<URL> parse(std::string_view text);

  URL(const URL& other);
  URL& operator=(const URL& other);
  URL(URL&&) noexcept = default;
  URL& operator=(URL&&) noexcept = default;
  ~URL();

  std::string scheme() const;  // lower-case
  std::string host() const;    // as written; an IPv6 address keeps its brackets
  std::optional<std::string> query() const;     // still percent-encoded, without "?"
  std::optional<std::string> fragment() const;  // without "#"

 private:
  struct Handle;
  explicit URL(std::unique_ptr<Handle> handle);
  std::optional<std::string> part(int which) const;

  std::unique_ptr<Handle> handle_;
};

// Percent-encodes every byte but ASCII letters, digits and "-_.~".
std::string percentEncode(std::string_view text);
// Decodes %XX escapes; a malformed escape is kept as it stands.
std::string percentDecode(std::string_view text);

// The "name[=value]" items of a query (without "?" or "#"), decoded, in order; an item without
// "=" has no value.
std::vector<std::pair<std::string, std::optional<std::string>>> decodedQueryItems(std::string_view query);

}  // namespace tavix::platform::http
