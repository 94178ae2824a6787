#include "delivery/output_stream.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <zlib.h>

#include <random>

#include "devserver/feedback_routes.h"
#include "platform/raw_deflate.h"

namespace tavix {
namespace {

// Keeps every piece it is handed, so that piece sizes can be checked.
class PieceRecorder final : public OutputStream {
 public:
  void open() override { opened = true; }
  long write(const std::uint8_t* buffer, std::size_t length) override {
    pieces.emplace_back(reinterpret_cast<const char*>(buffer), length);
    return static_cast<long>(length);
  }
  void close() override { closed = true; }
  StreamStatus streamStatus() const override { return StreamStatus::Open; }
  std::string joined() const {
    std::string all;
    for (const auto& p : pieces) all += p;
    return all;
  }
  bool opened = false;
  bool closed = false;
  std::vector<std::string> pieces;
};

std::string sha512Hex(std::string_view data) {
  unsigned char digest[64];
  unsigned int size = 0;
  EVP_Digest(data.data(), data.size(), digest, &size, EVP_sha512(), nullptr);
  static constexpr char kHex[] = "0123456789abcdef";
  std::string hex;
  for (unsigned i = 0; i < size; ++i) {
    hex += kHex[digest[i] >> 4];
    hex += kHex[digest[i] & 0xf];
  }
  return hex;
}

std::string randomBytes(std::size_t n, unsigned seed) {
  std::mt19937 random(seed);
  std::string s(n, '\0');
  for (auto& c : s) c = static_cast<char>(random());
  return s;
}

std::string jsonLikeText(std::size_t n) {
  std::string s;
  for (int i = 0; s.size() < n; ++i) s += "{\"type\":\"engagement\",\"query_id\":" + std::to_string(i * 7919 % 100003) + "},";
  s.resize(n);
  return s;
}

TEST(CompressedOutputStreamTest, RoundTripsThroughZlibInPiecesOfAtMost4096Bytes) {
  struct Case {
    std::string input;
    std::size_t chunk;
  };
  const std::vector<Case> cases = {
      {"", 1},
      {"hello, feedback", 3},
      {jsonLikeText(300000), 8192},
      {randomBytes(50000, 1), 50000},  // incompressible: the output buffer fills many times in one write
  };
  for (const auto& c : cases) {
    auto recorder = std::make_shared<PieceRecorder>();
    CompressedOutputStream stream(recorder);
    stream.open();
    EXPECT_TRUE(recorder->opened);
    EXPECT_EQ(stream.streamStatus(), StreamStatus::Open);
    for (std::size_t offset = 0; offset < c.input.size(); offset += c.chunk) {
      EXPECT_GE(stream.write(std::string_view(c.input).substr(offset, c.chunk)), 0);
    }
    stream.close();
    EXPECT_TRUE(recorder->closed);
    EXPECT_EQ(stream.streamStatus(), StreamStatus::AtEnd);
    EXPECT_FALSE(stream.streamError());
    EXPECT_EQ(stream.write("late"), -1) << "a finished stream takes nothing more";

    ASSERT_FALSE(recorder->pieces.empty()) << "even empty input yields a final block";
    for (const auto& piece : recorder->pieces) {
      EXPECT_GT(piece.size(), 0u);
      EXPECT_LE(piece.size(), CompressedOutputStream::kPieceSize);
    }
    EXPECT_EQ(platform::inflateRaw(recorder->joined()), c.input) << "input of " << c.input.size() << " bytes";
  }
}

TEST(CompressedOutputStreamTest, DigestHashesTheInputOncePerCompressorPass) {
  // Empty input: the digest of nothing, as every SHA-512 implementation knows it.
  {
    CompressedOutputStream stream;
    stream.open();
    stream.close();
    EXPECT_EQ(stream.dataDigestForStream(),
              "cf83e1357eefb8bdf1542850d66d8007d620e4050b5715dc83f4a921d36ce9ce"
              "47d0d13c5d85f2b0ff8318d2877eec2f63b931bd47417a81a538327af927da3e");
  }
  // Small writes that never fill the output buffer: one pass each, the plain SHA-512.
  {
    const std::string text = jsonLikeText(20000);
    CompressedOutputStream stream;
    stream.open();
    for (std::size_t offset = 0; offset < text.size(); offset += 1000) stream.write(std::string_view(text).substr(offset, 1000));
    stream.close();
    EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(text));
  }
  // One write of incompressible bytes fills the 4096-byte buffer several times: the input is
  // hashed once per pass, and the byte count adds what was consumed so far on every pass.
  {
    const std::string noise = randomBytes(300000, 3);
    CompressedOutputStream stream;
    stream.open();
    const long reported = stream.write(noise);
    stream.close();
    EXPECT_NE(stream.dataDigestForStream(), sha512Hex(noise));
    EXPECT_GT(reported, static_cast<long>(noise.size()));
    EXPECT_EQ(stream.dataDigestForStream(), devserver::expectedFeedbackDigest(noise, noise.size()));
  }
}

TEST(CompressedOutputStreamTest, AFailingDestinationFailsTheStream) {
  class Refusing final : public OutputStream {
   public:
    void open() override {}
    long write(const std::uint8_t*, std::size_t) override { return -1; }
    void close() override {}
    StreamStatus streamStatus() const override { return StreamStatus::Error; }
  };
  CompressedOutputStream stream(std::make_shared<Refusing>());
  stream.open();
  stream.write(randomBytes(20000, 4));
  stream.close();
  EXPECT_EQ(stream.streamStatus(), StreamStatus::Error);
  ASSERT_TRUE(stream.streamError());
  EXPECT_EQ(stream.streamError()->value(), 0);
  EXPECT_EQ(stream.write("more"), -1);
}

}  // namespace
}  // namespace tavix
