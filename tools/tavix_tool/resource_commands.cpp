#include "resource_commands.h"

#include <unistd.h>

#include <cmath>
#include <cstdio>
#include <ctime>
#include <future>

#include "tavix/client.h"

namespace tavix::tool {

namespace {

// "3d4h", "12m5s": an age or a wait at a glance.
std::string span(double seconds) {
  const auto s = static_cast<long long>(std::max(0.0, seconds));
  char text[32];
  if (s >= 86400) {
    std::snprintf(text, sizeof text, "%lldd%lldh", s / 86400, s % 86400 / 3600);
  } else if (s >= 3600) {
    std::snprintf(text, sizeof text, "%lldh%lldm", s / 3600, s % 3600 / 60);
  } else if (s >= 60) {
    std::snprintf(text, sizeof text, "%lldm%llds", s / 60, s % 60);
  } else {
    std::snprintf(text, sizeof text, "%llds", s);
  }
  return text;
}

// Asks the daemon rather than reading its defaults and folder: only the daemon knows which
// downloads are in flight and how far they got.
int list(client::Client& client) {
  proto::Envelope call;
  call.mutable_list_resources();
  proto::Envelope reply;
  if (auto error = client.callSync(call, &reply)) {
    std::fprintf(stderr, "tavix_tool: %s\n", error->describe().c_str());
    return 1;
  }
  const auto& answer = reply.list_resources_reply();
  if (answer.has_error()) {
    std::fprintf(stderr, "tavix_tool: %s\n", client::Error::fromProto(answer.error()).describe().c_str());
    return 1;
  }
  const double now = static_cast<double>(std::time(nullptr));
  for (const auto& r : answer.resources()) {
    std::printf("%s\n  url:      %s\n  version:  %s\n", r.identifier().c_str(),
                r.url().empty() ? "(not fetched yet)" : r.url().c_str(), r.version().empty() ? "-" : r.version().c_str());
    if (r.has_file()) {
      std::printf("  file:     %lld bytes, %s old\n", static_cast<long long>(r.file_size()),
                  span(now - r.file_modification_date()).c_str());
    } else {
      std::printf("  file:     none\n");
    }
    if (r.downloading() && !r.download_started()) {
      std::printf("  download: queued, begins in %s\n", span(r.download_begin_date() - now).c_str());
    } else if (r.downloading()) {
      if (r.bytes_expected() > 0) {
        std::printf("  download: %lld of %lld bytes (%.0f%%)\n", static_cast<long long>(r.bytes_received()),
                    static_cast<long long>(r.bytes_expected()),
                    100.0 * static_cast<double>(r.bytes_received()) / static_cast<double>(r.bytes_expected()));
      } else {
        std::printf("  download: %lld bytes so far\n", static_cast<long long>(r.bytes_received()));
      }
    }
  }
  return 0;
}

// The file's bytes, read through the descriptor the daemon hands over.
int cat(client::Client& client, const std::string& identifier) {
  std::promise<std::pair<int, std::optional<client::Error>>> done;
  client.fileHandleForResource(identifier, [&done](int fd, std::string, std::optional<client::Error> error) {
    done.set_value({fd, std::move(error)});
  });
  auto [fd, error] = done.get_future().get();
  if (error) {
    std::fprintf(stderr, "tavix_tool: %s\n", error->describe().c_str());
    return 1;
  }
  char buffer[65536];
  ssize_t n;
  while ((n = ::read(fd, buffer, sizeof buffer)) > 0) std::fwrite(buffer, 1, static_cast<std::size_t>(n), stdout);
  ::close(fd);
  return n < 0 ? 1 : 0;
}

}  // namespace

int resourcesCommand(client::Client& client, const std::vector<std::string>& args) {
  if (args.empty()) return list(client);
  if (args.size() == 2 && args[0] == "cat") return cat(client, args[1]);
  return 2;
}

}  // namespace tavix::tool
