// libtavix: the client side of tavixd's IPC protocol.
//
// A Client owns one connection to the daemon's socket. It connects lazily on the first call,
// sends its session configuration first, and reconnects (configuring again) on the next call
// after the daemon went away. Calls are asynchronous: each reply callback is called exactly once,
// with the reply or with an error (domain "tavix.client" for transport failures): when the
// connection drops, every call pending on it fails with kConnectionLost, and a call that has no
// reply by its deadline fails with kTimedOut (a reply that comes later is dropped). The blocking
// helpers wait for that callback.
//
// Threading: every method is safe from any thread. Callbacks and handlers run on the client's
// reader thread, one at a time; a callback must not call a blocking helper of the same client.
// The destructor fails every pending call with "client closed" before it returns.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tavix_proto/ipc.pb.h"

namespace tavix::client {

inline constexpr const char* kClientErrorDomain = "tavix.client";

struct Error {
  std::string domain;
  std::int64_t code = 0;
  std::string reason;

  std::string describe() const;
  static Error fromProto(const proto::TVXError& e) { return {e.domain(), e.code(), e.reason()}; }
};

// Transport error codes in kClientErrorDomain.
enum ClientErrorCode : std::int64_t {
  kCannotConnect = 1,   // no daemon listening, or the socket refused us
  kConnectionLost = 2,  // the connection ended before the reply came
  kTimedOut = 3,        // no reply by the call's deadline
  kProtocol = 4,        // the daemon answered with something we did not ask for
  kClosed = 5,          // the client was destroyed
};

// $XDG_RUNTIME_DIR/com.norvel.tavixd/socket (or the per-user /tmp fallback).
std::string defaultSocketPath();

class Client {
 public:
  struct Options {
    std::string socketPath;  // empty: defaultSocketPath()
    proto::TVXSessionConfiguration configuration;
    bool reconnect = true;   // false: once the connection is lost every call fails
    int timeoutMs = 10000;   // each call's deadline, from when it is sent; 0: none
  };

  explicit Client(Options options);
  ~Client();
  Client(const Client&) = delete;
  Client& operator=(const Client&) = delete;

  using EnvelopeReply = std::function<void(const proto::Envelope* reply, std::optional<Error> error)>;

  // Sends `message` as a call (a call id is assigned) and calls `reply` once. A reply whose
  // message is `call_failed` arrives as an error.
  void call(proto::Envelope message, EnvelopeReply reply);
  // As call(), for replies that carry descriptors (a flusher endpoint, a resource's file). The
  // descriptors the reply announces in `attached_fds` are handed over in order; the callback owns
  // them and must close them.
  using DescriptorReply =
      std::function<void(const proto::Envelope* reply, std::vector<int> fds, std::optional<Error> error)>;
  void callWithDescriptors(proto::Envelope message, DescriptorReply reply);

  // Sends a one-way message. False when it could not be sent.
  bool post(proto::Envelope message);

  // Typed calls.
  using RequestReply =
      std::function<void(std::uint64_t queryId, std::optional<proto::TVXReply> reply, std::optional<Error> error)>;
  void request(const proto::TVXRequest& request, RequestReply reply);
  void bag(std::function<void(std::optional<proto::TVXBagData>, std::optional<Error>)> reply);
  void notify(const std::string& eventName, std::function<void(std::optional<Error>)> reply);
  void runActivity(const std::string& name, std::function<void(std::optional<Error>)> reply);
  // The flush command channel's endpoint: a connected socket (yours to close) or -1 with an error.
  void listenToFlusher(std::function<void(int fd, std::optional<Error>)> reply);
  // A resource file the daemon keeps (a bag key): a read-only descriptor (yours to close) and its
  // attributes as an XML property list dictionary, or -1 with an error (code 404 in
  // "kTVXErrorDomain" when there is no such file).
  void fileHandleForResource(const std::string& identifier,
                             std::function<void(int fd, std::string attributesPlist, std::optional<Error>)> reply);

  // Blocking helpers: the same calls, waiting for their answer (at most their deadline).
  std::optional<Error> connect();  // connects and configures now
  std::optional<Error> notifySync(const std::string& eventName);
  std::optional<Error> runActivitySync(const std::string& name);
  // The whole reply envelope, or the error.
  std::optional<Error> callSync(proto::Envelope message, proto::Envelope* reply);

  // Messages the daemon sends on its own.
  void setBagDidLoadHandler(std::function<void(const proto::BagDidLoad&)> handler);
  void setResourceHandlers(std::function<void(const std::string& identifier)> downloaded,
                           std::function<void(const std::string& identifier)> deleted);

  bool isConnected() const;

 private:
  struct Impl;
  std::shared_ptr<Impl> impl_;
};

}  // namespace tavix::client
