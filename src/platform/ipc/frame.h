// Framing of the IPC byte stream: a 4-byte big-endian length, then that many bytes of payload.
//
// Pure functions and a decoder object with no system calls, so that the fuzzer and the tests can
// drive them directly. Threading: a FrameDecoder belongs to one reader at a time.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace tavix::platform::ipc {

// The largest payload a peer may send. A frame that announces more ends its connection.
inline constexpr std::size_t kMaxFrameSize = 16 * 1024 * 1024;
inline constexpr std::size_t kFrameHeaderSize = 4;

// Header and payload in one buffer, ready to write. `payload` must not exceed kMaxFrameSize.
std::string encodeFrame(std::string_view payload);

// A frame of `payloadSize` bytes with its header written, for a payload to be serialized in place
// at offset kFrameHeaderSize.
std::string frameWithRoom(std::size_t payloadSize);

class FrameDecoder {
 public:
  explicit FrameDecoder(std::size_t maxFrameSize = kMaxFrameSize) : max_(maxFrameSize) {}

  // Adds bytes read from the stream. Ignored once the decoder has failed.
  void append(const char* data, std::size_t size);

  // The next complete payload, or none when more bytes are needed or the decoder has failed.
  std::optional<std::string> next();

  // True once a header announced more than the limit; the stream cannot be resynchronised.
  bool failed() const { return failed_; }
  // The length announced by the header that failed the decoder.
  std::uint64_t rejectedLength() const { return rejected_; }

  // Bytes received and not yet returned as payloads.
  std::size_t buffered() const { return buffer_.size() - offset_; }

 private:
  std::size_t max_;
  std::string buffer_;
  std::size_t offset_ = 0;
  bool failed_ = false;
  std::uint64_t rejected_ = 0;
};

}  // namespace tavix::platform::ipc
