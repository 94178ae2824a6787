// JSON text to and from PropertyValue, so that JSON documents (the bag, request bodies, topic
// weights) are handled with the same value type as property lists and defaults.
//
// Every JSON document that comes from the network or from a client goes through parseJson, which
// bounds its size and its nesting: a hostile document is a parse error, never a deep recursion
// or an allocation the sender chose.
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

// The most a document may hold: bytes of text, levels of nested arrays and objects, and values
// in all (each value costs far more memory built than its text, "[1,1,...]" two bytes each).
struct JsonLimits {
  std::size_t maxBytes = 16 * 1024 * 1024;
  std::size_t maxDepth = 64;
  std::size_t maxValues = 1024 * 1024;
};

// The value of the JSON text, or empty when it is not well-formed JSON, is null, or passes one of
// `limits`. `error`, when given, receives a short description of what failed.
std::optional<PropertyValue> parseJson(std::string_view text, std::string* error = nullptr, JsonLimits limits = {});

// Whether the text is well-formed JSON within `limits`, without building anything; for code that
// reads the document with another JSON library afterwards.
bool isJsonWithinLimits(std::string_view text, std::string* error = nullptr, JsonLimits limits = {});

// Compact JSON text (no blanks), keys in byte order, non-ASCII characters as UTF-8. Invalid UTF-8
// in strings is replaced by U+FFFD rather than failing.
std::string toJson(const PropertyValue& value);

// Base64 (standard alphabet, padded), as used for Data on writing and for payloads that carry it.
std::string base64Encode(std::string_view bytes);
// Empty for text that is not base64 (whitespace is not allowed; padding is optional).
std::optional<std::string> base64Decode(std::string_view text);

}  // namespace tavix::platform
