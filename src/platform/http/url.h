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
  // Also an address as people type it and pages carry it: blanks around it are dropped and blanks
  // inside it kept as written; "http:/host" is forgiven; without a scheme ("host/path",
  // "host:port/path", "//host/path") it is an http URL. The path keeps its "." and ".." segments.
  // Still refused: no host ("mailto:a@b.com"), control characters, a port out of range.
  static std::optional<URL> parseLeniently(std::string_view text);

  URL(const URL& other);
  URL& operator=(const URL& other);
  URL(URL&&) noexcept = default;
  URL& operator=(URL&&) noexcept = default;
  ~URL();

  std::string scheme() const;  // lower-case
  std::string host() const;    // as written; an IPv6 address keeps its brackets
  std::optional<std::string> user() const;      // still percent-encoded
  std::optional<std::string> password() const;  // still percent-encoded
  std::optional<int> port() const;              // only when the URL names one
  std::string path() const;                     // still percent-encoded; "/" for none
  std::optional<std::string> query() const;     // still percent-encoded, without "?"
  std::optional<std::string> fragment() const;  // without "#"
  std::string string() const;                   // the whole URL, as libcurl writes it back

  // Appends "name=value", both percent-encoded as `percentEncode` does, after the query items the
  // URL has and before its fragment.
  void appendQueryItem(std::string_view name, std::string_view value);
  // Replaces the query, still percent-encoded and without "?"; none removes it, "?" and all.
  void setQuery(std::optional<std::string_view> query);

 private:
  struct Handle;
  explicit URL(std::unique_ptr<Handle> handle);
  static std::optional<URL> parseWithFlags(const std::string& text, unsigned flags);
  std::optional<std::string> part(int which) const;

  std::unique_ptr<Handle> handle_;
};

// The scheme `text` begins with, as written ("mailto" of "mailto:a@b.com"). A typed "host:port"
// ("localhost:8080/x") has none.
std::optional<std::string_view> schemeOf(std::string_view text);

// Percent-encodes every byte but ASCII letters, digits and "-_.~".
std::string percentEncode(std::string_view text);
// Decodes %XX escapes; a malformed escape is kept as it stands.
std::string percentDecode(std::string_view text);

// The "name[=value]" items of a query (without "?" or "#"), decoded, in order; an item without
// "=" has no value.
std::vector<std::pair<std::string, std::optional<std::string>>> decodedQueryItems(std::string_view query);

}  // namespace tavix::platform::http
