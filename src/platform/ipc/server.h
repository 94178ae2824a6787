// The IPC server: a listening Unix-domain socket and its connections, on the process's pool.
//
// Each connection reads frames (frame.h) and delivers them, in order, on its own SerialQueue;
// peers of another user are refused before anyone sees them. A connection holds at most a bounded
// number of unanswered calls: past it, it stops reading until one is answered, so a peer that
// writes faster than it is served waits on its own socket instead of growing the daemon's queues. Descriptors received over
// SCM_RIGHTS wait in the connection until the message layer takes them. The server knows frames
// and bytes only; what the payloads mean is the caller's business.
//
// Threading: every public method is safe from any thread. Handlers run on the connection's queue
// (messages, invalidation) or on a pool thread (accept).
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <system_error>
#include <vector>

#include "platform/dispatch.h"
#include "platform/ipc/frame.h"
#include "platform/ipc/unix_socket.h"

namespace tavix::platform {
class Logger;
}

namespace tavix::platform::ipc {

// Calls a peer may leave unanswered before its connection stops reading.
inline constexpr std::size_t kMaxUnansweredCalls = 64;

class IpcConnection : public std::enable_shared_from_this<IpcConnection> {
 public:
  using MessageHandler = std::function<void(std::string payload)>;
  using InvalidationHandler = std::function<void()>;
  // Keeps one received frame counted as an unanswered call while any copy lives.
  using CallHold = std::shared_ptr<void>;

  // Wraps a connected socket (made non-blocking here). Call start() to begin reading.
  // `logger` must outlive the connection.
  static std::shared_ptr<IpcConnection> make(DispatchPool& pool, UniqueFd fd, PeerCredentials peer,
                                             std::string queueLabel, Logger& logger,
                                             std::size_t maxFrameSize = kMaxFrameSize,
                                             std::size_t maxUnansweredCalls = kMaxUnansweredCalls);
  ~IpcConnection();
  IpcConnection(const IpcConnection&) = delete;
  IpcConnection& operator=(const IpcConnection&) = delete;

  const PeerCredentials& peer() const { return peer_; }
  SerialQueue& queue() { return queue_; }

  // Begins reading. Each payload goes to `onMessage` on queue(); when the connection ends (peer
  // gone, a bad frame, invalidate()), `onInvalidated` runs once on queue(), after every message
  // delivered before it. Call once.
  void start(MessageHandler onMessage, InvalidationHandler onInvalidated);

  // A frame counts as an unanswered call from the moment it is read until its message handler
  // returns, or, when the handler takes this hold, until every copy of the hold is gone (the
  // handler keeps it with its pending reply). On queue(), inside a message handler only; empty
  // elsewhere.
  CallHold holdCurrentCall();

  // Queues one frame; `fds` (owned, closed once sent) ride with it. Returns false, closing the
  // descriptors, when the connection is already invalidated or the payload is over the frame
  // limit (logged; the caller owes its peer a smaller answer). A peer that leaves more than four
  // maximum frames unread, a flood of calls it does not read the answers of, is disconnected.
  bool send(std::string payload, std::vector<UniqueFd> fds = {});
  // As send(), for a frame whose header is already in place (frameWithRoom()), so that a reply
  // serialized into it is never copied. Written from the calling thread when nothing waits
  // before it.
  bool sendFrame(std::string frame, std::vector<UniqueFd> fds = {});

  std::size_t maxFrameSize() const;

  // Takes the `count` oldest received descriptors. Fewer are returned when fewer arrived.
  std::vector<UniqueFd> takeReceivedFds(std::size_t count);

  // Closes the connection. Idempotent.
  void invalidate();
  bool isValid() const { return !closed_.load(); }

 private:
  struct Impl;
  IpcConnection(DispatchPool& pool, PeerCredentials peer, std::string queueLabel, Logger& logger);

  PeerCredentials peer_;
  SerialQueue queue_;
  Logger& logger_;
  std::atomic<bool> closed_{false};
  std::mutex fdLock_;
  std::vector<UniqueFd> receivedFds_;
  CallHold currentCall_;  // the frame being handled, on queue_ only
  std::unique_ptr<Impl> impl_;
};

class IpcListener {
 public:
  // The connection is started by the handler (or dropped, which closes it).
  using AcceptHandler = std::function<void(const std::shared_ptr<IpcConnection>&)>;

  // Listens at `path` (see listenAt) or, when `adoptedFd` is a descriptor, on that socket (socket
  // activation). `logger` must outlive the listener.
  static std::unique_ptr<IpcListener> listen(DispatchPool& pool, const std::string& path, Logger& logger,
                                             std::error_code* error);
  static std::unique_ptr<IpcListener> adopt(DispatchPool& pool, int adoptedFd, Logger& logger,
                                            std::error_code* error);
  // Stops accepting and removes the socket file this listener made. Live connections go on.
  ~IpcListener();
  IpcListener(const IpcListener&) = delete;
  IpcListener& operator=(const IpcListener&) = delete;

  // Starts accepting. `queueLabel` names each connection's queue (the peer's pid is appended).
  void resume(AcceptHandler handler, std::string queueLabel);

  const std::string& path() const { return path_; }

 private:
  struct Impl;
  IpcListener(DispatchPool& pool, UniqueFd fd, std::string path, Logger& logger);

  std::string path_;  // empty for an adopted socket
  std::shared_ptr<Impl> impl_;
};

}  // namespace tavix::platform::ipc
