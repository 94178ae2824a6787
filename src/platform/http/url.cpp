#include "platform/http/url.h"

#include <curl/curl.h>

#include <algorithm>
#include <charconv>

#include "platform/strings.h"

namespace tavix::platform::http {

struct URL::Handle {
  explicit Handle(CURLU* h) : url(h) {}
  ~Handle() { curl_url_cleanup(url); }
  CURLU* url;
};

namespace {

bool isSchemeChar(char c, bool first) {
  const bool alpha = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z');
  if (first) return alpha;
  return alpha || (c >= '0' && c <= '9') || c == '+' || c == '-' || c == '.';
}

// The length of the "scheme:" that `text` begins with, without the colon; 0 for none.
std::size_t schemeLength(std::string_view text) {
  const auto colon = text.find(':');
  if (colon == std::string_view::npos || colon == 0) return 0;
  for (std::size_t i = 0; i < colon; ++i) {
    if (!isSchemeChar(text[i], i == 0)) return 0;
  }
  return colon;
}

// libcurl forgives "scheme:/host" and "scheme:///host"; we take only "scheme://host".
bool hasSchemeAndAuthority(std::string_view text) {
  const auto colon = schemeLength(text);
  return colon != 0 && text.substr(colon, 3) == "://" && text.size() > colon + 3 && text[colon + 3] != '/' &&
         text[colon + 3] != '?' && text[colon + 3] != '#';
}

constexpr unsigned kStrictFlags = CURLU_NON_SUPPORT_SCHEME;
constexpr unsigned kLenientFlags = CURLU_NON_SUPPORT_SCHEME | CURLU_ALLOW_SPACE | CURLU_PATH_AS_IS;

}  // namespace

URL::URL(std::unique_ptr<Handle> handle) : handle_(std::move(handle)) {}
URL::URL(const URL& other) : handle_(std::make_unique<Handle>(curl_url_dup(other.handle_->url))) {}
URL& URL::operator=(const URL& other) {
  if (this != &other) handle_ = std::make_unique<Handle>(curl_url_dup(other.handle_->url));
  return *this;
}
URL::~URL() = default;

std::optional<URL> URL::parse(std::string_view text) {
  if (!hasSchemeAndAuthority(text)) return std::nullopt;
  return parseWithFlags(std::string(text), kStrictFlags);
}

std::optional<URL> URL::parseLeniently(std::string_view text) {
  text = trimmedWhitespace(text);
  if (text.starts_with("//")) text.remove_prefix(2);
  // libcurl's own guess would make "ftp.example.com" an ftp URL, and its default scheme is https;
  // an address typed without a scheme is an http one.
  if (!schemeOf(text)) return parseWithFlags("http://" + std::string(text), kLenientFlags);
  return parseWithFlags(std::string(text), kLenientFlags);
}

std::optional<URL> URL::parseWithFlags(const std::string& text, unsigned flags) {
  // A NUL would end the text early for libcurl.
  if (text.find('\0') != std::string::npos) return std::nullopt;
  auto handle = std::make_unique<Handle>(curl_url());
  if (!handle->url) return std::nullopt;
  if (curl_url_set(handle->url, CURLUPART_URL, text.c_str(), flags) != CURLUE_OK) return std::nullopt;
  return URL(std::move(handle));
}

std::optional<std::string> URL::part(int which) const {
  char* value = nullptr;
  if (curl_url_get(handle_->url, static_cast<CURLUPart>(which), &value, 0) != CURLUE_OK || !value) return std::nullopt;
  std::string out(value);
  curl_free(value);
  return out;
}

std::string URL::scheme() const { return part(CURLUPART_SCHEME).value_or(""); }
std::string URL::host() const { return part(CURLUPART_HOST).value_or(""); }
std::optional<std::string> URL::user() const { return part(CURLUPART_USER); }
std::optional<std::string> URL::password() const { return part(CURLUPART_PASSWORD); }
std::string URL::path() const { return part(CURLUPART_PATH).value_or("/"); }
std::optional<std::string> URL::query() const { return part(CURLUPART_QUERY); }
std::optional<std::string> URL::fragment() const { return part(CURLUPART_FRAGMENT); }
std::string URL::string() const { return part(CURLUPART_URL).value_or(""); }

std::optional<int> URL::port() const {
  const auto text = part(CURLUPART_PORT);
  int port = 0;
  // libcurl has checked it is a number from 0 to 65535.
  if (!text || std::from_chars(text->data(), text->data() + text->size(), port).ec != std::errc()) return std::nullopt;
  return port;
}

void URL::appendQueryItem(std::string_view name, std::string_view value) {
  // Encoded here rather than with CURLU_URLENCODE, which writes a blank as "+": our query items
  // are decoded without form rules, and "+" would come back as a plus sign.
  const std::string item = percentEncode(name) + "=" + percentEncode(value);
  curl_url_set(handle_->url, CURLUPART_QUERY, item.c_str(), CURLU_APPENDQUERY);
}

void URL::setQuery(std::optional<std::string_view> query) {
  const std::string text(query.value_or(""));
  curl_url_set(handle_->url, CURLUPART_QUERY, query ? text.c_str() : nullptr, 0);
}

std::optional<std::string_view> schemeOf(std::string_view text) {
  const auto length = schemeLength(text);
  if (length == 0) return std::nullopt;
  const std::string_view rest = text.substr(length + 1);
  const std::string_view port = rest.substr(0, rest.find_first_of("/?#"));
  const bool isPort = !port.empty() && std::all_of(port.begin(), port.end(), [](char c) { return c >= '0' && c <= '9'; });
  if (isPort) return std::nullopt;
  return text.substr(0, length);
}

namespace {

bool isUnreserved(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '_' ||
         c == '.' || c == '~';
}

}  // namespace

std::string percentEncode(std::string_view text) {
  // Most names and values need no escape: they are copied without a trip through libcurl.
  if (std::all_of(text.begin(), text.end(), isUnreserved)) return std::string(text);
  // The handle argument has been unused since libcurl 7.82.
  char* encoded = curl_easy_escape(nullptr, text.data(), static_cast<int>(text.size()));
  if (!encoded) return {};
  std::string out(encoded);
  curl_free(encoded);
  return out;
}

std::string percentDecode(std::string_view text) {
  if (text.find('%') == std::string_view::npos) return std::string(text);
  int length = 0;
  char* decoded = curl_easy_unescape(nullptr, text.data(), static_cast<int>(text.size()), &length);
  if (!decoded) return std::string(text);
  std::string out(decoded, static_cast<std::size_t>(length));
  curl_free(decoded);
  return out;
}

std::vector<std::pair<std::string, std::optional<std::string>>> decodedQueryItems(std::string_view query) {
  std::vector<std::pair<std::string, std::optional<std::string>>> items;
  while (!query.empty()) {
    const auto amp = query.find('&');
    const std::string_view item = query.substr(0, amp);
    if (!item.empty()) {
      const auto eq = item.find('=');
      if (eq == std::string_view::npos) {
        items.emplace_back(percentDecode(item), std::nullopt);
      } else {
        items.emplace_back(percentDecode(item.substr(0, eq)), percentDecode(item.substr(eq + 1)));
      }
    }
    if (amp == std::string_view::npos) break;
    query.remove_prefix(amp + 1);
  }
  return items;
}

}  // namespace tavix::platform::http
