// The daemon's side of one client's IPC connection: decodes the client's calls, validates its
// configuration, binds the connection to the client's ClientState (shared by all connections of
// the same client identifier), routes queries to it, takes the client's feedback, relays bag and
// resource notifications, and answers each call once.
//
// Runs on the IPC connection's own serial queue: handleIncomingMessage() and invalidated() are called
// there, and the configuration and bound state are touched only there. Replies to queries come
// back from the URL session's threads and go straight to the connection, which is thread-safe.
#pragma once

#include <atomic>
#include <functional>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "core/names.h"
#include "core/requests.h"
#include "feedback/client_session.h"
#include "platform/clock.h"
#include "platform/files.h"
#include "platform/notification_center.h"
#include "platform/transactions.h"

namespace tavix {

class DownloadManager;
class ClientSessionManager;
class ClientState;
class ClientStateManager;
class EngagedCompletionCache;
class TavixFlusherIPC;
class TVXBag;
class TVXNetworkRequestFactory;

namespace platform {
class ActivityScheduler;
class UserDefaults;
}  // namespace platform
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
  using Configuration = TVXSessionConfiguration;

  // What every connection works with: one struct, made at start-up and shared by all connections.
  // The pool, clock, transactions, activities and launch events must outlive the connections.
  struct Environment {
    platform::DispatchPool* pool = nullptr;
    platform::Clock* clock = nullptr;
    platform::TransactionTracker* transactions = nullptr;
    platform::ActivityScheduler* activities = nullptr;
    // Receives the launch events clients hand in; null: none are delivered.
    platform::ipc::LaunchEventRegistry* launchEvents = nullptr;
    std::shared_ptr<platform::UserDefaults> defaults;
    std::shared_ptr<platform::NotificationCenter> center;
    std::shared_ptr<TVXNetworkRequestFactory> requestFactory;  // the device's part of user agents
    std::shared_ptr<ClientStateManager> clientStates;
    // The daemon's own session manager: a rejected configuration is recorded there.
    std::shared_ptr<ClientSessionManager> sessionManager;
    std::shared_ptr<EngagedCompletionCache> engagedCompletions;
    // A client's feedback that belongs to no session is reported as a session of its own.
    FeedbackEnvironment feedback;
    platform::fs::path cachesFolder;  // where completion-feature files are written
    // Hands the tool its end of the flush command channel; null: "not available".
    std::shared_ptr<TavixFlusherIPC> flusher;
    // The bag's resource files; null: resource calls answer "not available".
    std::shared_ptr<DownloadManager> downloads;
  };
  ClientConnection(std::shared_ptr<const Environment> env, std::shared_ptr<platform::ipc::IpcConnection> connection);
  ~ClientConnection();
  ClientConnection(const ClientConnection&) = delete;
  ClientConnection& operator=(const ClientConnection&) = delete;

  // Opens the keep-alive transaction, arms its idle timer and starts relaying resource
  // notifications ("TVXFileDownloadCompletedNotification", "TVXFileDeletedNotification") to the
  // client. Call once, before messages flow.
  void start();

  // One frame from the client. Malformed or unknown messages are logged; a call among them is
  // answered with `call_failed`. Never throws, never ends the daemon.
  void handleIncomingMessage(const std::string& payload);

  // The connection has ended: stops the timer and closes the transaction, whose keep-alive lasts
  // another kIdleTransactionSeconds so that the daemon does not leave while the client may come
  // back.
  void invalidated();

  const std::shared_ptr<platform::ipc::IpcConnection>& connection() const { return connection_; }
  // The configuration and full user agent once a valid configuration came. On the queue only.
  const std::optional<Configuration>& configuration() const { return configuration_; }
  const std::string& userAgent() const { return userAgent_; }
  // The bound state, none until a valid configuration came. On the queue only.
  const std::shared_ptr<ClientState>& state() const { return state_; }

  // The connection has gone: the client state's session manager closes or marks the session;
  // `callback` says whether it was flushed. Safe from any thread.
  void flushSessionInvalidation(std::function<void(bool flushed)> callback);

 private:
  class PendingCall;

  void openOrExtendTransaction();
  void armIdleTimer(platform::Duration delay);
  // Empties the state's query cache and ends the keep-alive: at once (`now`, the idle timer) or
  // kIdleTransactionSeconds later (invalidation, destruction).
  void closeTransaction(bool now);
  void configure(std::uint64_t callId, const proto::Envelope& in);
  // Binds the state for the configuration when it can; logs why not otherwise.
  void ensureState();
  // Sends `out` as the answer to `callId`, or unasked with call id 0.
  void send(std::uint64_t callId, proto::Envelope& out);
  // Answers call `callId` with `out`; a message without a call id gets no answer.
  void reply(std::uint64_t callId, proto::Envelope& out);
  void relayResourceNotification(const platform::Notification& notification, bool downloaded);
  void bagDidLoad(const std::shared_ptr<const TVXBag>& bag, const std::optional<TVXError>& error);
  void bagChangeNotification(const platform::Notification& notification);
  void setEngagedCompletionCacheValues(const TVXBag& bag);
  // One method per message.
  void bag(std::uint64_t callId);
  void request(std::uint64_t callId, const proto::Envelope& in);
  void listenToFlusher(std::uint64_t callId);
  void listSessions(std::uint64_t callId);
  void fileHandleAndAttributesForResource(std::uint64_t callId, const proto::Envelope& in);
  void getImageMap(std::uint64_t callId);
  void listResources(std::uint64_t callId);
  void notify(std::uint64_t callId, const proto::Envelope& in);
  void runActivity(std::uint64_t callId, const proto::Envelope& in);
  void unknownMessage(std::uint64_t callId, const proto::Envelope& in);
  void reportFeedbackPayloadData(const std::string& data, std::uint64_t queryId);
  void feedback(std::uint64_t callId);
  void engagedCompletionMessage(const proto::Envelope& in);

  const std::shared_ptr<const Environment> env_;
  std::shared_ptr<platform::ipc::IpcConnection> connection_;
  std::optional<Configuration> configuration_;
  std::string userAgent_;
  std::shared_ptr<ClientState> state_;
  // A bag was asked for on the client's behalf (configure); it arrives as bagDidLoad once.
  bool bagRequested_ = false;

  std::atomic<bool> transactionOpen_{false};
  std::mutex transactionLock_;
  platform::TransactionTracker::Transaction transaction_;
  platform::TimerHandle idleTimer_;
  // On the queue (and in start(), before messages flow).
  bool idleTimerArmed_ = false;
  platform::TimePoint lastMessage_{};
  platform::NotificationCenter::Registration downloadObserver_;
  platform::NotificationCenter::Registration deleteObserver_;
  platform::NotificationCenter::Registration bagObserver_;
};

}  // namespace tavix
