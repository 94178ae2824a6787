#include "daemon/tavix_service.h"

#include <algorithm>
#include <cstring>

#include <google/protobuf/stubs/logging.h>

#include "core/diagnostics.h"
#include "core/logging.h"
#include "daemon/client_connection.h"
#include "platform/http/url_session.h"
#include "platform/ipc/server.h"
#include "query/client_state.h"

namespace tavix {

namespace {
platform::Logger& connectionLog() { return TavixLogForCategory(TavixLoggingCategoryConnection); }
}  // namespace

TavixService::TavixService(Environment env)
    : env_(std::move(env)),
      queue_(*env_.pool, "com.norvel.tavix.serviceQueue"),
      self_(std::make_shared<TavixService*>(this)) {
  // A malformed message is logged once by the connection; protobuf's own parse complaints would
  // let any peer write to our log at will.
  google::protobuf::SetLogHandler(nullptr);
}

TavixService::~TavixService() {
  self_.reset();
  queue_.sync([] {});  // let a handler that already holds the service finish
}

std::optional<std::string> TavixService::clientIDForConnection(const platform::ipc::IpcConnection& connection) {
  std::string path;
  if (auto ec = platform::ipc::executablePath(connection.peer().pid, &path)) {
    connectionLog().error("error getting path for pid [{}] {}", connection.peer().pid, ec.message());
    return std::nullopt;
  }
  return platform::ipc::lastPathComponent(path);
}

bool TavixService::shouldAcceptConnection(const std::shared_ptr<platform::ipc::IpcConnection>& connection) {
  const pid_t pid = connection->peer().pid;
  const std::string clientID = clientIDForConnection(*connection).value_or("(null)");
  connectionLog().notice("new connection from {} ({})", clientID, pid);

  auto client = env_.makeConnection(connection);
  client->start();

  std::weak_ptr<TavixService*> weakService = self_;
  std::weak_ptr<ClientConnection> weakClient = client;
  queue_.async([this, client, pid] {
    connections_.push_back(client);
    const auto same = std::count_if(connections_.begin(), connections_.end(),
                                    [pid](const auto& c) { return c->connection()->peer().pid == pid; });
    // Only a warning: some clients open more than one connection, and each is served.
    if (same >= 2) connectionLog().error("too many connections {} from pid {}", same, pid);
  });

  // The message handler holds the client weakly: the service's list keeps it alive until the
  // invalidation handler has run.
  connection->start(
      [weakClient](std::string payload) {
        if (auto c = weakClient.lock()) c->handleIncomingMessage(payload);
      },
      [weakService, weakClient, clientID, pid] {
        auto service = weakService.lock();
        auto c = weakClient.lock();
        if (c) c->invalidated();
        if (!service || !c) return;
        connectionLog().notice("connection from {} ({}) invalidated", clientID, pid);
        (*service)->connectionInvalidated(c);
        // On the connection's queue, where its bound state may be read.
        if (const auto& state = c->state(); state && state->clientShortName()) {
          TavixDiagnosticDataReporter::addValue(1, createCounterKey(*state->clientShortName(), "ipcinvalidation"));
        }
      });

  TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.clientconnection");
  return true;
}

void TavixService::connectionInvalidated(const std::shared_ptr<ClientConnection>& client) {
  queue_.async([this, client] {
    auto removeAndPurge = [this, client](bool flushed) {
      TavixLogForCategory(TavixLoggingCategorySession)
          .info("session {} on invalidation", flushed ? "flushed" : "not flushed");
      queue_.async([this, client] {
        connections_.erase(std::remove(connections_.begin(), connections_.end(), client), connections_.end());
        if (!connections_.empty()) return;
        // Replies cached for clients that have all gone are dead weight; the disk cache stays.
        TavixLogForCategory(TavixLoggingCategoryCaching).info("purging url cache");
        env_.querySession->purgeMemoryCache();
      });
    };
    // A connection that never said who it is has no session to close.
    client->flushSessionInvalidation(removeAndPurge);
  });
}

std::vector<std::shared_ptr<ClientConnection>> TavixService::getClientConnections() {
  std::vector<std::shared_ptr<ClientConnection>> copy;
  queue_.sync([&] { copy = connections_; });
  return copy;
}

}  // namespace tavix
