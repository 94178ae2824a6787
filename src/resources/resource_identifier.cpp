#include "resources/resource_identifier.h"

#include "platform/http/url.h"

namespace tavix {

using platform::http::URL;

namespace {

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
  auto url = URL::parse(text);
  if (!url) return std::nullopt;
  if (const auto query = url->query()) {
    std::string kept;
    std::string_view rest = *query;
    while (true) {
      const auto amp = rest.find('&');
      const std::string_view item = rest.substr(0, amp);
      if (platform::http::percentDecode(itemName(item)) != "key") {
        if (!kept.empty()) kept.push_back('&');
        kept.append(item);
      }
      if (amp == std::string_view::npos) break;
      rest = rest.substr(amp + 1);
    }
    // An emptied query is removed, not left as a bare "?".
    url->setQuery(kept.empty() ? std::nullopt : std::optional<std::string_view>(kept));
  }
  return url->string();
}

bool differsInPathOrQuery(std::string_view a, std::string_view b) {
  const auto first = URL::parse(a), second = URL::parse(b);
  if (!first || !second) return true;
  return first->path() != second->path() || first->query() != second->query();
}

std::optional<std::string> queryItemValue(std::string_view text, std::string_view name) {
  const auto url = URL::parse(text);
  const auto query = url ? url->query() : std::nullopt;
  if (!query) return std::nullopt;
  for (auto& [itemName, value] : platform::http::decodedQueryItems(*query)) {
    if (itemName == name) return value.value_or("");
  }
  return std::nullopt;
}

std::optional<std::string> urlPath(std::string_view text) {
  const auto url = URL::parse(text);
  if (!url) return std::nullopt;
  return platform::http::percentDecode(url->path());
}

}  // namespace tavix
