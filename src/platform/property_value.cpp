#include "platform/property_value.h"

#include <charconv>
#include <cmath>
#include <cstdlib>
#include <ctime>
#include <memory>

#include <fmt/core.h>
#include <plist/plist.h>

namespace tavix::platform {

std::optional<bool> PropertyValue::asBool() const {
  if (auto b = boolean()) return *b;
  if (auto i = integer()) return *i != 0;
  if (auto r = real()) return *r != 0.0;
  if (auto s = string()) {
    if (*s == "YES" || *s == "yes" || *s == "true" || *s == "TRUE" || *s == "1") return true;
    if (*s == "NO" || *s == "no" || *s == "false" || *s == "FALSE" || *s == "0") return false;
    if (auto i = PropertyValue(*s).asInteger()) return *i != 0;
  }
  return std::nullopt;
}

std::optional<std::int64_t> PropertyValue::asInteger() const {
  if (auto i = integer()) return *i;
  if (auto b = boolean()) return *b ? 1 : 0;
  if (auto r = real()) {
    if (!std::isfinite(*r)) return std::nullopt;
    return static_cast<std::int64_t>(*r);
  }
  if (auto s = string()) {
    std::int64_t v = 0;
    auto [end, ec] = std::from_chars(s->data(), s->data() + s->size(), v);
    if (ec == std::errc() && end == s->data() + s->size()) return v;
    if (auto r = PropertyValue(*s).asReal()) return static_cast<std::int64_t>(*r);
  }
  return std::nullopt;
}

std::optional<double> PropertyValue::asReal() const {
  if (auto r = real()) return *r;
  if (auto i = integer()) return static_cast<double>(*i);
  if (auto b = boolean()) return *b ? 1.0 : 0.0;
  if (auto s = string()) {
    if (s->empty()) return std::nullopt;
    char* end = nullptr;
    double v = std::strtod(s->c_str(), &end);
    if (end == s->c_str() + s->size()) return v;
  }
  return std::nullopt;
}

namespace {

// Property-list dates count from 2001-01-01 00:00:00 UTC.
constexpr double kPlistEpoch = 978307200.0;

const char kBase64[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

std::string base64(const PropertyValue::Data& data) {
  std::string out;
  out.reserve((data.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < data.size(); i += 3) {
    std::uint32_t n = data[i] << 16;
    if (i + 1 < data.size()) n |= data[i + 1] << 8;
    if (i + 2 < data.size()) n |= data[i + 2];
    out += kBase64[(n >> 18) & 63];
    out += kBase64[(n >> 12) & 63];
    out += i + 1 < data.size() ? kBase64[(n >> 6) & 63] : '=';
    out += i + 2 < data.size() ? kBase64[n & 63] : '=';
  }
  return out;
}

void escape(std::string& out, std::string_view text) {
  for (char c : text) {
    switch (c) {
      case '&': out += "&amp;"; break;
      case '<': out += "&lt;"; break;
      case '>': out += "&gt;"; break;
      default: out += c;
    }
  }
}

std::string isoDate(TimePoint t) {
  std::time_t secs = static_cast<std::time_t>(std::floor(toUnixSeconds(t)));
  std::tm tm{};
  gmtime_r(&secs, &tm);
  char buffer[32];
  std::strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%SZ", &tm);
  return buffer;
}

// Our own XML writer: libplist of this vintage cannot write negative integers in XML.
void writeXml(std::string& out, const PropertyValue& v, int depth) {
  const std::string indent(static_cast<std::size_t>(depth), '\t');
  out += indent;
  switch (v.type()) {
    case PropertyValue::Type::Boolean: out += *v.boolean() ? "<true/>" : "<false/>"; break;
    case PropertyValue::Type::Integer: out += fmt::format("<integer>{}</integer>", *v.integer()); break;
    case PropertyValue::Type::Real: out += fmt::format("<real>{}</real>", *v.real()); break;
    case PropertyValue::Type::String:
      out += "<string>";
      escape(out, *v.string());
      out += "</string>";
      break;
    case PropertyValue::Type::Date: out += "<date>" + isoDate(v.date()->time) + "</date>"; break;
    case PropertyValue::Type::Data: out += "<data>" + base64(*v.data()) + "</data>"; break;
    case PropertyValue::Type::Array:
      if (v.array()->empty()) {
        out += "<array/>";
        break;
      }
      out += "<array>\n";
      for (const auto& item : *v.array()) writeXml(out, item, depth + 1);
      out += indent + "</array>";
      break;
    case PropertyValue::Type::Dictionary:
      if (v.dictionary()->empty()) {
        out += "<dict/>";
        break;
      }
      out += "<dict>\n";
      for (const auto& [key, item] : *v.dictionary()) {
        out += indent + "\t<key>";
        escape(out, key);
        out += "</key>\n";
        writeXml(out, item, depth + 1);
      }
      out += indent + "</dict>";
      break;
  }
  out += "\n";
}

struct PlistDeleter {
  void operator()(void* p) const { plist_free(static_cast<plist_t>(p)); }
};
using PlistPtr = std::unique_ptr<void, PlistDeleter>;

plist_t toNode(const PropertyValue& v) {
  switch (v.type()) {
    case PropertyValue::Type::Boolean: return plist_new_bool(*v.boolean() ? 1 : 0);
    case PropertyValue::Type::Integer: return plist_new_uint(static_cast<std::uint64_t>(*v.integer()));
    case PropertyValue::Type::Real: return plist_new_real(*v.real());
    case PropertyValue::Type::String: return plist_new_string(v.string()->c_str());
    case PropertyValue::Type::Date: {
      double since = toUnixSeconds(v.date()->time) - kPlistEpoch;
      double whole = std::floor(since);
      return plist_new_date(static_cast<int32_t>(whole), static_cast<int32_t>((since - whole) * 1e6));
    }
    case PropertyValue::Type::Data:
      return plist_new_data(reinterpret_cast<const char*>(v.data()->data()), v.data()->size());
    case PropertyValue::Type::Array: {
      plist_t node = plist_new_array();
      for (const auto& item : *v.array()) plist_array_append_item(node, toNode(item));
      return node;
    }
    case PropertyValue::Type::Dictionary: {
      plist_t node = plist_new_dict();
      for (const auto& [key, item] : *v.dictionary()) plist_dict_set_item(node, key.c_str(), toNode(item));
      return node;
    }
  }
  return plist_new_bool(0);
}

std::optional<PropertyValue> fromNode(plist_t node, int depth) {
  if (!node || depth > 64) return std::nullopt;  // deep nesting is hostile, not a preference
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      return PropertyValue(b != 0);
    }
    case PLIST_UINT: {
      // libplist keeps integers as 64 raw bits; negative ones read back through the cast.
      uint64_t u = 0;
      plist_get_uint_val(node, &u);
      return PropertyValue(static_cast<std::int64_t>(u));
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      return PropertyValue(d);
    }
    case PLIST_STRING: {
      char* s = nullptr;
      plist_get_string_val(node, &s);
      std::string value = s ? s : "";
      std::free(s);
      return PropertyValue(std::move(value));
    }
    case PLIST_DATE: {
      int32_t sec = 0, usec = 0;
      plist_get_date_val(node, &sec, &usec);
      return PropertyValue(Date{fromUnixSeconds(kPlistEpoch + sec + usec / 1e6)});
    }
    case PLIST_DATA: {
      char* d = nullptr;
      uint64_t length = 0;
      plist_get_data_val(node, &d, &length);
      PropertyValue::Data bytes(d, d + length);
      std::free(d);
      return PropertyValue(std::move(bytes));
    }
    case PLIST_ARRAY: {
      PropertyValue::Array items;
      uint32_t n = plist_array_get_size(node);
      for (uint32_t i = 0; i < n; ++i) {
        auto item = fromNode(plist_array_get_item(node, i), depth + 1);
        if (!item) return std::nullopt;
        items.push_back(std::move(*item));
      }
      return PropertyValue(std::move(items));
    }
    case PLIST_DICT: {
      PropertyValue::Dictionary dict;
      plist_dict_iter it = nullptr;
      plist_dict_new_iter(node, &it);
      for (;;) {
        char* key = nullptr;
        plist_t item = nullptr;
        plist_dict_next_item(node, it, &key, &item);
        if (!item) {
          std::free(key);
          break;
        }
        auto value = fromNode(item, depth + 1);
        std::string k = key ? key : "";
        std::free(key);
        if (!value) {
          std::free(it);
          return std::nullopt;
        }
        dict.insert_or_assign(std::move(k), std::move(*value));
      }
      std::free(it);
      return PropertyValue(std::move(dict));
    }
    default: return std::nullopt;  // keys and UIDs never stand alone in our files
  }
}

}  // namespace

std::string toXmlPlist(const PropertyValue& value) {
  std::string out =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" \"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
      "<plist version=\"1.0\">\n";
  writeXml(out, value, 0);
  out += "</plist>\n";
  return out;
}

std::string toBinaryPlist(const PropertyValue& value) {
  PlistPtr root(toNode(value));
  char* bytes = nullptr;
  uint32_t length = 0;
  plist_to_bin(static_cast<plist_t>(root.get()), &bytes, &length);
  std::string out(bytes ? bytes : "", length);
  plist_to_bin_free(bytes);
  return out;
}

std::optional<PropertyValue> parsePlist(std::string_view bytes) {
  if (bytes.empty() || bytes.size() > UINT32_MAX) return std::nullopt;
  plist_t node = nullptr;
  plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &node);
  PlistPtr root(node);
  return fromNode(node, 0);
}

}  // namespace tavix::platform
