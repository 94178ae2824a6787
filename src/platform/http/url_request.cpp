#include "platform/http/url_request.h"
#include "platform/strings.h"

#include <algorithm>
#include <cctype>

namespace tavix::platform::http {

bool isValidHeaderValue(std::string_view value) {
  return std::none_of(value.begin(), value.end(), [](char c) {
    const auto u = static_cast<unsigned char>(c);
    return (u < 0x20 && u != '\t') || u == 0x7f;
  });
}

bool isValidHeaderName(std::string_view name) {
  static constexpr std::string_view kTokenPunctuation = "!#$%&'*+-.^_`|~";
  return !name.empty() && std::all_of(name.begin(), name.end(), [](char c) {
    return std::isalnum(static_cast<unsigned char>(c)) || kTokenPunctuation.find(c) != std::string_view::npos;
  });
}

std::string HeaderFields::description() const {
  std::string out = "{";
  for (const auto& [name, value] : fields_) {
    if (out.size() > 1) out += ", ";
    out += name + ": " + value;
  }
  return out + "}";
}

void HeaderFields::set(std::string_view name, std::string value) {
  remove(name);
  fields_.emplace_back(std::string(name), std::move(value));
}

void HeaderFields::add(std::string name, std::string value) { fields_.emplace_back(std::move(name), std::move(value)); }

void HeaderFields::remove(std::string_view name) {
  fields_.erase(std::remove_if(fields_.begin(), fields_.end(),
                               [&](const auto& f) { return equalsIgnoringASCIICase(f.first, name); }),
                fields_.end());
}

std::optional<std::string> HeaderFields::get(std::string_view name) const {
  for (const auto& [n, v] : fields_) {
    if (equalsIgnoringASCIICase(n, name)) return v;
  }
  return std::nullopt;
}

}  // namespace tavix::platform::http
