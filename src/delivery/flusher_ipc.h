// TavixFlusherIPC: the flush command channel through which tavix_tool watches feedback, watches
// upload bodies, stops periodic flushing and orders a dump.
//
// Each endpoint() is one end of a fresh socket pair; the channel serves the other end as a tool
// connection (frames of FlusherMessage, proto/flusher.proto). The most recently connected tool is
// the remote that commands act for; subscriptions last until its connection ends.
//
// Threading: owns the serial queue "com.norvel.tavixd.flusherIPCQueue"; the remote and both
// listeners are read and written only there, and every send to a tool is made there. Public
// methods are safe from any thread. Must be owned by a shared_ptr (made by create()).
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch.h"
#include "platform/ipc/unix_socket.h"

namespace tavix {

namespace platform {
class UserDefaults;
}

namespace proto {
class CTTavixFeedback;
}

namespace platform::ipc {
class IpcConnection;
}

class TavixFlusherIPC : public std::enable_shared_from_this<TavixFlusherIPC> {
 public:
  // What a dump needs of a client connection: its user agent and a way to close its session.
  struct ClientConnectionHandle {
    std::string userAgent;
    // Closes the connection's feedback session, then calls its argument.
    std::function<void(std::function<void()>)> flushSession;
  };
  using GetClientConnections = std::function<std::vector<ClientConnectionHandle>()>;

  enum Intent : std::uint64_t {
    kSubscribeToFlushedData = 0,
    kSubscribeToFeedback = 1,
    kStopFlushing = 2,
    kDump = 3,
  };

  // Sends every closed session now and calls its argument once they are on their way.
  using FlushFeedback = std::function<void(std::function<void()> done)>;

  // What the channel works with. The pool must outlive it. `getClientConnections` may be empty (a
  // dump then flushes nothing).
  struct Environment {
    platform::DispatchPool* pool = nullptr;
    std::shared_ptr<platform::UserDefaults> defaults;  // keeps "TVXFeedbackFlushDisabled"
    bool sharedSession = false;  // one flush then closes the session of every client
    GetClientConnections getClientConnections;
    FlushFeedback flushFeedback;
  };

  static std::shared_ptr<TavixFlusherIPC> create(Environment env);
  // Ends every tool connection.
  ~TavixFlusherIPC();
  TavixFlusherIPC(const TavixFlusherIPC&) = delete;
  TavixFlusherIPC& operator=(const TavixFlusherIPC&) = delete;

  // A new endpoint for a tool: the tool's end of a socket pair whose other end is now served.
  // Invalid when no socket pair could be made.
  platform::ipc::UniqueFd endpoint();

  // Asynchronously: the event's JSON description to the feedback subscriber, if there is one.
  void sendDataToReceivingStreamListener(const proto::CTTavixFeedback& feedback);
  // Asynchronously: upload bodies to the upload-body subscriber, if there is one.
  void sendDataToSendingStreamListener(std::vector<std::string> data);

  // Asynchronously: one command of the current remote (see Intent).
  void initiateConnectionWithIntent(std::uint64_t intent);

  platform::SerialQueue& queue() { return flusherIpcQueue_; }

 private:
  using Remote = std::shared_ptr<platform::ipc::IpcConnection>;

  explicit TavixFlusherIPC(Environment env);
  void accept(platform::ipc::UniqueFd fd);
  void handleMessage(const std::string& payload);
  void removeRemote(const Remote& remote);  // asynchronously on the queue
  void dump();                              // on the queue
  static void sendWorkDone(const Remote& remote);

  Environment env_;
  platform::SerialQueue flusherIpcQueue_;
  // On the queue:
  Remote remoteObject_;
  Remote receivingStreamListener_;
  std::atomic<bool> hasReceivingStreamListener_{false};  // set and cleared with the one above
  Remote sendingStreamListener_;
  std::vector<Remote> connections_;  // every live tool connection, kept open here
};

}  // namespace tavix
