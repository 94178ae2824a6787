// The daemon's side of one client's IPC connection: decodes the client's calls, validates its
// configuration and answers each call once. The query paths, the bag and the feedback sessions
// plug in here as they arrive; until then their calls get the error 500 "not available".
//
// Runs on the IPC connection's own serial queue: handleMessage() and invalidated() are called
// there, and everything they touch is touched only there, except `transactionOpen_` (atomic).
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/names.h"
#include "platform/clock.h"
#include "platform/notification_center.h"
#include "platform/transactions.h"

namespace tavix {

class Assembly;

namespace platform::ipc {
class IpcConnection;
class LaunchEventRegistry;
}  // namespace platform::ipc

namespace proto {
class Envelope;
class TVXError;
}  // namespace proto

// How long a silent client keeps the daemon alive.
inline constexpr double kIdleTransactionSeconds = 60;

class ClientConnection : public std::enable_shared_from_this<ClientConnection> {
 public:
  struct Configuration {
    std::string identifier;
    std::string userAgent;
  };

  // `launchEvents` may be null (no launch events then); it and the assembly outlive the object.
  ClientConnection(Assembly& assembly, std::shared_ptr<platform::ipc::IpcConnection> connection,
                   platform::ipc::LaunchEventRegistry* launchEvents);
  ~ClientConnection();
  ClientConnection(const ClientConnection&) = delete;
  ClientConnection& operator=(const ClientConnection&) = delete;

  // Opens the keep-alive transaction, arms its idle timer and starts relaying resource
  // notifications ("TVXFileDownloadCompletedNotification", "TVXFileDeletedNotification") to the
  // client. Call once, before messages flow.
  void start();

  // One frame from the client. Malformed or unknown messages are logged; a call among them is
  // answered with `call_failed`. Never throws, never ends the daemon.
  void handleMessage(const std::string& payload);

  // The connection has ended: closes the transaction and stops the timer.
  void invalidated();

  const std::shared_ptr<platform::ipc::IpcConnection>& connection() const { return connection_; }
  // The configuration and full user agent once a valid configuration came. On the queue only.
  const std::optional<Configuration>& configuration() const { return configuration_; }
  const std::string& userAgent() const { return userAgent_; }

 private:
  void openOrExtendTransaction();
  void closeTransaction();
  void configure(std::uint64_t callId, const proto::Envelope& in);
  void send(std::uint64_t callId, proto::Envelope& out);
  void relayResourceNotification(const platform::Notification& notification, bool downloaded);

  Assembly& assembly_;
  std::shared_ptr<platform::ipc::IpcConnection> connection_;
  platform::ipc::LaunchEventRegistry* launchEvents_;
  std::optional<Configuration> configuration_;
  std::string userAgent_;

  std::atomic<bool> transactionOpen_{false};
  std::mutex transactionLock_;
  platform::TransactionTracker::Transaction transaction_;
  platform::TimerHandle idleTimer_;
  platform::NotificationCenter::Registration downloadObserver_;
  platform::NotificationCenter::Registration deleteObserver_;
};

}  // namespace tavix
