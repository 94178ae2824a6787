// Feeds arbitrary bytes, split at arbitrary points, through the frame decoder and decodes every
// frame as an Envelope, the way a connection does with what a peer sends.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "platform/ipc/frame.h"
#include "tavix_proto/ipc.pb.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size < 2) return 0;
  // The first byte picks the read size, the second a small frame limit (or the real one), so
  // that the limit's edge is reached without megabytes of input.
  const std::size_t chunk = data[0] % 64 + 1;
  const std::size_t limit = data[1] == 0 ? tavix::platform::ipc::kMaxFrameSize : data[1] * 4u;
  data += 2;
  size -= 2;

  tavix::platform::ipc::FrameDecoder decoder(limit);
  std::size_t consumed = 0;
  for (std::size_t offset = 0; offset < size; offset += chunk) {
    const std::size_t n = std::min(chunk, size - offset);
    decoder.append(reinterpret_cast<const char*>(data + offset), n);
    while (auto payload = decoder.next()) {
      if (payload->size() > limit) std::abort();
      consumed += payload->size() + tavix::platform::ipc::kFrameHeaderSize;
      tavix::proto::Envelope envelope;
      if (!envelope.ParseFromString(*payload)) continue;
      // What the daemon reads of every message: the case, the call id, the descriptor count,
      // and a re-encoding must decode to the same message.
      (void)envelope.message_case();
      std::string again;
      if (!envelope.SerializeToString(&again)) std::abort();
      tavix::proto::Envelope copy;
      if (!copy.ParseFromString(again) || copy.call_id() != envelope.call_id() ||
          copy.message_case() != envelope.message_case() || copy.attached_fds() != envelope.attached_fds()) {
        std::abort();
      }
    }
    if (decoder.failed()) break;
  }
  if (!decoder.failed() && consumed + decoder.buffered() != size) std::abort();
  return 0;
}
