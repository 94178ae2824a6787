// JSON text to and from PropertyValue, so that JSON documents (the bag, request bodies, topic
// weights) are handled with the same value type as property lists and defaults.
//
// Mapping: objects → Dictionary, arrays → Array, strings → String, integers that fit in 64 bits
// → Integer, every other number → Real, booleans → Boolean. JSON has no Date or Data: on writing
// a Date becomes its seconds since 1970 (a number) and Data its base64 text.
// null has no PropertyValue: a null member of an object or an element of an array is left out,
// and a document that is null itself does not parse.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/property_value.h"

namespace tavix::platform {

// The value of the JSON text, or empty when it is not well-formed JSON (or is null). `error`,
// when given, receives a short description of what failed.
std::optional<PropertyValue> parseJson(std::string_view text, std::string* error = nullptr);

// Compact JSON text (no blanks), keys in byte order, non-ASCII characters as UTF-8. Invalid UTF-8
// in strings is replaced by U+FFFD rather than failing.
std::string toJson(const PropertyValue& value);

// Base64 (standard alphabet, padded), as used for Data on writing and for payloads that carry it.
std::string base64Encode(std::string_view bytes);
// Empty for text that is not base64 (whitespace is not allowed; padding is optional).
std::optional<std::string> base64Decode(std::string_view text);

}  // namespace tavix::platform
