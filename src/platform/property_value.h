// A property-list value: the typed values of the defaults store, the counters file and the bag's
// disk copy. Booleans, signed integers, reals, strings, dates, data, arrays and dictionaries.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/time.h"

namespace tavix::platform {

struct Date {
  TimePoint time;
  bool operator==(const Date&) const = default;
};

class PropertyValue {
 public:
  using Data = std::vector<std::uint8_t>;
  using Array = std::vector<PropertyValue>;
  using Dictionary = std::map<std::string, PropertyValue>;
  enum class Type { Boolean, Integer, Real, String, Date, Data, Array, Dictionary };

  PropertyValue() : value_(false) {}
  PropertyValue(bool v) : value_(v) {}
  PropertyValue(int v) : value_(static_cast<std::int64_t>(v)) {}
  PropertyValue(std::int64_t v) : value_(v) {}
  PropertyValue(std::uint32_t v) : value_(static_cast<std::int64_t>(v)) {}
  PropertyValue(double v) : value_(v) {}
  PropertyValue(const char* v) : value_(std::string(v)) {}
  PropertyValue(std::string v) : value_(std::move(v)) {}
  PropertyValue(platform::Date v) : value_(v) {}
  PropertyValue(Data v) : value_(std::move(v)) {}
  PropertyValue(Array v) : value_(std::move(v)) {}
  PropertyValue(Dictionary v) : value_(std::move(v)) {}

  Type type() const { return static_cast<Type>(value_.index()); }

  // The exact alternative, or null when the value holds another type.
  const bool* boolean() const { return std::get_if<bool>(&value_); }
  const std::int64_t* integer() const { return std::get_if<std::int64_t>(&value_); }
  const double* real() const { return std::get_if<double>(&value_); }
  const std::string* string() const { return std::get_if<std::string>(&value_); }
  const platform::Date* date() const { return std::get_if<platform::Date>(&value_); }
  const Data* data() const { return std::get_if<Data>(&value_); }
  const Array* array() const { return std::get_if<Array>(&value_); }
  const Dictionary* dictionary() const { return std::get_if<Dictionary>(&value_); }
  Dictionary* dictionary() { return std::get_if<Dictionary>(&value_); }

  // Lenient readings, as a defaults store answers them: numbers and booleans convert into one
  // another, strings are parsed ("YES"/"true"/"1" are true); anything else is empty.
  std::optional<bool> asBool() const;
  std::optional<std::int64_t> asInteger() const;
  std::optional<double> asReal() const;

  bool operator==(const PropertyValue& other) const { return value_ == other.value_; }

 private:
  std::variant<bool, std::int64_t, double, std::string, platform::Date, Data, Array, Dictionary> value_;
};

using Dictionary = PropertyValue::Dictionary;

// Property-list files. XML is what people edit (defaults); binary is compact (caches).
// Neither form can keep a string or key that holds U+0000 (libplist's strings end there, XML has
// no way to write it): writers of values from outside ask plistCanHold first and refuse, rather
// than store a string cut short.
bool plistCanHold(const PropertyValue& value);
std::string toXmlPlist(const PropertyValue& value);
std::string toBinaryPlist(const PropertyValue& value);
// Reads either form; empty for anything that is not a well-formed property list.
std::optional<PropertyValue> parsePlist(std::string_view bytes);

}  // namespace tavix::platform
