#include "platform/json_value.h"

#include <nlohmann/json.hpp>

namespace tavix::platform {

namespace {

using nlohmann::json;

// Builds the value straight from the parser's events (no intermediate tree, no recursion) and
// stops at the first event that passes a limit. With `build` false it only checks.
class LimitedBuilder {
 public:
  LimitedBuilder(const JsonLimits& limits, bool build) : limits_(limits), build_(build) {}

  bool null() { return counted() && place(std::nullopt); }
  bool boolean(bool v) { return counted() && place(PropertyValue(v)); }
  bool number_integer(json::number_integer_t v) { return counted() && place(PropertyValue(std::int64_t{v})); }
  bool number_unsigned(json::number_unsigned_t v) {
    if (!counted()) return false;
    // Beyond int64: kept as a real rather than wrapped around.
    if (v <= static_cast<std::uint64_t>(INT64_MAX)) return place(PropertyValue(static_cast<std::int64_t>(v)));
    return place(PropertyValue(static_cast<double>(v)));
  }
  bool number_float(json::number_float_t v, const std::string&) { return counted() && place(PropertyValue(v)); }
  bool string(std::string& v) { return counted() && place(PropertyValue(std::move(v))); }
  bool binary(json::binary_t&) { return fail("binary values are not JSON"); }
  bool key(std::string& k) {
    if (build_) stack_.back().key = std::move(k);
    return true;
  }
  bool start_object(std::size_t) { return open(true); }
  bool start_array(std::size_t) { return open(false); }
  bool end_object() { return close(); }
  bool end_array() { return close(); }
  bool parse_error(std::size_t position, const std::string&, const nlohmann::detail::exception&) {
    if (error_.empty()) error_ = "not well-formed JSON (at byte " + std::to_string(position) + ")";
    return false;
  }

  const std::string& error() const { return error_; }
  std::optional<PropertyValue>& root() { return root_; }

 private:
  struct Frame {
    bool object = false;
    PropertyValue::Array array;
    Dictionary dictionary;
    std::string key;
  };

  bool fail(std::string why) {
    error_ = std::move(why);
    return false;
  }
  bool counted() {
    if (++values_ <= limits_.maxValues) return true;
    return fail("more than " + std::to_string(limits_.maxValues) + " values");
  }
  bool open(bool object) {
    if (!counted()) return false;
    if (depth_ >= limits_.maxDepth) return fail("nested deeper than " + std::to_string(limits_.maxDepth) + " levels");
    ++depth_;
    if (build_) stack_.push_back(Frame{object, {}, {}, {}});
    return true;
  }
  bool close() {
    --depth_;
    if (!build_) return true;
    Frame done = std::move(stack_.back());
    stack_.pop_back();
    return place(done.object ? PropertyValue(std::move(done.dictionary)) : PropertyValue(std::move(done.array)));
  }
  // A null member or element is left out; a null document stays empty.
  bool place(std::optional<PropertyValue> v) {
    if (!build_ || !v) return true;
    if (stack_.empty()) {
      root_ = std::move(v);
    } else if (Frame& top = stack_.back(); top.object) {
      top.dictionary.insert_or_assign(std::move(top.key), std::move(*v));
    } else {
      top.array.push_back(std::move(*v));
    }
    return true;
  }

  const JsonLimits& limits_;
  const bool build_;
  std::size_t depth_ = 0;
  std::size_t values_ = 0;
  std::vector<Frame> stack_;
  std::optional<PropertyValue> root_;
  std::string error_;
};

bool runLimited(std::string_view text, LimitedBuilder& builder, const JsonLimits& limits, std::string* error) {
  if (text.size() > limits.maxBytes) {
    if (error) *error = "larger than " + std::to_string(limits.maxBytes) + " bytes";
    return false;
  }
  if (!json::sax_parse(text.begin(), text.end(), &builder)) {
    if (error) *error = builder.error().empty() ? "not well-formed JSON" : builder.error();
    return false;
  }
  return true;
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

std::optional<PropertyValue> parseJson(std::string_view text, std::string* error, JsonLimits limits) {
  LimitedBuilder builder(limits, true);
  if (!runLimited(text, builder, limits, error)) return std::nullopt;
  if (!builder.root()) {
    if (error) *error = "the document is null";
    return std::nullopt;
  }
  return std::move(builder.root());
}

bool isJsonWithinLimits(std::string_view text, std::string* error, JsonLimits limits) {
  LimitedBuilder checker(limits, false);
  return runLimited(text, checker, limits, error);
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
