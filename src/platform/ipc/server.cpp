#include "platform/ipc/server.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <asio/bind_executor.hpp>
#include <asio/post.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/strand.hpp>
#include <deque>

#include "platform/asio_context.h"
#include "platform/log.h"

namespace tavix::platform::ipc {

namespace {

using Strand = asio::strand<asio::io_context::executor_type>;

// One read takes at most this much, so a chatty peer cannot starve the others on the pool.
constexpr std::size_t kReadChunk = 64 * 1024;
constexpr int kReadsPerWakeup = 16;
// Descriptors a peer may leave unclaimed before it is taken for hostile.
constexpr std::size_t kMaxPendingFds = 64;
// Unsent bytes a connection may hold, in frames of the largest size.
constexpr std::size_t kMaxOutboxFrames = 4;

}  // namespace

// ---------------------------------------------------------------------------------------------

struct IpcConnection::Impl {
  Impl(DispatchPool& pool, int fd, std::size_t maxFrame, std::size_t maxUnanswered)
      : strand(asio::make_strand(asioContext(pool))),
        socket(strand, fd),
        decoder(maxFrame),
        maxFrame(maxFrame),
        calls(std::make_shared<Calls>(maxUnanswered)) {}

  // The unanswered calls, shared with their holds, which may outlive the connection.
  struct Calls {
    explicit Calls(std::size_t max) : max(max) {}
    const std::size_t max;
    std::atomic<std::size_t> unanswered{0};
    std::weak_ptr<IpcConnection> owner;
  };
  enum class Delivery { More, Paused, Failed };

  struct Outgoing {
    std::string bytes;
    std::vector<UniqueFd> fds;
    std::size_t offset = 0;
  };

  Strand strand;
  // Waited on and read on `strand` only. Written from whichever thread sends, under writeLock,
  // which the close also takes, so that no write ever reaches a descriptor number reused since.
  asio::posix::stream_descriptor socket;
  FrameDecoder decoder;
  // On `strand`; kept, so that a wake-up costs no allocation. Left uninitialized: only the pages
  // a read writes into become resident, a few kilobytes for a client that sends small calls.
  std::unique_ptr<char[]> readBuffer;
  std::size_t maxFrame;
  std::mutex writeLock;
  std::deque<Outgoing> outbox;  // under writeLock; not empty exactly while `writing`
  std::size_t outboxBytes = 0;
  bool writing = false;  // a wait for the socket to take more is armed or about to be
  std::shared_ptr<Calls> calls;
  bool paused = false;  // not reading: too many calls unanswered
  // Set once by start(); cleared on the queue after the invalidation handler ran, which breaks
  // any reference cycle through the handlers.
  MessageHandler onMessage;
  InvalidationHandler onInvalidated;

