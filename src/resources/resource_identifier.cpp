#include "resources/resource_identifier.h"

#include <curl/curl.h>

#include <memory>
#include <vector>

namespace tavix {

namespace {

struct UrlDeleter {
  void operator()(CURLU* url) const { curl_url_cleanup(url); }
};
using UrlHandle = std::unique_ptr<CURLU, UrlDeleter>;

UrlHandle parse(std::string_view text) {
  if (text.find('\0') != std::string_view::npos) return nullptr;
  UrlHandle url(curl_url());
  if (!url) return nullptr;
  const std::string copy(text);
  if (curl_url_set(url.get(), CURLUPART_URL, copy.c_str(), CURLU_NON_SUPPORT_SCHEME) != CURLUE_OK) return nullptr;
  return url;
}

// A part of a parsed URL; empty when the URL has none.
std::optional<std::string> part(CURLU* url, CURLUPart which, unsigned flags = 0) {
  char* value = nullptr;
  if (curl_url_get(url, which, &value, flags) != CURLUE_OK || !value) return std::nullopt;
  std::string result(value);
  curl_free(value);
  return result;
}

std::vector<std::string_view> split(std::string_view text, char separator) {
  std::vector<std::string_view> pieces;
  std::size_t start = 0;
  for (;;) {
    const std::size_t end = text.find(separator, start);
    pieces.push_back(text.substr(start, end == std::string_view::npos ? std::string_view::npos : end - start));
    if (end == std::string_view::npos) return pieces;
    start = end + 1;
  }
}

// Percent-decoding as URL components do it: "+" stays a plus sign.
std::string percentDecode(std::string_view text) {
  int length = 0;
  // libcurl ignores the handle here; a null one is allowed.
  char* decoded = curl_easy_unescape(nullptr, text.data(), static_cast<int>(text.size()), &length);
  if (!decoded) return std::string(text);
  std::string out(decoded, static_cast<std::size_t>(length));
  curl_free(decoded);
  return out;
}

std::string_view itemName(std::string_view item) { return item.substr(0, item.find('=')); }

}  // namespace

bool isLookupResource(std::string_view identifier) {
  return identifier == kTVXLookupHintsWeekly || identifier == kTVXLookupHintsMonthly;
}

bool isValidResourceIdentifier(std::string_view identifier, std::string* why) {
  const char* problem = nullptr;
  if (identifier.empty()) {
    problem = "empty";
  } else if (identifier.size() > 255) {
    problem = "longer than a file name may be";
  } else if (identifier.find('/') != std::string_view::npos) {
    problem = "contains \"/\"";
  } else if (identifier.find('\0') != std::string_view::npos) {
    problem = "contains NUL";
  } else if (identifier.front() == '.') {
    problem = "starts with \".\"";
  }
  if (problem && why) *why = problem;
  return problem == nullptr;
}

std::optional<std::string> urlForCompare(std::string_view text) {
  UrlHandle url = parse(text);
  if (!url) return std::nullopt;
  if (auto query = part(url.get(), CURLUPART_QUERY)) {
    std::string kept;
    for (std::string_view item : split(*query, '&')) {
      if (percentDecode(itemName(item)) == "key") continue;
      if (!kept.empty()) kept.push_back('&');
      kept.append(item);
    }
    // An emptied query is removed, not left as a bare "?".
    if (curl_url_set(url.get(), CURLUPART_QUERY, kept.empty() ? nullptr : kept.c_str(), 0) != CURLUE_OK) {
      return std::nullopt;
    }
  }
  return part(url.get(), CURLUPART_URL);
}

bool differsInPathOrQuery(std::string_view a, std::string_view b) {
  UrlHandle first = parse(a), second = parse(b);
  if (!first || !second) return true;
  return part(first.get(), CURLUPART_PATH) != part(second.get(), CURLUPART_PATH) ||
         part(first.get(), CURLUPART_QUERY) != part(second.get(), CURLUPART_QUERY);
}

std::optional<std::string> queryItemValue(std::string_view text, std::string_view name) {
  UrlHandle url = parse(text);
  if (!url) return std::nullopt;
  auto query = part(url.get(), CURLUPART_QUERY);
  if (!query) return std::nullopt;
  for (std::string_view item : split(*query, '&')) {
    if (percentDecode(itemName(item)) != name) continue;
    const std::size_t equals = item.find('=');
    return equals == std::string_view::npos ? std::string() : percentDecode(item.substr(equals + 1));
  }
  return std::nullopt;
}

std::optional<std::string> urlPath(std::string_view text) {
  UrlHandle url = parse(text);
  if (!url) return std::nullopt;
  return part(url.get(), CURLUPART_PATH, CURLU_URLDECODE);
}

}  // namespace tavix
