#include "tavix/client.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <cstdlib>
#include <future>
#include <map>
#include <mutex>
#include <thread>

#include "platform/ipc/frame.h"
#include "platform/ipc/unix_socket.h"

namespace tavix::client {

namespace ipc = platform::ipc;

namespace {

Error clientError(ClientErrorCode code, std::string reason) { return {kClientErrorDomain, code, std::move(reason)}; }

// The Impl whose reader runs on this thread, so that blocking from a callback is caught.
thread_local const void* tCurrentReader = nullptr;

using Steady = std::chrono::steady_clock;

}  // namespace

std::string Error::describe() const { return domain + " " + std::to_string(code) + ": " + reason; }

std::string defaultSocketPath() {
  std::string dir;
  if (const char* runtime = std::getenv("XDG_RUNTIME_DIR"); runtime && *runtime) {
    dir = runtime;
  } else {
    dir = "/tmp/tavix-runtime-" + std::to_string(::getuid());
  }
  return dir + "/com.norvel.tavixd/socket";
}

struct Client::Impl : std::enable_shared_from_this<Client::Impl> {
  // One connection. The reader thread and the writers share it; the socket closes when both
  // have let go, so a descriptor number is never reused under a live reader.
  struct Link {
    ipc::UniqueFd fd;
    std::mutex writeLock;
    // Wakes the reader when a call comes due before the time it sleeps until.
    ipc::UniqueFd wake{::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
    Steady::time_point sleepsUntil = Steady::time_point::max();  // guarded by Impl::lock
  };
  struct Pending {
    std::shared_ptr<Link> link;
    DescriptorReply reply;
    Steady::time_point deadline;
  };

  Options options;
  std::mutex lock;
  std::condition_variable readersDone;
  int readers = 0;
  bool closed = false;
  bool everConnected = false;
  std::shared_ptr<Link> link;  // the live connection, if any
  std::map<std::uint64_t, Pending> pending;
  std::uint64_t nextId = 1;
  std::function<void(const proto::BagDidLoad&)> onBag;
  std::function<void(const std::string&)> onDownloaded, onDeleted;

  std::optional<Error> connectLocked() {
    const std::string path = options.socketPath.empty() ? defaultSocketPath() : options.socketPath;
    ipc::UniqueFd fd;
    if (auto ec = ipc::connectTo(path, &fd)) return clientError(kCannotConnect, path + ": " + ec.message());
    auto fresh = std::make_shared<Link>();
    fresh->fd = std::move(fd);
    // The configuration goes first, so that the daemon binds the connection before any call.
    proto::Envelope configure;
    *configure.mutable_configure()->mutable_configuration() = options.configuration;
    const std::uint64_t id = nextId++;
    configure.set_call_id(id);
    std::string bytes = ipc::encodeFrame(configure.SerializeAsString());
    std::size_t sent = 0;
    if (auto ec = ipc::sendWithFds(fresh->fd.get(), bytes, {}, true, &sent)) {
      return clientError(kCannotConnect, "sending the configuration: " + ec.message());
    }
    pending[id] = {fresh,
                   [](const proto::Envelope*, std::vector<int> fds, std::optional<Error>) {
                     for (int fd : fds) ::close(fd);
                   },
                   deadlineFromNow()};
    link = fresh;
    everConnected = true;
    ++readers;
    std::thread([self = shared_from_this(), fresh] { self->readLoop(fresh); }).detach();
    return std::nullopt;
  }

  Steady::time_point deadlineFromNow() const {
    return options.timeoutMs > 0 ? Steady::now() + std::chrono::milliseconds(options.timeoutMs)
                                 : Steady::time_point::max();
  }