  static void armRead(const std::shared_ptr<IpcConnection>& self);
  static void onReadable(const std::shared_ptr<IpcConnection>& self);
  static Delivery deliverFrames(const std::shared_ptr<IpcConnection>& self);
  static void release(const std::shared_ptr<Calls>& calls);
  static void resume(const std::shared_ptr<IpcConnection>& self);
  static void armWrite(const std::shared_ptr<IpcConnection>& self);
  static void flush(const std::shared_ptr<IpcConnection>& self);
  static void close(const std::shared_ptr<IpcConnection>& self);
};

std::shared_ptr<IpcConnection> IpcConnection::make(DispatchPool& pool, UniqueFd fd, PeerCredentials peer,
                                                   std::string queueLabel, Logger& logger,
                                                   std::size_t maxFrameSize, std::size_t maxUnansweredCalls) {
  std::shared_ptr<IpcConnection> c(new IpcConnection(pool, peer, std::move(queueLabel), logger));
  c->impl_ = std::make_unique<Impl>(pool, fd.release(), maxFrameSize, std::max<std::size_t>(1, maxUnansweredCalls));
  c->impl_->calls->owner = c;
  asio::error_code ignored;
  c->impl_->socket.non_blocking(true, ignored);
  return c;
}

IpcConnection::IpcConnection(DispatchPool& pool, PeerCredentials peer, std::string queueLabel, Logger& logger)
    : peer_(peer), queue_(pool, std::move(queueLabel)), logger_(logger) {}

IpcConnection::~IpcConnection() = default;

void IpcConnection::start(MessageHandler onMessage, InvalidationHandler onInvalidated) {
  auto self = shared_from_this();
  asio::post(impl_->strand, [self, m = std::move(onMessage), i = std::move(onInvalidated)]() mutable {
    self->impl_->onMessage = std::move(m);
    self->impl_->onInvalidated = std::move(i);
    if (self->closed_) {
      Impl::close(self);  // already closed before start: still report it once
      return;
    }
    Impl::armRead(self);
  });
}

void IpcConnection::Impl::armRead(const std::shared_ptr<IpcConnection>& self) {
  self->impl_->socket.async_wait(asio::posix::stream_descriptor::wait_read, [self](const asio::error_code& ec) {
    if (ec || self->closed_) {
      close(self);
      return;
    }
    onReadable(self);
  });
}

void IpcConnection::Impl::onReadable(const std::shared_ptr<IpcConnection>& self) {
  Impl& impl = *self->impl_;
  if (!impl.readBuffer) impl.readBuffer.reset(new char[kReadChunk]);
  char* const buffer = impl.readBuffer.get();
  for (int round = 0; round < kReadsPerWakeup; ++round) {
    std::vector<int> fds;
    std::size_t n = 0;
    auto ec = receiveWithFds(impl.socket.native_handle(), buffer, kReadChunk, false, &fds, &n);
    if (!fds.empty()) {
      std::lock_guard lock(self->fdLock_);
      for (int fd : fds) self->receivedFds_.emplace_back(fd);
      if (self->receivedFds_.size() > kMaxPendingFds) {
        self->logger_.error("closing connection from pid {}: {} descriptors left unclaimed", self->peer_.pid,
                            self->receivedFds_.size());
        close(self);
        return;
      }
    }
    if (ec == std::errc::resource_unavailable_try_again || ec == std::errc::operation_would_block) break;
    if (ec || n == 0) {  // an error, or the peer closed its end
      close(self);
      return;
    }
    impl.decoder.append(buffer, n);
    // Paused, the read is not armed again: the peer's further bytes wait in its socket until a
    // call is answered.
    if (deliverFrames(self) != Delivery::More || self->closed_) return;
    if (n < kReadChunk) break;  // drained for now
  }
  armRead(self);
}

IpcConnection::Impl::Delivery IpcConnection::Impl::deliverFrames(const std::shared_ptr<IpcConnection>& self) {
  Impl& impl = *self->impl_;
  while (impl.calls->unanswered.load() < impl.calls->max) {
    if (self->closed_) return Delivery::Failed;
    auto payload = impl.decoder.next();
    if (!payload) {
      if (!impl.decoder.failed()) return Delivery::More;
      self->logger_.error("closing connection from pid {}: frame of {} bytes is over the limit of {}",
                          self->peer_.pid, impl.decoder.rejectedLength(), impl.maxFrame);
      close(self);
      return Delivery::Failed;
    }
    impl.calls->unanswered.fetch_add(1);
    CallHold hold(impl.calls.get(), [calls = impl.calls](void*) { release(calls); });
    Task call = [self, hold = std::move(hold), p = std::move(*payload)]() mutable {
      self->currentCall_ = std::move(hold);
      if (self->impl_->onMessage) self->impl_->onMessage(std::move(p));
      self->currentCall_.reset();
    };
    // Answered here, on the thread that read it, when the connection's queue is free: a call that
    // then waits (for the first bag, for the completion database) hands the reactor over first.
    if (self->queue_.pool().mayAnswerOnReactor()) {
      self->queue_.runHereOrAsync(std::move(call));
    } else {
      self->queue_.async(std::move(call));
    }
  }
  if (!impl.paused) {
    impl.paused = true;
    self->logger_.debug("not reading from pid {}: {} calls unanswered", self->peer_.pid, impl.calls->max);
  }
  return Delivery::Paused;
}

void IpcConnection::Impl::release(const std::shared_ptr<Calls>& calls) {
  // Only the release that brings the count back under the limit can find the reader paused.
  if (calls->unanswered.fetch_sub(1) != calls->max) return;
  if (auto self = calls->owner.lock()) asio::post(self->impl_->strand, [self] { resume(self); });
}

void IpcConnection::Impl::resume(const std::shared_ptr<IpcConnection>& self) {
  Impl& impl = *self->impl_;
  if (!impl.paused || self->closed_) return;
  impl.paused = false;
  if (deliverFrames(self) == Delivery::More) armRead(self);
}

IpcConnection::CallHold IpcConnection::holdCurrentCall() { return currentCall_; }

std::size_t IpcConnection::maxFrameSize() const { return impl_->maxFrame; }

bool IpcConnection::send(std::string payload, std::vector<UniqueFd> fds) {
  if (closed_) return false;
  if (payload.size() > impl_->maxFrame) {
    logger_.error("not sending {} bytes to pid {}: over the frame limit of {}", payload.size(), peer_.pid,
                  impl_->maxFrame);
    return false;
  }
  return sendFrame(encodeFrame(payload), std::move(fds));
}

bool IpcConnection::sendFrame(std::string frame, std::vector<UniqueFd> fds) {
  if (closed_) return false;
  Impl& impl = *impl_;
  const std::size_t payloadSize = frame.size() - std::min(frame.size(), kFrameHeaderSize);
  if (payloadSize > impl.maxFrame) {
    logger_.error("not sending {} bytes to pid {}: over the frame limit of {}", payloadSize, peer_.pid, impl.maxFrame);
    return false;
  }
  std::unique_lock lock(impl.writeLock);
  if (closed_) return false;
  if (impl.writing) {
    // A peer that stops reading must not make us hold its replies for ever.
    if (impl.outboxBytes + frame.size() > kMaxOutboxFrames * impl.maxFrame) {
      logger_.error("closing connection from pid {}: peer does not read, {} bytes waiting", peer_.pid,
                    impl.outboxBytes);
      lock.unlock();
      invalidate();
      return true;
    }
    impl.outboxBytes += frame.size();
    impl.outbox.push_back({std::move(frame), std::move(fds), 0});
    return true;
  }
  // Nothing waits before this frame: write it from this thread, and leave to the connection's
  // strand only what the socket does not take now.
  std::vector<int> raw;
  for (auto& fd : fds) raw.push_back(fd.get());
  std::size_t sent = 0;
  if (sendWithFds(impl.socket.native_handle(), frame, raw, false, &sent)) {
    lock.unlock();
    invalidate();
    return true;
  }
  if (sent == frame.size()) return true;
  if (sent > 0) fds.clear();  // they went with the first byte
  impl.outboxBytes += frame.size();
  impl.outbox.push_back({std::move(frame), std::move(fds), sent});
  impl.writing = true;
  lock.unlock();
  asio::post(impl.strand, [self = shared_from_this()] { Impl::armWrite(self); });
  return true;
}

void IpcConnection::Impl::armWrite(const std::shared_ptr<IpcConnection>& self) {
  if (self->closed_) return;
  self->impl_->socket.async_wait(asio::posix::stream_descriptor::wait_write, [self](const asio::error_code& ec) {
    if (ec || self->closed_) {
      close(self);
      return;
    }
    flush(self);
  });
}

void IpcConnection::Impl::flush(const std::shared_ptr<IpcConnection>& self) {
  Impl& impl = *self->impl_;
  std::unique_lock lock(impl.writeLock);
  while (!impl.outbox.empty()) {
    auto& out = impl.outbox.front();
    std::vector<int> raw;
    for (auto& fd : out.fds) raw.push_back(fd.get());
    std::size_t sent = 0;
    auto ec = sendWithFds(impl.socket.native_handle(), std::string_view(out.bytes).substr(out.offset), raw, false,
                          &sent);
    if (ec) {
      lock.unlock();
      close(self);
      return;
    }
    if (sent > 0) out.fds.clear();  // they went with the first byte
    out.offset += sent;
    if (out.offset < out.bytes.size()) {
      lock.unlock();
      armWrite(self);
      return;
    }
    impl.outboxBytes -= out.bytes.size();
    impl.outbox.pop_front();
  }
  impl.writing = false;
}

void IpcConnection::Impl::close(const std::shared_ptr<IpcConnection>& self) {
  Impl& impl = *self->impl_;
  {
    std::lock_guard lock(impl.writeLock);
    self->closed_ = true;
    if (impl.socket.is_open()) {
      asio::error_code ignored;
      impl.socket.close(ignored);
    }
    impl.outbox.clear();
    impl.outboxBytes = 0;
  }
  // Moved out, so it runs once; it runs after every message already queued, and nothing more is
  // delivered afterwards.
  auto handler = std::move(impl.onInvalidated);
  impl.onInvalidated = nullptr;
  if (!handler) return;
  self->queue_.async([self, handler = std::move(handler)] {
    self->impl_->onMessage = nullptr;
    handler();
    std::lock_guard lock(self->fdLock_);
    self->receivedFds_.clear();
  });
}

void IpcConnection::invalidate() {
  auto self = shared_from_this();
  closed_ = true;
  asio::post(impl_->strand, [self] { Impl::close(self); });
}

std::vector<UniqueFd> IpcConnection::takeReceivedFds(std::size_t count) {
  std::lock_guard lock(fdLock_);
  count = std::min(count, receivedFds_.size());
  std::vector<UniqueFd> out;
  for (std::size_t i = 0; i < count; ++i) out.push_back(std::move(receivedFds_[i]));
  receivedFds_.erase(receivedFds_.begin(), receivedFds_.begin() + static_cast<std::ptrdiff_t>(count));
  return out;
}

// ---------------------------------------------------------------------------------------------

struct IpcListener::Impl : std::enable_shared_from_this<IpcListener::Impl> {
  Impl(DispatchPool& pool, int fd, Logger& logger)
      : pool(pool), strand(asio::make_strand(asioContext(pool))), socket(strand, fd), logger(logger) {}

