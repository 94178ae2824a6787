#include "daemon/tavix_service.h"

#include "core/assembly.h"
#include "platform/defaults.h"

namespace tavix {

TavixService::TavixService(Assembly& assembly)
    : assembly_(assembly), queue_(*assembly.dispatchPool, "com.norvel.tavix.serviceQueue") {
  assembly_.sharedSession = assembly_.userDefaults->boolForKey("TVXSharedSession");
}

std::vector<std::shared_ptr<ClientConnection>> TavixService::getClientConnections() {
  std::vector<std::shared_ptr<ClientConnection>> copy;
  queue_.sync([&] { copy = connections_; });
  return copy;
}

}  // namespace tavix