  void readLoop(const std::shared_ptr<Link>& l) {
    tCurrentReader = this;
    ipc::FrameDecoder decoder;
    // Uninitialized: only what reads write into becomes resident in the app.
    constexpr std::size_t kChunk = 64 * 1024;
    std::unique_ptr<char[]> buffer(new char[kChunk]);
    // Descriptors arrive with the first byte of their frame; each frame takes as many as it
    // announces, oldest first.
    std::deque<ipc::UniqueFd> received;
    for (;;) {
      pollfd fds[2] = {{l->fd.get(), POLLIN, 0}, {l->wake.get(), POLLIN, 0}};
      if (::poll(fds, 2, millisecondsToNextDeadline(l)) < 0 && errno != EINTR) break;
      if (fds[1].revents & POLLIN) {
        std::uint64_t ignored;
        while (::read(l->wake.get(), &ignored, sizeof ignored) > 0) {
        }
      }
      expireCalls(l);
      if (!(fds[0].revents & (POLLIN | POLLHUP | POLLERR))) continue;
      std::vector<int> passed;
      std::size_t n = 0;
      auto ec = ipc::receiveWithFds(l->fd.get(), buffer.get(), kChunk, true, &passed, &n);
      for (int fd : passed) received.emplace_back(fd);
      if (ec || n == 0) break;
      decoder.append(buffer.get(), n);
      while (auto payload = decoder.next()) dispatch(*payload, received);
      if (decoder.failed()) break;
    }
    finishLink(l);
    tCurrentReader = nullptr;
  }

  // How long the reader may sleep before a call of `l` is due; -1 for as long as it likes.
  int millisecondsToNextDeadline(const std::shared_ptr<Link>& l) {
    std::lock_guard g(lock);
    auto next = Steady::time_point::max();
    for (const auto& [id, call] : pending) {
      if (call.link == l) next = std::min(next, call.deadline);
    }
    l->sleepsUntil = next;
    if (next == Steady::time_point::max()) return -1;
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(next - Steady::now()).count();
    return static_cast<int>(std::clamp<std::int64_t>(left, 0, 60 * 60 * 1000));
  }

  // Fails the calls of `l` whose deadline has passed; a reply that comes later finds nothing.
  void expireCalls(const std::shared_ptr<Link>& l) {
    std::vector<DescriptorReply> expired;
    {
      std::lock_guard g(lock);
      const auto now = Steady::now();
      for (auto it = pending.begin(); it != pending.end();) {
        if (it->second.link == l && it->second.deadline <= now) {
          expired.push_back(std::move(it->second.reply));
          it = pending.erase(it);
        } else {
          ++it;
        }
      }
    }
    for (auto& reply : expired) {
      reply(nullptr, {}, clientError(kTimedOut, "no reply from tavixd in " + std::to_string(options.timeoutMs) + " ms"));
    }
  }

  void dispatch(const std::string& payload, std::deque<ipc::UniqueFd>& received) {
    proto::Envelope in;
    if (!in.ParseFromString(payload)) return;  // nothing to match it with; drop it
    std::vector<ipc::UniqueFd> fds;
    for (std::uint32_t i = 0; i < in.attached_fds() && !received.empty(); ++i) {
      fds.push_back(std::move(received.front()));
      received.pop_front();
    }
    if (in.call_id() == 0) {
      std::unique_lock l(lock);
      auto bag = onBag;
      auto downloaded = onDownloaded;
      auto deleted = onDeleted;
      l.unlock();
      if (in.has_bag_did_load() && bag) bag(in.bag_did_load());
      if (in.has_did_download_resource() && downloaded) downloaded(in.did_download_resource().identifier());
      if (in.has_did_delete_resource() && deleted) deleted(in.did_delete_resource().identifier());
      return;
    }
    DescriptorReply reply;
    {
      std::lock_guard l(lock);
      auto it = pending.find(in.call_id());
      if (it == pending.end()) return;  // a late or duplicate reply: each callback runs once
      reply = std::move(it->second.reply);
      pending.erase(it);
    }
    std::vector<int> raw;
    for (auto& fd : fds) raw.push_back(fd.release());
    if (in.has_call_failed()) {
      reply(nullptr, std::move(raw), Error::fromProto(in.call_failed()));
    } else {
      reply(&in, std::move(raw), std::nullopt);
    }
  }

