#include "platform/ipc/launch_events.h"

namespace tavix::platform::ipc {

void LaunchEventRegistry::setHandler(const std::string& stream, Handler handler) {
  std::lock_guard lock(lock_);
  handlers_[stream] = std::make_shared<Handler>(std::move(handler));
}

bool LaunchEventRegistry::deliver(const std::string& stream, const std::string& eventName) {
  std::shared_ptr<Handler> handler;
  {
    std::lock_guard lock(lock_);
    auto it = handlers_.find(stream);
    if (it == handlers_.end()) return false;
    handler = it->second;
  }
  queue_.async([handler, eventName] { (*handler)(eventName); });
  return true;
}

}  // namespace tavix::platform::ipc