  DispatchPool& pool;
  Strand strand;
  asio::posix::stream_descriptor socket;
  Logger& logger;
  std::mutex lock;  // guards `handler` and `stopped` against the destructor
  AcceptHandler handler;
  std::string label;
  bool stopped = false;

  void armAccept() {
    auto self = shared_from_this();
    socket.async_wait(asio::posix::stream_descriptor::wait_read, [self](const asio::error_code& ec) {
      // Closed by the destructor; a wait that had already completed can still run after the close.
      if (ec || !self->socket.is_open()) return;
      self->acceptAll();
      self->armAccept();
    });
  }

  void acceptAll() {
    const uid_t me = ::geteuid();
    for (;;) {
      UniqueFd fd(::accept4(socket.native_handle(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
      if (!fd.valid()) {
        if (errno == EINTR || errno == ECONNABORTED) continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK) logger.error("accept failed: {}", std::strerror(errno));
        return;
      }
      PeerCredentials peer;
      if (auto ec = peerCredentials(fd.get(), &peer)) {
        logger.error("refusing connection: no peer credentials: {}", ec.message());
        continue;
      }
      if (peer.uid != me) {
        logger.error("refusing connection from pid {} of uid {}", peer.pid, peer.uid);
        continue;
      }
      std::lock_guard guard(lock);
      if (stopped) return;
      auto connection =
          IpcConnection::make(pool, std::move(fd), peer, label + "." + std::to_string(peer.pid), logger);
      if (handler) handler(connection);
    }
  }
};

std::unique_ptr<IpcListener> IpcListener::listen(DispatchPool& pool, const std::string& path, Logger& logger,
                                                 std::error_code* error) {
  UniqueFd fd;
  if (auto ec = listenAt(path, &fd)) {
    *error = ec;
    return nullptr;
  }
  return std::unique_ptr<IpcListener>(new IpcListener(pool, std::move(fd), path, logger));
}

std::unique_ptr<IpcListener> IpcListener::adopt(DispatchPool& pool, int adoptedFd, Logger& logger,
                                                std::error_code* error) {
  int type = 0;
  socklen_t len = sizeof(type);
  if (::getsockopt(adoptedFd, SOL_SOCKET, SO_TYPE, &type, &len) != 0 || type != SOCK_STREAM) {
    *error = std::make_error_code(std::errc::not_a_socket);
    return nullptr;
  }
  return std::unique_ptr<IpcListener>(new IpcListener(pool, UniqueFd(adoptedFd), "", logger));
}

IpcListener::IpcListener(DispatchPool& pool, UniqueFd fd, std::string path, Logger& logger)
    : path_(std::move(path)), impl_(std::make_shared<Impl>(pool, fd.release(), logger)) {
  asio::error_code ignored;
  impl_->socket.non_blocking(true, ignored);
}

IpcListener::~IpcListener() {
  {
    std::lock_guard guard(impl_->lock);
    impl_->stopped = true;
    impl_->handler = nullptr;
  }
  asio::post(impl_->strand, [impl = impl_] {
    asio::error_code ignored;
    impl->socket.close(ignored);
  });
  if (!path_.empty()) ::unlink(path_.c_str());
}

void IpcListener::resume(AcceptHandler handler, std::string queueLabel) {
  {
    std::lock_guard guard(impl_->lock);
    impl_->handler = std::move(handler);
    impl_->label = std::move(queueLabel);
  }
  asio::post(impl_->strand, [impl = impl_] { impl->armAccept(); });
}

}  // namespace tavix::platform::ipc
