// Small ASCII string helpers shared by every layer. Protocol tokens (schemes, hosts, header names,
// client names) are ASCII and compare without regard to locale; text a person typed is lower-cased
// with ICU where it is used, not here.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace tavix::platform {

constexpr char asciiLower(char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; }

inline std::string asciiLowercased(std::string_view s) {
  std::string out(s);
  for (char& c : out) c = asciiLower(c);
  return out;
}

constexpr bool equalsIgnoringASCIICase(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (asciiLower(a[i]) != asciiLower(b[i])) return false;
  }
  return true;
}

// Without leading and trailing blanks (space, tab, CR, LF, vertical tab, form feed).
constexpr std::string_view trimmedWhitespace(std::string_view s) {
  constexpr std::string_view kBlanks = " \t\r\n\v\f";
  const auto begin = s.find_first_not_of(kBlanks);
  if (begin == std::string_view::npos) return {};
  return s.substr(begin, s.find_last_not_of(kBlanks) - begin + 1);
}

enum class HexCase { Lower, Upper };

// The bytes as two hex digits each.
inline std::string hexString(std::string_view bytes, HexCase hexCase = HexCase::Lower) {
  const char* digits = hexCase == HexCase::Lower ? "0123456789abcdef" : "0123456789ABCDEF";
  std::string out;
  out.reserve(bytes.size() * 2);
  for (char ch : bytes) {
    const auto c = static_cast<unsigned char>(ch);
    out += digits[c >> 4];
    out += digits[c & 0xf];
  }
  return out;
}

// The value of one hex digit, or -1.
constexpr int hexDigitValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;
}

}  // namespace tavix::platform
