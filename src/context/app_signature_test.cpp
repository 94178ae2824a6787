#include "context/app_signature.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <zlib.h>


#include "platform/json_value.h"

namespace tavix {
namespace {

using Bytes = std::vector<std::uint8_t>;

struct Encoded {
  int flag;
  Bytes payload;
};

Encoded encode(const Bytes& bitmap) {
  Bytes out(bitmap.size());
  std::size_t length = 0;
  int flag = encodeRun(bitmap.data(), bitmap.size(), out.data(), &length);
  out.resize(length);
  return {flag, out};
}

// A whitelist resource as the server publishes it: the inner document travels as JSON text.
std::string whitelist(const std::string& version, const std::string& appsJson) {
  platform::PropertyValue inner = platform::parseJson(R"({"version":")" + version + R"(","apps":)" + appsJson + "}").value();
  return platform::toJson(platform::Dictionary{
      {"apps", platform::toJson(inner)}, {"compression", "RLE"}, {"encoding", "bitmap"}});
}

// The signature's bytes, with its self-consistency (CRC, length field, digest tail) checked.
Bytes decodeSignature(const std::string& base64) {
  auto text = platform::base64Decode(base64);
  EXPECT_TRUE(text.has_value());
  Bytes bytes(text->begin(), text->end());
  EXPECT_GE(bytes.size(), 12u);
  const uLong crc = crc32(0L, bytes.data() + 4, static_cast<uInt>(bytes.size() - 4));
  EXPECT_EQ((uLong(bytes[0]) << 24 | uLong(bytes[1]) << 16 | uLong(bytes[2]) << 8 | bytes[3]), crc);
  return bytes;
}

TEST(AppSignature, SparseIdsAreSentRawWithFlagZero) {
  const Bytes bitmap = makeBitmap({1, 3});
  ASSERT_EQ(bitmap, Bytes{0x50});
  // Runs 0(1) 1(1) 0(1) 1(1) 0(4): 2 + 5 + 1 = 8 bytes of code against 1 of bitmap.
  EXPECT_EQ(encode(bitmap).flag, 0);
  EXPECT_EQ(encode(bitmap).payload, bitmap);

  auto signature = processWhitelist(whitelist("0aff1b", R"({"a.one":[{"encoding_id":1}],"a.three":[{"encoding_id":3}]})"),
                                    {{"a.one", "1"}, {"a.three", "2.0"}, {"not.listed", "1"}});
  ASSERT_TRUE(signature);
  const Bytes bytes = decodeSignature(*signature);
  ASSERT_EQ(bytes.size(), 13u);
  // Version 0xff1b with its top bit replaced by the raw flag, then the bitmap's length.
  EXPECT_EQ(Bytes(bytes.begin() + 4, bytes.begin() + 8), (Bytes{0x7f, 0x1b, 0x00, 0x01}));
  unsigned char digest[16];
  unsigned size = 0;
  ASSERT_EQ(EVP_Digest(bitmap.data(), 1, digest, &size, EVP_md5(), nullptr), 1);
  EXPECT_EQ(Bytes(bytes.begin() + 8, bytes.begin() + 12), Bytes(digest + 12, digest + 16));
  EXPECT_EQ(bytes[12], 0x50);
}

TEST(AppSignature, LongZeroRunsSplitAt256Bits) {
  Bytes bitmap(65, 0);
  bitmap.back() = 0x01;
  const Encoded code = encode(bitmap);
  EXPECT_EQ(code.flag, 1);
  // R = 4; 519 zero-bits as 256 + 256 + 7, then one one-bit; kinds 0,0,0,1.
  EXPECT_EQ(code.payload, (Bytes{0x00, 0x04, 255, 255, 6, 0, 0x10}));

  Bytes out(bitmap.size());
  std::size_t length = 0;
  ASSERT_EQ(rle_compress(bitmap.data(), bitmap.size(), out.data(), &length), 1);
  ASSERT_EQ(length, 4 + code.payload.size());
  auto signature = makeSignature(bitmap.size(), out.data(), length, 1, "00c1");
  ASSERT_TRUE(signature);
  const Bytes bytes = decodeSignature(*signature);
  // Flag 1 in the top bit of version byte 0x00, then the bitmap's length, 65.
  EXPECT_EQ(Bytes(bytes.begin() + 4, bytes.begin() + 8), (Bytes{0x80, 0xc1, 0x00, 65}));
  EXPECT_EQ(Bytes(bytes.begin() + 12, bytes.end()), code.payload);
}

TEST(AppSignature, BitmapSizingLeavesOutALargestIdOnAByteBoundary) {
  EXPECT_EQ(makeBitmap({8}), Bytes{0x00});
  EXPECT_EQ(makeBitmap({9, 16}), (Bytes{0x00, 0x40}));
  EXPECT_EQ(makeBitmap({17}), (Bytes{0x00, 0x00, 0x40}));
}

TEST(AppSignature, UnusableVersionsGiveNoSignature) {
  const std::uint8_t payload[5] = {1, 2, 3, 4, 0x50};
  EXPECT_FALSE(makeSignature(1, payload, 5, 0, "abc"));
  EXPECT_FALSE(makeSignature(1, payload, 5, 0, "zz00"));
  EXPECT_TRUE(makeSignature(1, payload, 5, 0, "AB00"));
  const std::string apps = R"({"a":[{"encoding_id":3}]})";
  EXPECT_FALSE(processWhitelist(whitelist("12345", apps), {{"a", "1"}}));
  EXPECT_TRUE(processWhitelist(whitelist("1234", apps), {{"a", "1"}}));
}

TEST(AppSignature, MalformedWhitelistsAndNoMatchesGiveNoSignatureAndAReason) {
  const std::vector<InstalledApp> installed = {{"a", "1"}, {"b", ""}};
  const std::string good = whitelist("0102", R"({"a":[{"encoding_id":5}]})");
  std::vector<std::string> bad = {
      "not json",
      R"({"apps":"{}","compression":"zip","encoding":"bitmap"})",
      R"({"apps":{"version":"0102"},"compression":"RLE","encoding":"bitmap"})",
      R"({"apps":"{\"version\":\"0102\",\"apps\":","compression":"RLE","encoding":"bitmap"})",
      whitelist("0102", R"({"b":[{"encoding_id":1}]})"),              // installed without a version
      whitelist("0102", R"({"a":[{"encoding_id":1},"last"]})"),        // the last element decides
      whitelist("0102", R"({"a":[{"encoding_id":4294967295}]})"),      // a 512 MiB bitmap: refused
      std::string(100 * 1024 * 1024, '{'),
  };
  for (std::size_t i = 0; i < bad.size(); ++i) {
    std::string why;
    EXPECT_FALSE(processWhitelist(bad[i], installed, &why)) << i;
    EXPECT_FALSE(why.empty()) << i;
  }
  EXPECT_TRUE(processWhitelist(good, installed));
  EXPECT_TRUE(processWhitelist(whitelist("0102", R"({"a":[{"encoding_id":1},{"encoding_id":9}]})"), installed));
}

}  // namespace
}  // namespace tavix
