// The pure half of look-up hints: the version signature of a hints file from the URL it was
// served from, the check a hints file passes before it is handed to the hints store, and the
// filter that drops look-up results that do not fit the typed query well enough.
//
// Logs under "Tavix_LookUp". Stateless: safe from any thread.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/property_value.h"

namespace tavix {

// Source kinds of the hints store.
inline constexpr int kTVXLookupSourceKindWeekly = 2;
inline constexpr int kTVXLookupSourceKindMonthly = 3;

// "c-d-b" for a URL whose path is "/a/b/c/d" (parts 3, 4 and 2 of the path split at "/", the
// leading empty part counting). The empty text, with a log line, for a path of four parts or
// fewer or a URL that does not parse.
std::string signatureFromURL(std::string_view url);

// Whether the bytes of a downloaded hints file are fit to push: a JSON document within the
// parser's bounds. `why` says what is wrong otherwise.
bool isUsableHintsFile(std::string_view bytes, std::string* why = nullptr);

// The words of `text` (word-break rules of `locale`, punctuation and spaces left out), each
// lower-cased.
std::vector<std::string> tokenize(std::string_view text, const char* locale = nullptr);

// The look-up reply (an array of dictionaries that may each hold a "results" array) with every
// result dropped whose "lookup_instructions" the query `query` does not meet:
//  - the weights of the "keywords" whose "word" the query contains must sum to at least
//    "min_keywords_score", and the query must contain "completion" (both as case-insensitive
//    substrings; an absent or empty completion is not contained);
//  - when "min_subject_score" > 0, the Jaccard index of the query's and the "subject"'s word sets
//    must reach it.
// Results without instructions are kept. A reply that is not an array comes back unchanged.
// `locale` (an ICU locale name; null for the process's) governs case and word breaks.
platform::PropertyValue filterLookupResults(std::string_view query, const platform::PropertyValue& reply,
                                            const char* locale = nullptr);

}  // namespace tavix
