// URL sessions: HTTP and HTTPS data tasks on libcurl's multi interface.
//
// A URLSession owns one transfer thread that drives every transfer of the session; nothing else
// touches curl. Completions never run on that thread: each task delivers its completion on the
// queue its creator named, or on the session's delegate queue. Every task's completion is called
// exactly once, on every path: success, HTTP error status (not an error here), transport failure,
// timeout, cancel(), and the session's destruction (URLErrorCancelled).
//
// Hostile servers are bounded: a response body (counted after content decoding, which happens
// only for the codings the request asked for) stops at the session's maximum, and an interactive
// session holds each task to its request's time-out in all, not only between bytes.
//
// Threading: every method of URLSession and URLSessionDataTask is safe from any thread.
//
// Background sessions (resource downloads, feedback uploads) share this transport; their
// persistence sits beside it, in a TransferJournal (transfer_journal.h).
#pragma once

#include <any>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/http/url_request.h"

namespace tavix::platform {
class Clock;
class DispatchPool;
class Logger;
class SerialQueue;
}  // namespace tavix::platform

namespace tavix::platform::http {

struct URLSessionConfiguration {
  // Names the session in logs and, later, its transfer journal. Empty for default sessions.
  std::string identifier;

  // TCP Fast Open on new connections.
  bool tcpFastOpen = false;
  // TLS session resumption across the session's connections (one curl share handle per session).
  bool tlsSessionReuse = true;
  // Idle connections are kept for reuse this long, then closed.
  std::chrono::seconds connectionIdleTimeout{10};
  // How long the transfer thread stays once nothing is in flight; the next task starts it again.
  // An idle daemon then holds no HTTP thread at all.
  std::chrono::milliseconds transferThreadLinger{10000};
  // Several requests on one connection where the server speaks HTTP/2.
  bool multiplexing = true;

  // PEM file of the certificate authorities to trust instead of the system's; empty: the system's.
  // Verification of the peer and its host name is always on.
  std::string trustedCertificatesFile;

  // In-memory HTTP response cache, in bytes; 0 turns it off.
  std::size_t memoryCacheCapacity = 0;

  // Seconds without progress before a task fails; 0 leaves it to each request's timeoutInterval.
  double timeoutIntervalForRequest = 0;
  // Seconds a task may take in all; 0 for no limit.
  double timeoutIntervalForResource = 0;
  // Interactive sessions (a client waits on each task): a request's timeoutInterval also bounds
  // the whole task, so a server that trickles its answer a byte at a time ends in
  // URLErrorTimedOut instead of holding the client.
  bool requestTimeoutIsDeadline = false;

  // Bytes of response body, after content decoding, that a task may receive; the task that passes
  // them is cancelled there with URLErrorDataLengthExceedsMaximum. 0: no limit.
  std::size_t maximumResponseBodySize = 0;

  // Where the session logs what it refuses (bodies over the limit, unasked content codings,
  // header values it will not send). Null: nowhere. Must outlive the session.
  Logger* logger = nullptr;

  // Pool of the session's delegate queue. Null: the session makes a one-thread pool of its own.
  DispatchPool* delegatePool = nullptr;
  // Time source of the response cache's freshness. Null: the system clock.
  Clock* clock = nullptr;
};

// Where the time of one task went, as libcurl measured it (seconds from the task's start).
// Zero where a phase did not happen (no DNS for a literal address, no TLS for http, no
// network at all for a cache hit).
struct URLSessionTaskMetrics {
  double domainLookupSeconds = 0;
  double connectSeconds = 0;
  double secureConnectionSeconds = 0;
  double firstByteSeconds = 0;
  double totalSeconds = 0;
  bool reusedConnection = false;
  bool fromCache = false;
  std::string peerAddress;  // numeric, without port
  long peerPort = 0;
  std::string protocol;  // "http/1.0", "http/1.1", "h2", "h3"
  std::int64_t requestBodyBytes = 0;
  std::int64_t responseBodyBytes = 0;
};

// Data, then the response head when one came back whole, then the transport error if any.
// HTTP error statuses arrive as responses, not errors.
using DataTaskCompletion = std::function<void(std::string data, std::optional<HTTPURLResponse> response,
                                              std::optional<URLError> error)>;

class URLSession;

class URLSessionDataTask {
 public:
  enum class State { Suspended, Running, Completed };

  URLSessionDataTask(const URLSessionDataTask&) = delete;
  URLSessionDataTask& operator=(const URLSessionDataTask&) = delete;
  ~URLSessionDataTask();

  // Starts the transfer; later calls do nothing. A task of a session that is gone completes
  // with URLErrorCancelled.
  void resume();
  // Ends the task with URLErrorCancelled unless it has completed already.
  void cancel();

  std::uint64_t taskIdentifier() const;
  const URLRequest& originalRequest() const;
  State state() const;
  // Response body bytes received so far, and as the response announced them (-1 while unknown).
  std::int64_t countOfBytesReceived() const;
  std::int64_t countOfBytesExpectedToReceive() const;

  // Filled in just before the completion is called; empty until then.
  URLSessionTaskMetrics metrics() const;

  // The proxy of this task: a URL ("http://host:port", "socks5://...") or none. By default a
  // task uses no proxy at all, whatever the environment says. Set before resume().
  void setProxy(std::optional<std::string> proxyURL);

  // Values the owner attaches to the task and reads back later (e.g. "numberOfFeedbacks").
  void setValue(const std::string& key, std::any value);
  std::any value(const std::string& key) const;

  struct Impl;

 private:
  friend class URLSession;
  explicit URLSessionDataTask(std::shared_ptr<Impl> impl) : impl_(std::move(impl)) {}
  std::shared_ptr<Impl> impl_;
};

class URLSession {
 public:
  explicit URLSession(URLSessionConfiguration configuration = {});
  // Cancels every task still running (their completions are called) and stops the transfer
  // thread. Do not drop the last reference from one of the session's own completions.
  ~URLSession();
  URLSession(const URLSession&) = delete;
  URLSession& operator=(const URLSession&) = delete;

  // What the destructor does, for an owner that is not the last holder: cancels every task still
  // running (their completions are called) and stops the transfer thread. Tasks made afterwards
  // complete with URLErrorCancelled when resumed.
  void invalidateAndCancel();

  // A task for `request`, not yet resumed. The completion runs on `deliverOn` when given (it must
  // outlive the task's completion), else on the session's delegate queue.
  std::shared_ptr<URLSessionDataTask> dataTask(URLRequest request, DataTaskCompletion completion,
                                               SerialQueue* deliverOn = nullptr);

  const URLSessionConfiguration& configuration() const;

  // The response cache: bytes held now, and emptying it. Both 0 / no-ops without a cache.
  std::size_t memoryCacheUsage() const;
  void purgeMemoryCache();

  struct Impl;

 private:
  std::shared_ptr<Impl> impl_;
};

}  // namespace tavix::platform::http
