#include "delivery/flusher_ipc.h"

#include <sys/socket.h>
#include <unistd.h>

#include <atomic>

#include "core/logging.h"
#include "feedback/tavix_feedback.h"
#include "platform/defaults.h"
#include "platform/ipc/server.h"
#include "tavix_proto/flusher.pb.h"

namespace tavix {

namespace {

platform::Logger& flusherLog() { return TavixLogForCategory(TavixLoggingCategoryFlusher); }
platform::Logger& sessionLog() { return TavixLogForCategory(TavixLoggingCategorySession); }

constexpr const char* kFlushDisabledKey = "TVXFeedbackFlushDisabled";

std::string describe(const std::shared_ptr<platform::ipc::IpcConnection>& remote) {
  if (!remote) return "(null)";
  return "<tool connection pid " + std::to_string(remote->peer().pid) + ">";
}

void send(const std::shared_ptr<platform::ipc::IpcConnection>& remote, const proto::FlusherMessage& message) {
  if (!remote) return;
  std::string bytes;
  if (!message.SerializeToString(&bytes) || !remote->send(std::move(bytes))) {
    flusherLog().error("remote proxy error: {}", "cannot send to " + describe(remote));
  }
}

}  // namespace

std::shared_ptr<TavixFlusherIPC> TavixFlusherIPC::create(Environment env) {
  auto channel = std::shared_ptr<TavixFlusherIPC>(new TavixFlusherIPC(std::move(env)));
  flusherLog().debug("started accepting connections :{}", "socket pairs");
  return channel;
}

TavixFlusherIPC::TavixFlusherIPC(Environment env)
    : env_(std::move(env)), flusherIpcQueue_(*env_.pool, "com.norvel.tavixd.flusherIPCQueue") {}

TavixFlusherIPC::~TavixFlusherIPC() {
  for (const auto& connection : connections_) connection->invalidate();
  flusherLog().notice("stopped listening for TVXFlusherListener connections");
}

platform::ipc::UniqueFd TavixFlusherIPC::endpoint() {
  int fds[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) {
    flusherLog().error("remote proxy error: {}", std::error_code(errno, std::generic_category()).message());
    return {};
  }
  accept(platform::ipc::UniqueFd(fds[0]));
  return platform::ipc::UniqueFd(fds[1]);
}

void TavixFlusherIPC::accept(platform::ipc::UniqueFd fd) {
  platform::ipc::PeerCredentials peer;
  platform::ipc::peerCredentials(fd.get(), &peer);
  auto remote = platform::ipc::IpcConnection::make(*env_.pool, std::move(fd), peer,
                                                   "com.norvel.tavixd.flusherIPC.connection", flusherLog());
  std::weak_ptr<TavixFlusherIPC> weak = weak_from_this();
  std::weak_ptr<platform::ipc::IpcConnection> weakRemote = remote;
  flusherIpcQueue_.async([self = shared_from_this(), remote] {
    self->remoteObject_ = remote;  // a newer tool replaces an older one
    self->connections_.push_back(remote);
  });
  remote->start(
      [weak](std::string payload) {
        if (auto self = weak.lock()) self->handleMessage(payload);
      },
      [weak, weakRemote] {
        auto self = weak.lock();
        auto remote = weakRemote.lock();
        if (!self || !remote) return;
        flusherLog().notice("listener invalidated");
        self->removeRemote(remote);
      });
}

void TavixFlusherIPC::removeRemote(const Remote& remote) {
  flusherIpcQueue_.async([self = shared_from_this(), remote] {
    if (self->receivingStreamListener_ == remote) {
      self->receivingStreamListener_.reset();
      self->hasReceivingStreamListener_ = false;
      flusherLog().notice("Removed receiving stream listener");
    }
    if (self->sendingStreamListener_ == remote) {
      self->sendingStreamListener_.reset();
      flusherLog().notice("Removed sending stream listener");
    }
    if (self->remoteObject_ == remote) {
      self->remoteObject_.reset();
      flusherLog().notice("Removed remote listener");
    }
    std::erase(self->connections_, remote);
  });
}

void TavixFlusherIPC::handleMessage(const std::string& payload) {
  proto::FlusherMessage message;
  if (!message.ParseFromString(payload) || !message.has_initiate_connection()) {
    flusherLog().error("remote proxy error: {}", "unexpected message on the flusher channel");
    return;
  }
  initiateConnectionWithIntent(message.initiate_connection().intent());
}

void TavixFlusherIPC::sendDataToReceivingStreamListener(const proto::CTTavixFeedback& feedback) {
  // Every record passes here: with nobody listening, it costs no copy and no hop.
  if (!hasReceivingStreamListener_.load()) return;
  flusherIpcQueue_.async([self = shared_from_this(), feedback] {
    if (!self->receivingStreamListener_) return;
    const std::string description = feedbackDescription(feedback);
    if (description.empty()) return;
    proto::FlusherMessage message;
    message.mutable_received_feedback_description()->set_description(description);
    send(self->receivingStreamListener_, message);
  });
}

void TavixFlusherIPC::sendDataToSendingStreamListener(std::vector<std::string> data) {
  flusherIpcQueue_.async([self = shared_from_this(), data = std::move(data)] {
    if (!self->sendingStreamListener_) return;
    proto::FlusherMessage message;
    for (const auto& body : data) message.mutable_flushed_data()->add_data(body);
    send(self->sendingStreamListener_, message);
  });
}

void TavixFlusherIPC::sendWorkDone(const Remote& remote) {
  proto::FlusherMessage message;
  message.mutable_work_done();
  send(remote, message);
}

void TavixFlusherIPC::initiateConnectionWithIntent(std::uint64_t intent) {
  flusherIpcQueue_.async([self = shared_from_this(), intent] {
    switch (intent) {
      case kSubscribeToFlushedData:
        self->sendingStreamListener_ = self->remoteObject_;
        flusherLog().notice("new listener for flusher client sessions, delegate: {}", describe(self->remoteObject_));
        break;
      case kSubscribeToFeedback:
        self->receivingStreamListener_ = self->remoteObject_;
        self->hasReceivingStreamListener_ = true;
        flusherLog().notice("new listener for client feedbacks, delegate: {}", describe(self->remoteObject_));
        break;
      case kStopFlushing:
        flusherLog().notice("flushing stopped; dump command will start flushing again");
        self->env_.defaults->setObject(kFlushDisabledKey, platform::PropertyValue(true));
        self->env_.defaults->synchronize();
        sendWorkDone(self->remoteObject_);
        break;
      case kDump:
        self->dump();
        break;
      default:
        flusherLog().notice("Unsupported command yet: {}", intent);
        break;
    }
  });
}

void TavixFlusherIPC::dump() {
  flusherIpcQueue_.assertCurrent("TavixFlusherIPC::dump");
  if (!sendingStreamListener_) {
    flusherLog().notice("no listener for sending stream at dump time, setting current remote as listener");
    sendingStreamListener_ = remoteObject_;
  }
  flusherLog().notice("new listener for flusher client sessions, delegate: {}", describe(sendingStreamListener_));
  auto defaults = env_.defaults;
  if (!env_.getClientConnections) {
    flusherLog().notice("Can't get client connections. Flushed nothing.");
    defaults->removeObject(kFlushDisabledKey);
    sendWorkDone(remoteObject_);
    return;
  }
  std::weak_ptr<TavixFlusherIPC> weak = weak_from_this();
  auto group = std::make_shared<platform::DispatchGroup>(flusherIpcQueue_, [weak] {
    auto self = weak.lock();
    if (!self) return;
    sessionLog().notice("dump command complete, calling -workDone");
    sendWorkDone(self->remoteObject_);
  });
  for (const auto& connection : env_.getClientConnections()) {
    group->enter();
    const std::string agent = connection.userAgent;
    connection.flushSession([flush = env_.flushFeedback, group, agent, defaults] {
      sessionLog().notice("session flushed because of dump command {}", agent);
      flush([group, defaults] {
        defaults->removeObject(kFlushDisabledKey);
        group->leave();
      });
    });
    // One flush closes the shared session of every client.
    if (env_.sharedSession) break;
  }
  group->leave();
}

}  // namespace tavix
