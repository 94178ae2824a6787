#include "daemon/client_connection.h"

#include "core/assembly.h"
#include "core/logging.h"
#include "core/names.h"
#include "delivery/flusher_ipc.h"
#include "network/user_agent.h"
#include "platform/activity.h"
#include "platform/ipc/launch_events.h"
#include "platform/ipc/server.h"
#include "platform/notification_center.h"
#include "tavix_proto/ipc.pb.h"

namespace tavix {

namespace {

constexpr const char* kNotifyStream = "com.norvel.notifyd.matching";

platform::Logger& connectionLog() { return TavixLogForCategory(TavixLoggingCategoryConnection); }
platform::Logger& sessionLog() { return TavixLogForCategory(TavixLoggingCategorySession); }

void setError(proto::TVXError* error, std::int64_t code, const std::string& reason) {
  error->set_domain(kTVXErrorDomain);
  error->set_code(code);
  error->set_reason(reason);
}

}  // namespace

ClientConnection::ClientConnection(Assembly& assembly, std::shared_ptr<platform::ipc::IpcConnection> connection,
                                   platform::ipc::LaunchEventRegistry* launchEvents)
    : assembly_(assembly), connection_(std::move(connection)), launchEvents_(launchEvents) {}

ClientConnection::~ClientConnection() {
  idleTimer_.cancel();
  closeTransaction();
}

void ClientConnection::start() {
  if (assembly_.notificationCenter) {
    std::weak_ptr<ClientConnection> weak = weak_from_this();
    downloadObserver_ = assembly_.notificationCenter->addObserver(
        kTVXFileDownloadCompletedNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
          if (auto self = weak.lock()) self->relayResourceNotification(n, true);
        });
    deleteObserver_ = assembly_.notificationCenter->addObserver(
        kTVXFileDeletedNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
          if (auto self = weak.lock()) self->relayResourceNotification(n, false);
        });
  }
  openOrExtendTransaction();
}

void ClientConnection::relayResourceNotification(const platform::Notification& notification, bool downloaded) {
  auto it = notification.userInfo.find("identifier");
  if (it == notification.userInfo.end() || !it->second.string()) return;
  proto::Envelope out;
  if (downloaded) {
    out.mutable_did_download_resource()->set_identifier(*it->second.string());
  } else {
    out.mutable_did_delete_resource()->set_identifier(*it->second.string());
  }
  // Off the poster's thread; the connection is held weakly, so a client gone meanwhile is skipped.
  std::weak_ptr<platform::ipc::IpcConnection> weak = connection_;
  assembly_.dispatchPool->post([weak, bytes = out.SerializeAsString()]() mutable {
    if (auto connection = weak.lock()) connection->send(std::move(bytes));
  });
}

void ClientConnection::invalidated() {
  downloadObserver_.reset();
  deleteObserver_.reset();
  idleTimer_.cancel();
  closeTransaction();
}

void ClientConnection::openOrExtendTransaction() {
  idleTimer_.cancel();
  if (assembly_.clock) {
    std::weak_ptr<ClientConnection> weak = weak_from_this();
    idleTimer_ = assembly_.clock->after(platform::seconds(kIdleTransactionSeconds), connection_->queue(), [weak] {
      auto self = weak.lock();
      if (!self) return;
      connectionLog().debug("timing out idle ipc transaction");
      self->closeTransaction();
    });
  }
  if (!transactionOpen_.exchange(true) && assembly_.transactions) {
    std::lock_guard lock(transactionLock_);
    transaction_ = assembly_.transactions->begin("com.norvel.tavixd.ipc");
  }
}

void ClientConnection::closeTransaction() {
  if (!transactionOpen_.exchange(false)) return;
  std::lock_guard lock(transactionLock_);
  transaction_.reset();
}

void ClientConnection::send(std::uint64_t callId, proto::Envelope& out) {
  out.set_call_id(callId);
  std::string bytes;
  if (!out.SerializeToString(&bytes)) {
    connectionLog().error("cannot serialise reply to call {}", callId);
    return;
  }
  connection_->send(std::move(bytes));
}

