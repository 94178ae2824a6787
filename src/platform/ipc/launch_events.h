// Launch-event streams: named streams whose events (a name each) wake a handler in the daemon.
// Under systemd nothing delivers them by itself; the tool hands them in over IPC.
//
// Threading: every method is safe from any thread; handlers run on the registry's queue.
#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <string>

#include "platform/dispatch.h"

namespace tavix::platform::ipc {

class LaunchEventRegistry {
 public:
  using Handler = std::function<void(const std::string& eventName)>;

  // `queue` runs the handlers and must outlive the registry.
  explicit LaunchEventRegistry(SerialQueue& queue) : queue_(queue) {}

  // Installs (or replaces) the handler of `stream`.
  void setHandler(const std::string& stream, Handler handler);

  // Queues `eventName` for the handler of `stream`; false when the stream has no handler.
  bool deliver(const std::string& stream, const std::string& eventName);

 private:
  SerialQueue& queue_;
  std::mutex lock_;
  std::map<std::string, std::shared_ptr<Handler>> handlers_;
};

}  // namespace tavix::platform::ipc
