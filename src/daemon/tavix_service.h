// The IPC listener's delegate: completes the object graph at start and keeps the list of live
// client connections.
//
// Owns the serial queue "com.norvel.tavix.serviceQueue"; `connections` is touched only there.
#pragma once

#include <memory>
#include <vector>

#include "platform/dispatch.h"

namespace tavix {

class Assembly;
class ClientConnection;

class TavixService {
 public:
  // Completes the assembly: sets `sharedSession` from the "TVXSharedSession" default.
  explicit TavixService(Assembly& assembly);
  TavixService(const TavixService&) = delete;
  TavixService& operator=(const TavixService&) = delete;

  // A copy of the live connections, taken synchronously on the service queue; callable from any
  // other queue.
  std::vector<std::shared_ptr<ClientConnection>> getClientConnections();

  platform::SerialQueue& queue() { return queue_; }

 private:
  Assembly& assembly_;
  platform::SerialQueue queue_;
  std::vector<std::shared_ptr<ClientConnection>> connections_;
};

}  // namespace tavix