  void finishLink(const std::shared_ptr<Link>& l) {
    std::vector<DescriptorReply> failed;
    bool wasClosed;
    {
      std::lock_guard g(lock);
      if (link == l) link.reset();
      for (auto it = pending.begin(); it != pending.end();) {
        if (it->second.link == l) {
          failed.push_back(std::move(it->second.reply));
          it = pending.erase(it);
        } else {
          ++it;
        }
      }
      wasClosed = closed;
    }
    for (auto& reply : failed) {
      reply(nullptr, {}, wasClosed ? clientError(kClosed, "client closed")
                               : clientError(kConnectionLost, "connection to tavixd lost"));
    }
    std::lock_guard g(lock);
    --readers;
    readersDone.notify_all();
  }

  void call(proto::Envelope message, DescriptorReply reply) {
    std::unique_lock l(lock);
    if (closed) {
      l.unlock();
      reply(nullptr, {}, clientError(kClosed, "client closed"));
      return;
    }
    if (!link) {
      if (everConnected && !options.reconnect) {
        l.unlock();
        reply(nullptr, {}, clientError(kConnectionLost, "connection to tavixd lost"));
        return;
      }
      if (auto error = connectLocked()) {
        l.unlock();
        reply(nullptr, {}, error);
        return;
      }
    }
    const std::uint64_t id = nextId++;
    message.set_call_id(id);
    auto target = link;
    const auto deadline = deadlineFromNow();
    pending[id] = {target, std::move(reply), deadline};
    const bool sooner = deadline < target->sleepsUntil;
    l.unlock();
    if (sooner) {
      const std::uint64_t one = 1;
      [[maybe_unused]] auto ignored = ::write(target->wake.get(), &one, sizeof one);
    }
    if (!write(target, message)) {
      DescriptorReply failed;
      {
        std::lock_guard g(lock);
        auto it = pending.find(id);
        if (it == pending.end()) return;  // the reader already failed it
        failed = std::move(it->second.reply);
        pending.erase(it);
      }
      failed(nullptr, {}, clientError(kConnectionLost, "cannot send to tavixd"));
    }
  }

  bool write(const std::shared_ptr<Link>& target, const proto::Envelope& message) {
    std::string bytes;
    if (!message.SerializeToString(&bytes) || bytes.size() > ipc::kMaxFrameSize) return false;
    bytes = ipc::encodeFrame(bytes);
    std::lock_guard w(target->writeLock);
    std::size_t sent = 0;
    return !ipc::sendWithFds(target->fd.get(), bytes, {}, true, &sent);
  }

