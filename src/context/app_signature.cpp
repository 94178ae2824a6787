#include "context/app_signature.h"

#include <openssl/evp.h>
#include <zlib.h>

#include <algorithm>
#include <cmath>
#include <cstring>

#include "platform/json_value.h"

namespace tavix {

namespace {

// The bitmap's length travels in 16 bits.
constexpr std::size_t kMaxBitmapLength = 0xFFFF;

bool md5(const std::uint8_t* data, std::size_t length, std::uint8_t digest[16]) {
  unsigned size = 0;
  return EVP_Digest(data, length, digest, &size, EVP_md5(), nullptr) == 1 && size == 16;
}

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

void fail(std::string* why, const char* text) {
  if (why) *why = text;
}

// A whitelist's "encoding_id" as a bit index; empty for anything that cannot name a bit.
std::optional<std::uint32_t> encodingId(const platform::PropertyValue& value) {
  double number;
  if (auto* i = value.integer()) {
    number = static_cast<double>(*i);
  } else if (auto* r = value.real()) {
    number = *r;
  } else {
    return std::nullopt;
  }
  if (!(number >= 0) || number != std::floor(number) || number > 4294967295.0) return std::nullopt;
  return static_cast<std::uint32_t>(number);
}

}  // namespace

std::vector<std::uint8_t> makeBitmap(const std::vector<std::uint32_t>& encodingIds) {
  if (encodingIds.empty()) return {};
  const std::uint32_t largest = *std::max_element(encodingIds.begin(), encodingIds.end());
  std::vector<std::uint8_t> bitmap(static_cast<std::size_t>(std::ceil(largest / 8.0)), 0);
  for (std::uint32_t id : encodingIds) {
    const std::size_t byte = id / 8;
    if (byte < bitmap.size()) bitmap[byte] |= static_cast<std::uint8_t>(0x80u >> (id % 8));
  }
  return bitmap;
}

void saveRun(RunWriter& writer, std::uint8_t lengthMinusOne, bool ones) {
  writer.entries.push_back(lengthMinusOne);
  writer.kindByte = static_cast<std::uint8_t>(writer.kindByte | (ones ? 0x80u >> writer.kindBits : 0u));
  if (++writer.kindBits == 8) {
    writer.kinds.push_back(writer.kindByte);
    writer.kindByte = 0;
    writer.kindBits = 0;
  }
}

std::uint8_t getRunLength(std::uint8_t byte) {
  std::uint8_t value = 0;
  for (int bit = 7; bit >= 0; --bit) value = static_cast<std::uint8_t>((value << 1) | ((byte >> bit) & 1));
  return value;
}

int encodeRun(const std::uint8_t* bitmap, std::size_t length, std::uint8_t* out, std::size_t* outLength) {
  RunWriter writer;
  bool open = true;  // the next bit opens a run
  bool kind = false;
  unsigned counter = 0;
  for (std::size_t i = 0; i < length; ++i) {
    for (int shift = 7; shift >= 0; --shift) {
      const bool bit = (bitmap[i] >> shift) & 1;
      if (open) {
        kind = bit;
        counter = 0;
        open = false;
      } else if (bit == kind) {
        ++counter;
      } else {
        saveRun(writer, static_cast<std::uint8_t>(counter), kind);
        kind = bit;
        counter = 0;
      }
      if (counter == 255) {
        saveRun(writer, 255, kind);
        open = true;
      }
    }
  }
  if (!open) saveRun(writer, static_cast<std::uint8_t>(counter), kind);
  if (writer.kindBits > 0) writer.kinds.push_back(writer.kindByte);

  const std::size_t runs = writer.entries.size();
  const std::size_t codeLength = 2 + runs + writer.kinds.size();
  // The same real-number test the server's encoder makes; a zero-length bitmap is sent raw.
  if (runs <= 0xFFFF && static_cast<double>(codeLength) / static_cast<double>(length) < 1.0) {
    out[0] = static_cast<std::uint8_t>(runs >> 8);
    out[1] = static_cast<std::uint8_t>(runs);
    std::memcpy(out + 2, writer.entries.data(), runs);
    std::memcpy(out + 2 + runs, writer.kinds.data(), writer.kinds.size());
    *outLength = codeLength;
    return 1;
  }
  if (length > 0) std::memcpy(out, bitmap, length);
  *outLength = length;
  return 0;
}

int rle_compress(const std::uint8_t* bitmap, std::size_t length, std::uint8_t* out, std::size_t* outLength) {
  std::uint8_t digest[16] = {};
  md5(bitmap, length, digest);
  std::vector<std::uint8_t> payload(length, 0);
  std::size_t payloadLength = 0;
  const int flag = encodeRun(bitmap, length, payload.data(), &payloadLength);
  std::memcpy(out, digest + 12, 4);
  if (payloadLength > 0) std::memcpy(out + 4, payload.data(), payloadLength);
  *outLength = payloadLength + 4;
  return flag;
}

bool rle_expand(const std::uint8_t* code, std::size_t codeLength, std::uint8_t* out, std::size_t length) {
  if (codeLength < 2) return false;
  const std::size_t runs = (static_cast<std::size_t>(code[0]) << 8) | code[1];
  const std::size_t kindBytes = (runs + 7) / 8;
  if (codeLength != 2 + runs + kindBytes) return false;
  const std::uint8_t* entries = code + 2;
  const std::uint8_t* kinds = entries + runs;
  std::memset(out, 0, length);
  const std::size_t totalBits = length * 8;
  std::size_t bit = 0;
  for (std::size_t r = 0; r < runs; ++r) {
    const std::size_t runLength = static_cast<std::size_t>(getRunLength(entries[r])) + 1;
    const bool ones = (kinds[r / 8] >> (7 - r % 8)) & 1;
    if (bit + runLength > totalBits) return false;
    if (ones) {
      for (std::size_t b = bit; b < bit + runLength; ++b) out[b / 8] |= static_cast<std::uint8_t>(0x80u >> (b % 8));
    }
    bit += runLength;
  }
  return bit == totalBits;
}

std::optional<std::string> makeSignature(std::size_t bitmapLength, const std::uint8_t* payloadWithDigest,
                                         std::size_t payloadLength, int flag, std::string_view version) {
  if (version.size() % 2 != 0 || version.size() < 4 || bitmapLength > kMaxBitmapLength) return std::nullopt;
  std::vector<std::uint8_t> versionBytes;
  versionBytes.reserve(version.size() / 2);
  for (std::size_t i = 0; i < version.size(); i += 2) {
    const int high = hexDigit(version[i]), low = hexDigit(version[i + 1]);
    if (high < 0 || low < 0) return std::nullopt;
    versionBytes.push_back(static_cast<std::uint8_t>(high << 4 | low));
  }
  std::string bytes(4, '\0');
  bytes.reserve(8 + payloadLength);
  const std::uint8_t secondToLast = versionBytes[versionBytes.size() - 2];
  bytes.push_back(static_cast<char>((secondToLast & 0x7F) | (flag ? 0x80 : 0)));
  bytes.push_back(static_cast<char>(versionBytes.back()));
  bytes.push_back(static_cast<char>(bitmapLength >> 8));
  bytes.push_back(static_cast<char>(bitmapLength));
  bytes.append(reinterpret_cast<const char*>(payloadWithDigest), payloadLength);
  const uLong crc = crc32(0L, reinterpret_cast<const Bytef*>(bytes.data() + 4), static_cast<uInt>(bytes.size() - 4));
  for (int i = 0; i < 4; ++i) bytes[i] = static_cast<char>(crc >> (24 - 8 * i));
  return platform::base64Encode(bytes);
}

std::optional<std::string> processWhitelist(std::string_view whitelist, const std::vector<InstalledApp>& installed,
                                            std::string* why) {
  std::string error;
  auto outer = platform::parseJson(whitelist, &error);
  const platform::Dictionary* outerObject = outer ? outer->dictionary() : nullptr;
  if (!outerObject) {
    if (why) *why = "whitelist is not a JSON object" + (error.empty() ? std::string() : ": " + error);
    return std::nullopt;
  }
  auto text = [&](const char* key) -> const std::string* {
    auto it = outerObject->find(key);
    return it == outerObject->end() ? nullptr : it->second.string();
  };
  const std::string* appsText = text("apps");
  const std::string* compression = text("compression");
  const std::string* encoding = text("encoding");
  if (!appsText || !compression || *compression != "RLE" || !encoding || *encoding != "bitmap") {
    fail(why, "whitelist lacks \"apps\" text, \"compression\" \"RLE\" or \"encoding\" \"bitmap\"");
    return std::nullopt;
  }

  auto inner = platform::parseJson(*appsText, &error);
  const platform::Dictionary* innerObject = inner ? inner->dictionary() : nullptr;
  const std::string* version = nullptr;
  const platform::Dictionary* apps = nullptr;
  if (innerObject) {
    if (auto it = innerObject->find("version"); it != innerObject->end()) version = it->second.string();
    if (auto it = innerObject->find("apps"); it != innerObject->end()) apps = it->second.dictionary();
  }
  if (!version || !apps) {
    fail(why, "whitelist's inner document lacks a \"version\" text or an \"apps\" object");
    return std::nullopt;
  }

  std::vector<std::uint32_t> ids;
  for (const InstalledApp& app : installed) {
    if (app.bundleIdentifier.empty() || app.bundleVersion.empty()) continue;
    auto it = apps->find(app.bundleIdentifier);
    if (it == apps->end()) continue;
    const platform::PropertyValue::Array* entries = it->second.array();
    if (!entries || entries->empty()) continue;
    const platform::Dictionary* last = entries->back().dictionary();
    if (!last) continue;
    auto idValue = last->find("encoding_id");
    if (idValue == last->end()) continue;
    if (auto id = encodingId(idValue->second)) ids.push_back(*id);
  }
  if (ids.empty()) {
    fail(why, "no installed app is on the whitelist");
    return std::nullopt;
  }
  std::sort(ids.begin(), ids.end());
  // Checked before the bitmap is allocated: a hostile id must not choose the allocation.
  if (std::ceil(ids.back() / 8.0) > static_cast<double>(kMaxBitmapLength)) {
    fail(why, "whitelist encoding id too large for the bitmap");
    return std::nullopt;
  }

  const std::vector<std::uint8_t> bitmap = makeBitmap(ids);
  std::vector<std::uint8_t> compressed(bitmap.size() + 4);
  std::size_t compressedLength = 0;
  const int flag = rle_compress(bitmap.data(), bitmap.size(), compressed.data(), &compressedLength);
  auto signature = makeSignature(bitmap.size(), compressed.data(), compressedLength, flag, *version);
  if (!signature) fail(why, "whitelist version is not an even count (at least 4) of hexadecimal digits");
  return signature;
}

}  // namespace tavix
