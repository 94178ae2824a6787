// Feeds arbitrary bytes to the installed-app whitelist parser, both as the whole resource and as
// its inner document (so that the fuzzer need not learn JSON string escaping to reach the apps),
// and checks every signature it makes: the CRC holds, the length field matches, and a run-length
// payload expands back to a bitmap whose digest tail is the one sent. The bytes are also run
// through the run-length code as a bitmap, which must round-trip.
//
// Run: UBSAN_OPTIONS=halt_on_error=1 <build>/bin/whitelist_fuzzer -runs=1000000 -dict=fuzz/json.dict [corpus-dir]
#include <openssl/evp.h>
#include <zlib.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "context/app_signature.h"
#include "platform/json_value.h"

namespace {

const std::vector<tavix::InstalledApp>& installed() {
  static const std::vector<tavix::InstalledApp> apps = [] {
    std::vector<tavix::InstalledApp> list;
    for (char c = 'a'; c <= 'z'; ++c) list.push_back({std::string(1, c), "1"});
    list.push_back({"com.example.app", "2.0"});
    list.push_back({"no.version", ""});
    return list;
  }();
  return apps;
}

void check(bool ok) {
  if (!ok) std::abort();
}

void checkSignature(const std::string& signature) {
  auto decoded = tavix::platform::base64Decode(signature);
  check(decoded.has_value() && decoded->size() >= 12);
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(decoded->data());
  const std::size_t size = decoded->size();
  const uLong crc = crc32(0L, bytes + 4, static_cast<uInt>(size - 4));
  check((uLong(bytes[0]) << 24 | uLong(bytes[1]) << 16 | uLong(bytes[2]) << 8 | bytes[3]) == crc);
  const std::size_t length = std::size_t(bytes[6]) << 8 | bytes[7];
  std::vector<std::uint8_t> bitmap(length);
  if (bytes[4] & 0x80) {
    check(size - 12 < length);
    check(tavix::rle_expand(bytes + 12, size - 12, bitmap.data(), length));
  } else {
    check(size - 12 == length);
    if (length) std::memcpy(bitmap.data(), bytes + 12, length);
  }
  unsigned char digest[16];
  unsigned digestSize = 0;
  check(EVP_Digest(bitmap.data(), length, digest, &digestSize, EVP_md5(), nullptr) == 1);
  check(std::memcmp(digest + 12, bytes + 8, 4) == 0);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string text(reinterpret_cast<const char*>(data), size);
  if (auto signature = tavix::processWhitelist(text, installed())) checkSignature(*signature);

  const std::string wrapped = tavix::platform::toJson(tavix::platform::Dictionary{
      {"apps", text}, {"compression", "RLE"}, {"encoding", "bitmap"}});
  if (auto signature = tavix::processWhitelist(wrapped, installed())) checkSignature(*signature);

  std::vector<std::uint8_t> code(size);
  std::size_t codeLength = 0;
  if (tavix::encodeRun(data, size, code.data(), &codeLength) == 1) {
    std::vector<std::uint8_t> expanded(size);
    check(tavix::rle_expand(code.data(), codeLength, expanded.data(), size));
    check(std::memcmp(expanded.data(), data, size) == 0);
  }
  return 0;
}