  std::optional<Error> callSync(proto::Envelope message, proto::Envelope* out) {
    if (tCurrentReader == this) return clientError(kProtocol, "blocking call from a reply callback");
    struct Result {
      std::promise<std::optional<Error>> done;
      proto::Envelope reply;
    };
    auto result = std::make_shared<Result>();
    auto future = result->done.get_future();
    call(std::move(message), [result](const proto::Envelope* reply, std::vector<int> fds, std::optional<Error> error) {
      for (int fd : fds) ::close(fd);
      if (reply) result->reply = *reply;
      result->done.set_value(std::move(error));
    });
    // The call's own deadline answers it if the daemon does not.
    auto error = future.get();
    if (!error && out) *out = result->reply;
    return error;
  }
};

Client::Client(Options options) : impl_(std::make_shared<Impl>()) { impl_->options = std::move(options); }

Client::~Client() {
  std::unique_lock l(impl_->lock);
  impl_->closed = true;
  if (impl_->link) ::shutdown(impl_->link->fd.get(), SHUT_RDWR);
  impl_->link.reset();
  if (tCurrentReader == impl_.get()) return;  // destroyed from our own callback: cannot wait
  impl_->readersDone.wait(l, [&] { return impl_->readers == 0; });
}

void Client::call(proto::Envelope message, EnvelopeReply reply) {
  impl_->call(std::move(message), [reply = std::move(reply)](const proto::Envelope* in, std::vector<int> fds,
                                                             std::optional<Error> error) {
    for (int fd : fds) ::close(fd);  // nobody asked for them
    reply(in, std::move(error));
  });
}

void Client::callWithDescriptors(proto::Envelope message, DescriptorReply reply) {
  impl_->call(std::move(message), std::move(reply));
}

void Client::listenToFlusher(std::function<void(int fd, std::optional<Error>)> reply) {
  proto::Envelope message;
  message.mutable_listen_to_flusher();
  callWithDescriptors(std::move(message), [reply = std::move(reply)](const proto::Envelope* in, std::vector<int> fds,
                                                                     std::optional<Error> error) {
    int endpoint = -1;
    if (!error && !in->has_listen_to_flusher_reply()) error = clientError(kProtocol, "unexpected reply");
    if (!error && in->listen_to_flusher_reply().has_error()) error = Error::fromProto(in->listen_to_flusher_reply().error());
    if (!error && (!in->listen_to_flusher_reply().has_endpoint() || fds.empty())) {
      error = clientError(kProtocol, "reply without an endpoint");
    }
    if (!error) {
      endpoint = fds.front();
      fds.erase(fds.begin());
    }
    for (int fd : fds) ::close(fd);
    reply(endpoint, std::move(error));
  });
}

void Client::fileHandleForResource(const std::string& identifier,
                                   std::function<void(int fd, std::string attributesPlist, std::optional<Error>)> reply) {
  proto::Envelope message;
  message.mutable_file_handle_and_attributes_for_resource()->set_identifier(identifier);
  callWithDescriptors(std::move(message), [reply = std::move(reply)](const proto::Envelope* in, std::vector<int> fds,
                                                                     std::optional<Error> error) {
    int file = -1;
    std::string attributes;
    if (!error && !in->has_file_handle_and_attributes_for_resource_reply()) {
      error = clientError(kProtocol, "unexpected reply");
    }
    const auto* r = error ? nullptr : &in->file_handle_and_attributes_for_resource_reply();
    if (r && r->has_error()) error = Error::fromProto(r->error());
    if (!error && (!r->has_file_handle() || fds.empty())) error = clientError(kProtocol, "reply without a file");
    if (!error) {
      file = fds.front();
      fds.erase(fds.begin());
      attributes = r->attributes_plist();
    }
    for (int fd : fds) ::close(fd);
    reply(file, std::move(attributes), std::move(error));
  });
}

bool Client::post(proto::Envelope message) {
  std::shared_ptr<Impl::Link> target;
  {
    std::lock_guard l(impl_->lock);
    if (impl_->closed) return false;
    if (!impl_->link && (impl_->everConnected && !impl_->options.reconnect)) return false;
    if (!impl_->link && impl_->connectLocked()) return false;
    target = impl_->link;
  }
  message.set_call_id(0);
  return impl_->write(target, message);
}

std::optional<Error> Client::callSync(proto::Envelope message, proto::Envelope* reply) {
  return impl_->callSync(std::move(message), reply);
}

std::optional<Error> Client::connect() {
  {
    std::lock_guard l(impl_->lock);
    if (impl_->closed) return clientError(kClosed, "client closed");
    if (impl_->link) return std::nullopt;
  }
  // A configuration the daemon refuses closes the connection, so a round trip after it tells.
  proto::Envelope ping;
  ping.mutable_list_sessions();
  auto error = callSync(std::move(ping), nullptr);
  if (error && error->domain == kClientErrorDomain) return error;
  return std::nullopt;  // the daemon answered (even with its own error): we are configured
}

void Client::request(const proto::TVXRequest& request, RequestReply reply) {
  proto::Envelope message;
  *message.mutable_request()->mutable_request() = request;
  const std::uint64_t queryId = request.query_id();
  call(std::move(message), [reply = std::move(reply), queryId](const proto::Envelope* in, std::optional<Error> error) {
    if (error) return reply(queryId, std::nullopt, error);
    if (!in->has_request_reply()) return reply(queryId, std::nullopt, clientError(kProtocol, "unexpected reply"));
    const auto& r = in->request_reply();
    reply(r.query_id(), r.has_reply() ? std::optional(r.reply()) : std::nullopt,
          r.has_error() ? std::optional(Error::fromProto(r.error())) : std::nullopt);
  });
}

void Client::bag(std::function<void(std::optional<proto::TVXBagData>, std::optional<Error>)> reply) {
  proto::Envelope message;
  message.mutable_bag();
  call(std::move(message), [reply = std::move(reply)](const proto::Envelope* in, std::optional<Error> error) {
    if (error) return reply(std::nullopt, error);
    if (!in->has_bag_reply()) return reply(std::nullopt, clientError(kProtocol, "unexpected reply"));
    const auto& r = in->bag_reply();
    reply(r.has_bag() ? std::optional(r.bag()) : std::nullopt,
          r.has_error() ? std::optional(Error::fromProto(r.error())) : std::nullopt);
  });
}

void Client::notify(const std::string& eventName, std::function<void(std::optional<Error>)> reply) {
  proto::Envelope message;
  message.mutable_notify()->set_name(eventName);
  call(std::move(message), [reply = std::move(reply)](const proto::Envelope* in, std::optional<Error> error) {
    if (error) return reply(error);
    if (!in->has_notify_reply()) return reply(clientError(kProtocol, "unexpected reply"));
    reply(in->notify_reply().has_error() ? std::optional(Error::fromProto(in->notify_reply().error()))
                                         : std::nullopt);
  });
}

void Client::runActivity(const std::string& name, std::function<void(std::optional<Error>)> reply) {
  proto::Envelope message;
  message.mutable_run_activity()->set_name(name);
  call(std::move(message), [reply = std::move(reply)](const proto::Envelope* in, std::optional<Error> error) {
    if (error) return reply(error);
    if (!in->has_run_activity_reply()) return reply(clientError(kProtocol, "unexpected reply"));
    const auto& r = in->run_activity_reply();
    reply(r.has_error() ? std::optional(Error::fromProto(r.error())) : std::nullopt);
  });
}

namespace {
template <typename Start>
std::optional<Error> waitFor(const void* impl, Start start) {
  if (tCurrentReader == impl) return clientError(kProtocol, "blocking call from a reply callback");
  auto done = std::make_shared<std::promise<std::optional<Error>>>();
  auto future = done->get_future();
  start([done](std::optional<Error> error) { done->set_value(std::move(error)); });
  return future.get();  // the call's deadline answers it if the daemon does not
}
}  // namespace

std::optional<Error> Client::notifySync(const std::string& eventName) {
  return waitFor(impl_.get(), [&](auto cb) { notify(eventName, cb); });
}

std::optional<Error> Client::runActivitySync(const std::string& name) {
  return waitFor(impl_.get(), [&](auto cb) { runActivity(name, cb); });
}

void Client::setBagDidLoadHandler(std::function<void(const proto::BagDidLoad&)> handler) {
  std::lock_guard l(impl_->lock);
  impl_->onBag = std::move(handler);
}

void Client::setResourceHandlers(std::function<void(const std::string&)> downloaded,
                                 std::function<void(const std::string&)> deleted) {
  std::lock_guard l(impl_->lock);
  impl_->onDownloaded = std::move(downloaded);
  impl_->onDeleted = std::move(deleted);
}

bool Client::isConnected() const {
  std::lock_guard l(impl_->lock);
  return impl_->link != nullptr;
}

}  // namespace tavix::client
