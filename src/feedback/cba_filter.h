// CBAFilterController: cleans a session's feedback before it is sent. Each CBA engagement (a
// page the user reached from the completion bar) is graded by how closely its URL matches a web
// punch-out that the service itself showed earlier for the same query; the URL is then removed
// from the record, and engagements that match nothing shown are dropped. Stateless.
//
// The URL helpers below are what the grading compares with: lenient parsing, the unwrapping of
// accelerated-mobile-page (AMP) wrapper URLs, and a host-and-path form normalised by registrable
// domain (public suffix list, libpsl).
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "feedback/tavix_feedback.h"

namespace tavix {

// A URL split into its parts. Scheme and host are lower-case (host without a trailing dot); a URL
// with a host and an empty path gets the path "/", so "http://a.com" equals "http://a.com/".
// Query and fragment are absent when the URL has no "?" or "#".
struct URLComponents {
  std::string scheme;
  std::string user;
  std::string password;
  std::string host;
  std::optional<int> port;
  std::string path;
  std::optional<std::string> query;
  std::optional<std::string> fragment;

  bool operator==(const URLComponents&) const = default;
};

// Parses leniently, as `URL::parseLeniently` does: blanks around the text are ignored, and a text
// without a scheme is an http URL ("www.a.com/x", "localhost:8080/x", "//a.com/x"). An address
// that names no host ("mailto:a@b.com") keeps what follows its scheme as path, query and fragment.
// None for what is no URL: an empty or blank string, a bad host or port, control characters.
std::optional<URLComponents> tavix_componentsWithString(std::string_view text);

// The page that an AMP wrapper URL shows, or `components` itself when it is not a wrapper.
// Recognised wrappers (the query and fragment of the wrapper go to the wrapped page):
//   Google's AMP viewer, on any google.<suffix> host:  /amp/s/HOST/PATH -> https://HOST/PATH
//                                                      /amp/HOST/PATH   -> http://HOST/PATH
//   the AMP cache, on any *.cdn.ampproject.org host:  /c/s/HOST/PATH and /v/s/HOST/PATH -> https
//                                                      /c/HOST/PATH and /v/HOST/PATH     -> http
// A wrapper of a wrapper is unwrapped too. A publisher's own ".../amp/..." page is not a wrapper:
// nothing in it says which page it stands for.
URLComponents tavix_componentsForEmbeddedAMPURL(const URLComponents& components);

// Registrable domain + path, for a comparison by domain: "http://www.news.bbc.co.uk/a/" and
// "https://m.bbc.co.uk/a" both give "bbc.co.uk/a". Scheme, user, port, query and fragment are left
// out and one trailing "/" of the path is removed. A host without a registrable domain (an
// address, "localhost", a bare public suffix) stands for itself. Empty when there is no host.
std::string tavix_normalizedURLStringForTLDFeatures(const URLComponents& components);

// How closely two URLs match, weakest first.
enum CBAMatchType : int {
  kCBAMatchNone = 0,        // no match, or either URL empty
  kCBAMatchTLDFeatures = 1, // same normalised host and path
  kCBAMatchWithoutQuery = 2,// equal once the queries are removed
  kCBAMatchIdentical = 3,   // equal (after AMP unwrapping)
};

class CBAFilterController {
 public:
  // One ordered pass: visible results collect, per query id, the punch-out URLs of web results
  // ("com.norvel.tavix.web_suggest" and "com.norvel.tavix.web_index"); each CBA engagement is
  // graded against the URLs collected so far for its query (its record is changed in place:
  // cba_type set, url cleared) and kept only when the grade is above 0. Everything else is kept.
  std::vector<FeedbackRef> arrayOfCBAFilteredFeedback(const std::vector<FeedbackRef>& feedbacks) const;

  static int cbaMatchTypeBetweenURL(std::string_view a, std::string_view b);
};

}  // namespace tavix
