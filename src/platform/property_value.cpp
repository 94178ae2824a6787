#include "platform/property_value.h"

#include <charconv>
#include <cmath>
#include <cstdlib>
#include <ctime>
#include <memory>

#include <fmt/core.h>
#include <plist/plist.h>

namespace tavix::platform {

namespace {

// Levels of arrays and dictionaries a property list may nest.
constexpr int kMaxPlistDepth = 64;

// A real as an integer, truncated; past the range of int64 it saturates (the plain conversion is
// undefined there), and NaN or an infinity has no integer reading.
std::optional<std::int64_t> integerOfReal(double r) {
  if (!std::isfinite(r)) return std::nullopt;
  if (r >= 9223372036854775808.0) return INT64_MAX;
  if (r < -9223372036854775808.0) return INT64_MIN;
  return static_cast<std::int64_t>(r);
}

}  // namespace

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
  if (auto r = real()) return integerOfReal(*r);
  if (auto s = string()) {
    std::int64_t v = 0;
    auto [end, ec] = std::from_chars(s->data(), s->data() + s->size(), v);
    if (ec == std::errc() && end == s->data() + s->size()) return v;
    if (auto r = PropertyValue(*s).asReal()) return integerOfReal(*r);
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

// Control characters go as character references, which read back as they were (a raw one would
// make the file malformed, and a raw CR would come back as LF). U+0000 has no XML form at all:
// plistCanHold refuses it before anything is written.
void escape(std::string& out, std::string_view text) {
  for (char c : text) {
    switch (c) {
      case '&': out += "&amp;"; break;
      case '<': out += "&lt;"; break;
      case '>': out += "&gt;"; break;
      case '\t':
      case '\n': out += c; break;
      default:
        if (static_cast<unsigned char>(c) < 0x20) {
          out += fmt::format("&#x{:x};", static_cast<unsigned char>(c));
        } else {
          out += c;
        }
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
  if (!node || depth > kMaxPlistDepth) return std::nullopt;  // deep nesting is hostile, not a preference
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
      // By pointer and length: the copying reader asserts that a string holds no NUL. One that
      // does is refused, as the XML form could not write it back.
      std::uint64_t length = 0;
      const char* s = plist_get_string_ptr(node, &length);
      std::string value = s ? std::string(s, length) : std::string();
      if (value.find('\0') != std::string::npos) return std::nullopt;
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

bool plistCanHold(const PropertyValue& value) {
  constexpr std::string_view kNul("\0", 1);
  switch (value.type()) {
    case PropertyValue::Type::String: return value.string()->find(kNul) == std::string::npos;
    case PropertyValue::Type::Array:
      for (const auto& item : *value.array()) {
        if (!plistCanHold(item)) return false;
      }
      return true;
    case PropertyValue::Type::Dictionary:
      for (const auto& [key, item] : *value.dictionary()) {
        if (key.find(kNul) != std::string::npos || !plistCanHold(item)) return false;
      }
      return true;
    default: return true;
  }
}

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

namespace {

std::uint64_t bigEndian(std::string_view bytes, std::size_t at, std::size_t width) {
  std::uint64_t v = 0;
  for (std::size_t i = 0; i < width; ++i) v = (v << 8) | static_cast<std::uint8_t>(bytes[at + i]);
  return v;
}

// libplist reads nested arrays and dictionaries recursively, and asserts (aborting the process)
// when it hands out a string or key that holds a NUL. A file someone wrote may do either, so the
// bytes are looked at first: deeper than we read, or with a NUL in a string, they are refused.
// What these walks cannot make sense of is left to libplist to refuse.

// A binary property list: the objects of its offset table, as libplist finds them.
class BinaryPlistWalk {
 public:
  explicit BinaryPlistWalk(std::string_view bytes) : bytes_(bytes) {}

  bool refused() {
    constexpr std::size_t kHeader = 8, kTrailer = 32;
    if (bytes_.size() < kHeader + kTrailer) return false;
    const std::size_t trailer = bytes_.size() - kTrailer;
    offsetSize_ = static_cast<std::uint8_t>(bytes_[trailer + 6]);
    refSize_ = static_cast<std::uint8_t>(bytes_[trailer + 7]);
    objects_ = bigEndian(bytes_, trailer + 8, 8);
    const std::uint64_t top = bigEndian(bytes_, trailer + 16, 8);
    table_ = bigEndian(bytes_, trailer + 24, 8);
    if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8 || table_ > trailer ||
        objects_ > (trailer - table_) / offsetSize_) {
      return false;
    }
    for (std::uint64_t i = 0; i < objects_; ++i) {
      if (holdsNul(i)) return true;
    }
    return top < objects_ && tooDeep(top);
  }

 private:
  struct Object {
    unsigned kind = 0;
    std::uint64_t count = 0;
    std::uint64_t start = 0;  // of the payload
  };

  // Offsets and lengths are checked against the whole file, not the object table: whatever
  // libplist may accept is looked at.
  std::optional<Object> object(std::uint64_t index) const {
    const std::size_t end = bytes_.size();
    const std::uint64_t at = bigEndian(bytes_, table_ + index * offsetSize_, offsetSize_);
    if (at >= end) return std::nullopt;
    const auto marker = static_cast<std::uint8_t>(bytes_[at]);
    Object o{static_cast<unsigned>(marker >> 4), static_cast<std::uint64_t>(marker & 0x0F), at + 1};
    const bool sized = o.kind == 0x4 || o.kind == 0x5 || o.kind == 0x6 || o.kind == 0xA || o.kind == 0xC || o.kind == 0xD;
    if (sized && o.count == 0x0F) {  // the count follows as an integer object
      if (o.start >= end) return std::nullopt;
      const auto intMarker = static_cast<std::uint8_t>(bytes_[o.start]);
      const std::size_t width = std::size_t{1} << (intMarker & 0x0F);
      if ((intMarker >> 4) != 0x1 || width > 8 || o.start + 1 + width > end) return std::nullopt;
      o.count = bigEndian(bytes_, o.start + 1, width);
      o.start += 1 + width;
    }
    return o;
  }

  bool holdsNul(std::uint64_t index) const {
    const auto o = object(index);
    if (!o || (o->kind != 0x5 && o->kind != 0x6)) return false;  // ASCII and UTF-16 strings; keys too
    const std::size_t end = bytes_.size();
    const std::uint64_t unit = o->kind == 0x5 ? 1 : 2;
    if (o->start > end || o->count > (end - o->start) / unit) return false;
    for (std::uint64_t c = 0; c < o->count; ++c) {
      const std::size_t at = o->start + unit * c;
      if (bytes_[at] == '\0' && (unit == 1 || bytes_[at + 1] == '\0')) return true;
    }
    return false;
  }

  // The references of an array, set or dictionary (keys and values).
  std::vector<std::uint64_t> children(const Object& o) const {
    std::vector<std::uint64_t> out;
    if (o.kind != 0xA && o.kind != 0xC && o.kind != 0xD) return out;
    const std::uint64_t refs = o.kind == 0xD ? 2 * o.count : o.count;
    const std::size_t end = bytes_.size();
    if (o.count > end || o.start > end || refs > (end - o.start) / refSize_) return out;
    for (std::uint64_t r = 0; r < refs; ++r) out.push_back(bigEndian(bytes_, o.start + r * refSize_, refSize_));
    return out;
  }

  // Depth first, without recursion, each object once: nesting past the limit, or a loop.
  bool tooDeep(std::uint64_t top) const {
    enum : std::uint8_t { kUnseen, kOpen, kDone };
    std::vector<std::uint8_t> state(objects_, kUnseen);
    struct Frame {
      std::vector<std::uint64_t> children;
      std::size_t next = 0;
    };
    std::vector<std::pair<std::uint64_t, Frame>> path;
    auto enter = [&](std::uint64_t index) {
      state[index] = kOpen;
      const auto o = object(index);
      path.push_back({index, Frame{o ? children(*o) : std::vector<std::uint64_t>{}}});
    };
    enter(top);
    while (!path.empty()) {
      if (path.size() > kMaxPlistDepth + 1) return true;
      auto& [index, frame] = path.back();
      if (frame.next == frame.children.size()) {
        state[index] = kDone;
        path.pop_back();
        continue;
      }
      const std::uint64_t child = frame.children[frame.next++];
      if (child >= objects_ || state[child] == kDone) continue;
      if (state[child] == kOpen) return true;
      enter(child);
    }
    return false;
  }

  std::string_view bytes_;
  std::size_t offsetSize_ = 0;
  std::size_t refSize_ = 0;
  std::uint64_t objects_ = 0;
  std::uint64_t table_ = 0;
};

// The XML form: a raw NUL or a character reference to one; arrays and dictionaries nested past the
// limit (counted from the tags, so a tag inside a comment counts too: such files are not ours).
bool xmlPlistRefused(std::string_view text) {
  if (text.find('\0') != std::string_view::npos) return true;
  for (std::size_t at = text.find("&#"); at != std::string_view::npos; at = text.find("&#", at + 2)) {
    std::size_t i = at + 2;
    if (i < text.size() && (text[i] == 'x' || text[i] == 'X')) ++i;
    while (i < text.size() && text[i] == '0') ++i;
    if (i < text.size() && text[i] == ';' && text[i - 1] == '0') return true;
  }
  int depth = 0;
  for (std::size_t at = text.find('<'); at != std::string_view::npos; at = text.find('<', at + 1)) {
    const std::string_view tag = text.substr(at + 1);
    const bool closing = tag.starts_with('/');
    const std::string_view name = tag.substr(closing ? 1 : 0);
    std::size_t length = name.starts_with("array") ? 5 : name.starts_with("dict") ? 4 : 0;
    if (length == 0 || length >= name.size()) continue;
    const char after = name[length];
    if (after != '>' && after != '/' && after != ' ' && after != '\t' && after != '\n' && after != '\r') continue;
    const std::size_t close = name.find('>', length);
    if (close == std::string_view::npos) continue;
    if (closing) {
      --depth;
    } else if (name[close - 1] != '/' && ++depth > kMaxPlistDepth + 1) {
      return true;
    }
  }
  return false;
}

}  // namespace

std::optional<PropertyValue> parsePlist(std::string_view bytes) {
  if (bytes.empty() || bytes.size() > UINT32_MAX) return std::nullopt;
  if (bytes.starts_with("bplist00") ? BinaryPlistWalk(bytes).refused() : xmlPlistRefused(bytes)) return std::nullopt;
  plist_t node = nullptr;
  plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &node);
  PlistPtr root(node);
  return fromNode(node, 0);
}

}  // namespace tavix::platform
