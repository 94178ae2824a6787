#include "platform/ipc/frame.h"

namespace tavix::platform::ipc {

std::string frameWithRoom(std::size_t payloadSize) {
  const auto n = static_cast<std::uint32_t>(payloadSize);
  std::string out(kFrameHeaderSize + payloadSize, '\0');
  out[0] = static_cast<char>((n >> 24) & 0xff);
  out[1] = static_cast<char>((n >> 16) & 0xff);
  out[2] = static_cast<char>((n >> 8) & 0xff);
  out[3] = static_cast<char>(n & 0xff);
  return out;
}

std::string encodeFrame(std::string_view payload) {
  std::string out = frameWithRoom(payload.size());
  payload.copy(out.data() + kFrameHeaderSize, payload.size());
  return out;
}

void FrameDecoder::append(const char* data, std::size_t size) {
  if (failed_ || size == 0) return;
  // Drop what has been consumed before growing, so a long-lived stream does not keep old frames.
  if (offset_ > 0 && offset_ >= buffer_.size() / 2) {
    buffer_.erase(0, offset_);
    offset_ = 0;
  }
  buffer_.append(data, size);
}

std::optional<std::string> FrameDecoder::next() {
  if (failed_ || buffered() < kFrameHeaderSize) return std::nullopt;
  const auto* p = reinterpret_cast<const unsigned char*>(buffer_.data() + offset_);
  const std::uint64_t length = (std::uint64_t{p[0]} << 24) | (std::uint64_t{p[1]} << 16) |
                               (std::uint64_t{p[2]} << 8) | std::uint64_t{p[3]};
  if (length > max_) {
    failed_ = true;
    rejected_ = length;
    buffer_.clear();
    offset_ = 0;
    return std::nullopt;
  }
  if (buffered() < kFrameHeaderSize + length) return std::nullopt;
  std::string payload = buffer_.substr(offset_ + kFrameHeaderSize, length);
  offset_ += kFrameHeaderSize + length;
  if (offset_ == buffer_.size()) {
    buffer_.clear();
    offset_ = 0;
  }
  return payload;
}

}  // namespace tavix::platform::ipc
