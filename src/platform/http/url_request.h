// The values that cross the HTTP layer: a request to send, the response head that came back and
// a transport error. Plain values, no I/O; the URL session moves them over the wire.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace tavix::platform::http {

// Header fields in the order set. Names compare case-insensitively, as HTTP says.
class HeaderFields {
 public:
  // Replaces every field of that name.
  void set(std::string_view name, std::string value);
  void add(std::string name, std::string value);
  void remove(std::string_view name);
  std::optional<std::string> get(std::string_view name) const;
  bool contains(std::string_view name) const { return get(name).has_value(); }
  const std::vector<std::pair<std::string, std::string>>& all() const { return fields_; }
  bool empty() const { return fields_.empty(); }
  // "{Name: value, Name: value}", for logs.
  std::string description() const;

 private:
  std::vector<std::pair<std::string, std::string>> fields_;
};

// Whether `value` may stand as a header field's value: no control characters but the tab, so that
// nothing can end the field early (CR LF) and smuggle in another. URL sessions refuse requests
// that break this; components check strings that will become header values where they take them.
bool isValidHeaderValue(std::string_view value);
// Whether `name` is a header field name (an HTTP token).
bool isValidHeaderName(std::string_view name);

struct URLRequest {
  std::string url;  // absolute, already percent-encoded
  std::string method = "GET";
  // An "Accept-Encoding" field names the content codings the response may use, and the session
  // decodes those; without it the response may use none.
  HeaderFields headers;
  std::string body;
  double timeoutInterval = 60;  // seconds without progress before the task fails
  // Skip any cached response and go to the server (bag fetches, warm-ups, uploads).
  bool reloadIgnoringLocalCacheData = false;
};

struct HTTPURLResponse {
  long statusCode = 0;
  std::string url;  // after redirects
  HeaderFields headers;
  std::int64_t expectedContentLength = -1;
};

// A transport failure: no HTTP response (or not a whole one) came back.
struct URLError {
  std::string domain;  // kURLErrorDomain for transport failures
  long code = 0;
  std::string description;
};

inline constexpr const char* kURLErrorDomain = "TavixURLErrorDomain";

// The transport error codes the daemon tells apart.
enum URLErrorCode : long {
  URLErrorUnknown = -1,
  URLErrorCancelled = -999,
  URLErrorBadURL = -1000,
  URLErrorUnsupportedURL = -1002,
  URLErrorCannotFindHost = -1003,
  URLErrorTimedOut = -1001,
  URLErrorCannotConnectToHost = -1004,
  URLErrorNetworkConnectionLost = -1005,
  URLErrorBadServerResponse = -1011,
  URLErrorDataLengthExceedsMaximum = -1103,
  URLErrorSecureConnectionFailed = -1200,
};

}  // namespace tavix::platform::http
