// The IPC listener's delegate: accepts every client connection and keeps the list of live ones.
//
// Owns the serial queue "com.norvel.tavix.serviceQueue"; `connections` is touched only there.
// accept() is safe from any thread; connection handlers run on each connection's own queue.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch.h"

namespace tavix {

class ClientConnection;

namespace platform::http {
class URLSession;
}
namespace platform::ipc {
class IpcConnection;
}  // namespace platform::ipc

class TavixService {
 public:
  struct Environment {
    platform::DispatchPool* pool = nullptr;
    // The query session, whose memory cache goes when the last client does.
    std::shared_ptr<platform::http::URLSession> querySession;
    // Binds a new connection to a client; not yet started.
    std::function<std::shared_ptr<ClientConnection>(const std::shared_ptr<platform::ipc::IpcConnection>&)>
        makeConnection;
  };
  explicit TavixService(Environment env);
  ~TavixService();
  TavixService(const TavixService&) = delete;
  TavixService& operator=(const TavixService&) = delete;

  // The listener's delegate hook: every connection is accepted, bound to a new ClientConnection
  // and started. A second connection from one process is logged as a warning and served.
  bool shouldAcceptConnection(const std::shared_ptr<platform::ipc::IpcConnection>& connection);

  // A copy of the live connections, taken synchronously on the service queue; callable from any
  // other queue.
  std::vector<std::shared_ptr<ClientConnection>> getClientConnections();

  // The last path component of the peer's executable; none (logged) when it cannot be read.
  static std::optional<std::string> clientIDForConnection(const platform::ipc::IpcConnection& connection);

  platform::SerialQueue& queue() { return queue_; }

 private:
  void connectionInvalidated(const std::shared_ptr<ClientConnection>& client);

  Environment env_;
  platform::SerialQueue queue_;
  std::vector<std::shared_ptr<ClientConnection>> connections_;
  // Handlers hold this weakly, so that nothing runs into a destroyed service.
  std::shared_ptr<TavixService*> self_;
};

}  // namespace tavix
