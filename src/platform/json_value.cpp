#include "platform/json_value.h"

#include <nlohmann/json.hpp>

namespace tavix::platform {

namespace {

using nlohmann::json;

// Walks the parsed document; false for null, which the caller drops.
bool fromJson(const json& j, PropertyValue* out) {
  switch (j.type()) {
    case json::value_t::null:
    case json::value_t::discarded:
      return false;
    case json::value_t::boolean:
      *out = j.get<bool>();
      return true;
    case json::value_t::number_integer:
      *out = j.get<std::int64_t>();
      return true;
    case json::value_t::number_unsigned: {
      auto u = j.get<std::uint64_t>();
      if (u <= static_cast<std::uint64_t>(INT64_MAX)) {
        *out = static_cast<std::int64_t>(u);
      } else {
        *out = static_cast<double>(u);
      }
      return true;
    }
    case json::value_t::number_float:
      *out = j.get<double>();
      return true;
    case json::value_t::string:
      *out = j.get<std::string>();
      return true;
    case json::value_t::array: {
      PropertyValue::Array array;
      array.reserve(j.size());
      for (const auto& element : j) {
        PropertyValue v;
        if (fromJson(element, &v)) array.push_back(std::move(v));
      }
      *out = std::move(array);
      return true;
    }
    case json::value_t::object: {
      Dictionary dict;
      for (auto it = j.begin(); it != j.end(); ++it) {
        PropertyValue v;
        if (fromJson(it.value(), &v)) dict.emplace(it.key(), std::move(v));
      }
      *out = std::move(dict);
      return true;
    }
    case json::value_t::binary:
      return false;
  }
  return false;
}

json toJsonValue(const PropertyValue& value) {
  switch (value.type()) {
    case PropertyValue::Type::Boolean:
      return *value.boolean();
    case PropertyValue::Type::Integer:
      return *value.integer();
    case PropertyValue::Type::Real:
      return *value.real();
    case PropertyValue::Type::String:
      return *value.string();
    case PropertyValue::Type::Date:
      return toUnixSeconds(value.date()->time);
    case PropertyValue::Type::Data: {
      const auto& d = *value.data();
      return base64Encode(std::string_view(reinterpret_cast<const char*>(d.data()), d.size()));
    }
    case PropertyValue::Type::Array: {
      json array = json::array();
      for (const auto& element : *value.array()) array.push_back(toJsonValue(element));
      return array;
    }
    case PropertyValue::Type::Dictionary: {
      json object = json::object();
      for (const auto& [key, element] : *value.dictionary()) object[key] = toJsonValue(element);
      return object;
    }
  }
  return nullptr;
}

constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

}  // namespace

std::optional<PropertyValue> parseJson(std::string_view text, std::string* error) {
  json j = json::parse(text.begin(), text.end(), nullptr, /*allow_exceptions=*/false);
  if (j.is_discarded()) {
    if (error) *error = "not well-formed JSON";
    return std::nullopt;
  }
  PropertyValue value;
  if (!fromJson(j, &value)) {
    if (error) *error = "the document is null";
    return std::nullopt;
  }
  return value;
}

std::string toJson(const PropertyValue& value) {
  return toJsonValue(value).dump(-1, ' ', false, json::error_handler_t::replace);
}

std::string base64Encode(std::string_view bytes) {
  std::string out;
  out.reserve((bytes.size() + 2) / 3 * 4);
  std::size_t i = 0;
  for (; i + 2 < bytes.size(); i += 3) {
    std::uint32_t n = (std::uint8_t(bytes[i]) << 16) | (std::uint8_t(bytes[i + 1]) << 8) | std::uint8_t(bytes[i + 2]);
    out += kAlphabet[(n >> 18) & 63];
    out += kAlphabet[(n >> 12) & 63];
    out += kAlphabet[(n >> 6) & 63];
    out += kAlphabet[n & 63];
  }
  std::size_t rest = bytes.size() - i;
  if (rest > 0) {
    std::uint32_t n = std::uint8_t(bytes[i]) << 16;
    if (rest == 2) n |= std::uint8_t(bytes[i + 1]) << 8;
    out += kAlphabet[(n >> 18) & 63];
    out += kAlphabet[(n >> 12) & 63];
    out += rest == 2 ? kAlphabet[(n >> 6) & 63] : '=';
    out += '=';
  }
  return out;
}

std::optional<std::string> base64Decode(std::string_view text) {
  while (!text.empty() && text.back() == '=') text.remove_suffix(1);
  if (text.size() % 4 == 1) return std::nullopt;
  std::string out;
  out.reserve(text.size() * 3 / 4);
  std::uint32_t buffer = 0;
  int bits = 0;
  for (char c : text) {
    int v;
    if (c >= 'A' && c <= 'Z') v = c - 'A';
    else if (c >= 'a' && c <= 'z') v = c - 'a' + 26;
    else if (c >= '0' && c <= '9') v = c - '0' + 52;
    else if (c == '+') v = 62;
    else if (c == '/') v = 63;
    else return std::nullopt;
    buffer = (buffer << 6) | static_cast<std::uint32_t>(v);
    bits += 6;
    if (bits >= 8) {
      bits -= 8;
      out += static_cast<char>((buffer >> bits) & 0xFF);
    }
  }
  return out;
}

}  // namespace tavix::platform
