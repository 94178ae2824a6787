#include "flush_commands.h"

#include <unistd.h>
#include <zlib.h>

#include <cstdio>
#include <future>
#include <optional>

#include "platform/ipc/frame.h"
#include "platform/ipc/unix_socket.h"
#include "tavix/client.h"
#include "tavix_proto/flusher.pb.h"
#include "platform/raw_deflate.h"
#include "platform/strings.h"

namespace tavix::tool {

namespace {

using platform::ipc::UniqueFd;

enum Intent : std::uint64_t { kWatchUploads = 0, kWatchFeedback = 1, kStopFlushing = 2, kDump = 3 };

// The channel's tool end, as the daemon hands it over.
UniqueFd openChannel(client::Client& client) {
  auto result = std::make_shared<std::promise<std::pair<int, std::optional<client::Error>>>>();
  auto answer = result->get_future();
  client.listenToFlusher(
      [result](int fd, std::optional<client::Error> error) { result->set_value({fd, std::move(error)}); });
  auto [fd, error] = answer.get();
  if (error) {
    std::fprintf(stderr, "tavix_tool: %s\n", error->describe().c_str());
    return {};
  }
  return UniqueFd(fd);
}

bool sendIntent(int fd, std::uint64_t intent) {
  proto::FlusherMessage message;
  message.mutable_initiate_connection()->set_intent(intent);
  const std::string frame = platform::ipc::encodeFrame(message.SerializeAsString());
  std::size_t sent = 0;
  return !platform::ipc::sendWithFds(fd, frame, {}, true, &sent) && sent == frame.size();
}

// Calls `handle` with each message until it returns false or the daemon closes the channel.
// False when the channel ended first.
template <typename Handler>
bool readMessages(int fd, Handler handle) {
  platform::ipc::FrameDecoder decoder;
  char buffer[65536];
  for (;;) {
    while (auto payload = decoder.next()) {
      proto::FlusherMessage message;
      if (!message.ParseFromString(*payload)) continue;
      if (!handle(message)) return true;
    }
    if (decoder.failed()) return false;
    std::vector<int> fds;
    std::size_t received = 0;
    if (platform::ipc::receiveWithFds(fd, buffer, sizeof buffer, true, &fds, &received) || received == 0) return false;
    for (int extra : fds) ::close(extra);
    decoder.append(buffer, received);
  }
}

// One upload body as a JSON line: its size and bytes, or (inflated) the JSON it carries.
void printUpload(const std::string& body, bool inflate) {
  if (inflate) {
    if (auto json = tavix::platform::inflateRaw(body)) {
      std::printf("{\"compressed_size\":%zu,\"json\":%s}\n", body.size(), json->c_str());
    } else {
      std::printf("{\"compressed_size\":%zu,\"error\":\"not raw DEFLATE\"}\n", body.size());
    }
  } else {
    std::printf("{\"compressed_size\":%zu,\"deflate_hex\":\"%s\"}\n", body.size(), tavix::platform::hexString(body).c_str());
  }
  std::fflush(stdout);
}

}  // namespace

bool isFlushCommand(const std::string& command) {
  return command == "dump" || command == "stop-flushing" || command == "watch" || command == "watch-uploads";
}

const char* flushCommandsUsage() {
  return "  dump                                     close every session now, upload it and re-enable\n"
         "                                           periodic flushing (a line per session sent)\n"
         "  stop-flushing                            stop periodic flushing until the next dump\n"
         "  watch                                    print incoming feedback events as JSON lines\n"
         "  watch-uploads [--inflate]                print each upload body as it is sent\n";
}

int runFlushCommand(client::Client& client, const std::string& command, const std::vector<std::string>& args) {
  bool inflate = false;
  if (command == "watch-uploads" && args.size() == 1 && args[0] == "--inflate") {
    inflate = true;
  } else if (!args.empty()) {
    return 2;
  }
  UniqueFd channel = openChannel(client);
  if (!channel.valid()) return 1;

  if (command == "dump" || command == "stop-flushing") {
    if (!sendIntent(channel.get(), command == "dump" ? kDump : kStopFlushing)) {
      std::fprintf(stderr, "tavix_tool: cannot talk to the flusher channel\n");
      return 1;
    }
    std::size_t sessions = 0;
    const bool finished = readMessages(channel.get(), [&](const proto::FlusherMessage& message) {
      if (message.has_flushed_data()) {
        for (const auto& body : message.flushed_data().data()) {
          ++sessions;
          std::printf("flushed session %zu (%zu bytes compressed)\n", sessions, body.size());
          std::fflush(stdout);
        }
      }
      return !message.has_work_done();
    });
    if (!finished) {
      std::fprintf(stderr, "tavix_tool: the daemon closed the flusher channel\n");
      return 1;
    }
    if (command == "dump") {
      std::printf("dump complete: %zu session%s flushed\n", sessions, sessions == 1 ? "" : "s");
    } else {
      std::printf("periodic flushing stopped; dump to start it again\n");
    }
    return 0;
  }

  // watch, watch-uploads: until the daemon goes away or we are interrupted.
  if (!sendIntent(channel.get(), command == "watch" ? kWatchFeedback : kWatchUploads)) return 1;
  readMessages(channel.get(), [&](const proto::FlusherMessage& message) {
    if (message.has_received_feedback_description()) {
      std::printf("%s\n", message.received_feedback_description().description().c_str());
      std::fflush(stdout);
    }
    if (message.has_flushed_data()) {
      for (const auto& body : message.flushed_data().data()) printUpload(body, inflate);
    }
    return true;
  });
  return 0;
}

}  // namespace tavix::tool