void ClientConnection::handleMessage(const std::string& payload) {
  openOrExtendTransaction();
  const pid_t pid = connection_->peer().pid;
  proto::Envelope in;
  if (!in.ParseFromString(payload)) {
    connectionLog().error("malformed message of {} bytes from pid {}", payload.size(), pid);
    return;
  }
  // Descriptors the daemon does not take are closed here rather than left to pile up.
  if (in.attached_fds() > 0) connection_->takeReceivedFds(in.attached_fds());

  const std::uint64_t callId = in.call_id();
  proto::Envelope out;
  auto notAvailable = [&](proto::TVXError* error) { setError(error, 500, "not available"); };

  switch (in.message_case()) {
    case proto::Envelope::kConfigure:
      configure(callId, in);
      return;
    case proto::Envelope::kBag:
      notAvailable(out.mutable_bag_reply()->mutable_error());
      break;
    case proto::Envelope::kRequest: {
      if (in.request().request().kind_case() == proto::TVXRequest::KIND_NOT_SET) {
        // A kind we do not route gets no reply at all, as a class we do not know would.
        connectionLog().error("request of unknown kind from pid {}", pid);
        return;
      }
      auto* reply = out.mutable_request_reply();
      reply->set_query_id(in.request().request().query_id());
      notAvailable(reply->mutable_error());
      break;
    }
    case proto::Envelope::kFeedback:
      notAvailable(out.mutable_feedback_reply()->mutable_error());
      break;
    case proto::Envelope::kListenToFlusher: {
      // The tool's end of a fresh flusher channel rides with the reply.
      auto* reply = out.mutable_listen_to_flusher_reply();
      platform::ipc::UniqueFd endpoint;
      if (assembly_.flusherIPCListener) endpoint = assembly_.flusherIPCListener->endpoint();
      if (!endpoint.valid()) {
        notAvailable(reply->mutable_error());
        break;
      }
      if (callId == 0) return;
      reply->set_has_endpoint(true);
      out.set_attached_fds(1);
      out.set_call_id(callId);
      std::vector<platform::ipc::UniqueFd> fds;
      fds.push_back(std::move(endpoint));
      connection_->send(out.SerializeAsString(), std::move(fds));
      return;
    }
    case proto::Envelope::kListSessions:
      notAvailable(out.mutable_list_sessions_reply()->mutable_error());
      break;
    case proto::Envelope::kFileHandleAndAttributesForResource:
      notAvailable(out.mutable_file_handle_and_attributes_for_resource_reply()->mutable_error());
      break;
    case proto::Envelope::kGetImageMap:
      notAvailable(out.mutable_get_image_map_reply()->mutable_error());
      break;
    case proto::Envelope::kReportFeedbackPayloadData:
    case proto::Envelope::kClearEngagedCompletions:
    case proto::Envelope::kAddCompletion:
    case proto::Envelope::kUpdateParameters:
      // One-way messages whose receivers are not part of this daemon yet.
      connectionLog().debug("message {} from pid {} dropped: not available", static_cast<int>(in.message_case()),
                            pid);
      return;
    case proto::Envelope::kNotify: {
      const std::string stream = in.notify().stream().empty() ? kNotifyStream : in.notify().stream();
      auto* reply = out.mutable_notify_reply();
      reply->set_delivered(launchEvents_ && launchEvents_->deliver(stream, in.notify().name()));
      if (!reply->delivered()) setError(reply->mutable_error(), 404, "no handler for stream " + stream);
      break;
    }
    case proto::Envelope::kRunActivity: {
      auto* reply = out.mutable_run_activity_reply();
      const std::string& name = in.run_activity().name();
      if (!assembly_.activityScheduler || !assembly_.activityScheduler->state(name)) {
        setError(reply->mutable_error(), 404, "no activity " + name);
      } else if (!assembly_.activityScheduler->runNow(name)) {
        setError(reply->mutable_error(), 500, "activity " + name + " is running");
      }
      break;
    }
    default:
      connectionLog().error("unknown message {} from pid {}", static_cast<int>(in.message_case()), pid);
      if (callId == 0) return;
      setError(out.mutable_call_failed(), 500, "unknown message");
      break;
  }
  if (callId == 0) return;  // a call without an id cannot be answered
  send(callId, out);
}

void ClientConnection::configure(std::uint64_t callId, const proto::Envelope& in) {
  const auto& config = in.configure().configuration();
  sessionLog().notice("client configuration {{identifier: {}, userAgent: {}}}", config.identifier(),
                      config.user_agent());
  if (configuration_ && configuration_->identifier != config.identifier()) {
    // The first identifier keeps the connection; a client cannot switch identities mid-way.
    sessionLog().fault("session identifier must match");
  } else if (config.identifier().empty()) {
    sessionLog().fault("configuration requires identifier");
  } else if (config.user_agent().empty()) {
    sessionLog().fault("configuration requires userAgent");
  } else {
    configuration_ = Configuration{config.identifier(), config.user_agent()};
    userAgent_ = createUserAgentString(config.user_agent(), DeviceInformation(assembly_.userDefaults.get()))
                     .value_or(config.user_agent());
  }
  if (!configuration_) {
    // No reply at all: the client learns of it by the closed connection.
    sessionLog().fault("invalid configuration, closing connection");
    connection_->invalidate();
    return;
  }
  proto::Envelope out;
  out.mutable_configure_reply()->set_has_endpoint(false);
  if (callId != 0) send(callId, out);
}

}  // namespace tavix
