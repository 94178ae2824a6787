#include "daemon/client_connection.h"

#include <fmt/format.h>

#include <cmath>

#include "bagview/tvx_bag.h"
#include "cache/query_cache.h"
#include "cache/engaged_completion_cache.h"
#include "core/logging.h"
#include "core/names.h"
#include "daemon/wire_records.h"
#include "delivery/flusher_ipc.h"
#include "feedback/client_session.h"
#include "feedback/client_session_manager.h"
#include "network/locale_context.h"
#include "network/request_factory.h"
#include "network/tracing.h"
#include "bagview/user_agent.h"
#include "platform/activity.h"
#include "platform/defaults.h"
#include "platform/http/url_request.h"
#include "platform/ipc/launch_events.h"
#include "platform/ipc/server.h"
#include "platform/json_value.h"
#include "platform/notification_center.h"
#include "query/client_state.h"
#include "query/client_state_manager.h"
#include "resources/download_manager.h"
#include "tavix_proto/ipc.pb.h"

namespace tavix {

namespace {

constexpr const char* kNotifyStream = "com.norvel.notify.matching";

platform::Logger& connectionLog() { return TavixLogForCategory(TavixLoggingCategoryConnection); }
platform::Logger& sessionLog() { return TavixLogForCategory(TavixLoggingCategorySession); }
platform::Logger& bagLog() { return TavixLogForCategory(TavixLoggingCategoryBag); }

// Kernel trace points stand in as debug lines on the Request category when tracing is on.
void trace(std::uint32_t code) {
  if (TVXTraceEnabled) TavixLogForCategory(TavixLoggingCategoryRequest).debug("trace 0x{:08x}", code);
}

// The trace codes around each traced query kind.
enum TVXTraceCode : std::uint32_t {
  TVXTraceCodeSearchStart = 0x2b000004,
  TVXTraceCodeSearchEnd = 0x2b000008,
  TVXTraceCodeCardStart = 0x2b00000c,
  TVXTraceCodeCardEnd = 0x2b000010,
  TVXTraceCodeZeroKeywordStart = 0x2b00001c,
  TVXTraceCodeZeroKeywordEnd = 0x2b000020,
  TVXTraceCodeFeedbackStart = 0x2b000024,
  TVXTraceCodeFeedbackEnd = 0x2b000028,
  TVXTraceCodeLookupStart = 0x2b00002c,
  TVXTraceCodeLookupEnd = 0x2b000030,
};

struct TraceCodes {
  std::uint32_t start = 0;
  std::uint32_t end = 0;
};

TraceCodes traceCodesFor(proto::TVXRequest::KindCase kind) {
  switch (kind) {
    case proto::TVXRequest::kSearch: return {TVXTraceCodeSearchStart, TVXTraceCodeSearchEnd};
    case proto::TVXRequest::kCard: return {TVXTraceCodeCardStart, TVXTraceCodeCardEnd};
    case proto::TVXRequest::kZeroKeyword: return {TVXTraceCodeZeroKeywordStart, TVXTraceCodeZeroKeywordEnd};
    case proto::TVXRequest::kLookup: return {TVXTraceCodeLookupStart, TVXTraceCodeLookupEnd};
    default: return {};
  }
}

// The display scale of the device when a client does not say: "TVXMainScreenScale", else 1.
double mainScreenScale(const platform::UserDefaults* defaults) {
  const double scale = defaults ? defaults->doubleForKey("TVXMainScreenScale") : 0;
  return scale > 0 ? scale : 1.0;
}

// The keyboard's input mode when a client does not say: the keyboard preference
// ("TVXKeyboardInputMode"), else the current locale, which is the first input mode it enables.
std::string defaultKeyboardInputMode(const platform::UserDefaults* defaults) {
  if (defaults) {
    if (auto mode = defaults->stringForKey("TVXKeyboardInputMode"); mode && !mode->empty()) return *mode;
  }
  return TVXCurrentLocaleSettings(defaults).locale;
}

// `message` serialized straight into a frame, header in place, so that it is never copied again.
// `size` is the message's ByteSizeLong(), taken just before.
std::string frameOf(const google::protobuf::MessageLite& message, std::size_t size) {
  std::string frame = platform::ipc::frameWithRoom(size);
  message.SerializeWithCachedSizesToArray(reinterpret_cast<std::uint8_t*>(frame.data() + platform::ipc::kFrameHeaderSize));
  return frame;
}

std::string frameOf(const google::protobuf::MessageLite& message) { return frameOf(message, message.ByteSizeLong()); }

// Sends one frame to the client; a frame that cannot go (the client has gone, or it is over the
// size limit) is the remote proxy's error, logged and otherwise dropped.
void sendToClient(platform::ipc::IpcConnection& connection, std::string frame,
                  std::vector<platform::ipc::UniqueFd> fds = {}) {
  if (connection.sendFrame(std::move(frame), std::move(fds))) return;
  connectionLog().error("(pid:{}) remote proxy error: {}", connection.peer().pid,
                        connection.isValid() ? "message too large" : "connection invalidated");
}

// Answers `callId` with `out` and `fd` attached; a message without a call id gets no answer.
void answerWithDescriptor(platform::ipc::IpcConnection& connection, std::uint64_t callId, proto::Envelope& out,
                          platform::ipc::UniqueFd fd) {
  if (callId == 0) return;
  out.set_attached_fds(1);
  out.set_call_id(callId);
  std::vector<platform::ipc::UniqueFd> fds;
  fds.push_back(std::move(fd));
  sendToClient(connection, frameOf(out), std::move(fds));
}

void setError(proto::TVXError* error, std::int64_t code, const std::string& reason) {
  error->set_domain(kTVXErrorDomain);
  error->set_code(code);
  error->set_reason(reason);
}

// A client's string as a log line may carry it: control characters as \xNN, so that a value
// cannot forge lines of its own.
std::string printable(std::string_view text) {
  std::string out;
  for (char c : text) {
    const auto u = static_cast<unsigned char>(c);
    if (u < 0x20 || u == 0x7f) {
      out += fmt::format("\\x{:02x}", u);
    } else {
      out += c;
    }
  }
  return out;
}

// The answer to `callId` as a frame the connection will take: an answer too large for a frame
// becomes a call_failed that says so, so that the caller still hears back once.
std::string answerFrame(const platform::ipc::IpcConnection& connection, std::uint64_t callId, proto::Envelope& out) {
  out.set_call_id(callId);
  const std::size_t size = out.ByteSizeLong();
  if (size <= connection.maxFrameSize()) return frameOf(out, size);
  const std::string reason =
      fmt::format("reply of {} bytes is over the frame limit of {} bytes", size, connection.maxFrameSize());
  connectionLog().error("answering call {} from pid {} with an error: {}", callId, connection.peer().pid, reason);
  proto::Envelope failed;
  failed.set_call_id(callId);
  setError(failed.mutable_call_failed(), 500, reason);
  return frameOf(failed);
}

}  // namespace

// A call answered later, off the connection's queue. It is answered once: a second answer is
// dropped, and a call whose last reference goes without an answer gets an error, so no caller
// waits for ever. Until then it counts among the connection's unanswered calls, which bound how
// much a client can have the daemon hold for it.
class ClientConnection::PendingCall {
 public:
  // On the connection's queue, inside the handler of the call.
  PendingCall(const std::shared_ptr<platform::ipc::IpcConnection>& connection, std::uint64_t callId)
      : connection_(connection), callId_(callId), hold_(connection->holdCurrentCall()) {}
  ~PendingCall() {
    if (answered_.load() || callId_ == 0) return;
    connectionLog().fault("call {} ended without an answer", callId_);
    proto::Envelope failed;
    setError(failed.mutable_call_failed(), 500, "no answer");
    if (auto connection = connection_.lock()) sendToClient(*connection, answerFrame(*connection, callId_, failed));
  }
  PendingCall(const PendingCall&) = delete;
  PendingCall& operator=(const PendingCall&) = delete;

  // Safe from any thread.
  void answer(proto::Envelope& out) {
    if (answered_.exchange(true)) {
      connectionLog().fault("second answer to call {} dropped", callId_);
      return;
    }
    if (auto connection = connection_.lock(); connection && callId_ != 0) {
      sendToClient(*connection, answerFrame(*connection, callId_, out));
    }
    hold_.reset();
  }

 private:
  std::weak_ptr<platform::ipc::IpcConnection> connection_;
  const std::uint64_t callId_;
  std::atomic<bool> answered_{false};
  platform::ipc::IpcConnection::CallHold hold_;
};

ClientConnection::ClientConnection(std::shared_ptr<const Environment> env,
                                   std::shared_ptr<platform::ipc::IpcConnection> connection)
    : env_(std::move(env)), connection_(std::move(connection)) {}

ClientConnection::~ClientConnection() {
  idleTimer_.cancel();
  closeTransaction(false);
}

void ClientConnection::start() {
  std::weak_ptr<ClientConnection> weak = weak_from_this();
  downloadObserver_ = env_->center->addObserver(
      kTVXFileDownloadCompletedNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        if (auto self = weak.lock()) self->relayResourceNotification(n, true);
      });
  deleteObserver_ = env_->center->addObserver(
      kTVXFileDeletedNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        if (auto self = weak.lock()) self->relayResourceNotification(n, false);
      });
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
  env_->pool->post([weak, frame = frameOf(out)]() mutable {
    if (auto connection = weak.lock()) sendToClient(*connection, std::move(frame));
  });
}

void ClientConnection::invalidated() {
  downloadObserver_.reset();
  deleteObserver_.reset();
  bagObserver_.reset();
  idleTimer_.cancel();
  closeTransaction(false);
}

void ClientConnection::openOrExtendTransaction() {
  // A message only moves the mark; the one armed timer looks at it when it fires, so that a
  // keystroke does not cost a timer of its own.
  lastMessage_ = env_->clock->now();
  if (!idleTimerArmed_) armIdleTimer(platform::seconds(kIdleTransactionSeconds));
  if (!transactionOpen_.exchange(true)) {
    std::lock_guard lock(transactionLock_);
    transaction_ = env_->transactions->begin("com.norvel.tavixd.ipc");
  }
}

void ClientConnection::armIdleTimer(platform::Duration delay) {
  idleTimerArmed_ = true;
  std::weak_ptr<ClientConnection> weak = weak_from_this();
  idleTimer_ = env_->clock->after(delay, connection_->queue(), [weak] {
    auto self = weak.lock();
    if (!self) return;
    self->idleTimerArmed_ = false;
    const auto limit = platform::seconds(kIdleTransactionSeconds);
    const auto silent = self->env_->clock->now() - self->lastMessage_;
    if (silent < limit) return self->armIdleTimer(limit - silent);
    connectionLog().debug("timing out idle ipc transaction");
    self->closeTransaction(true);
  });
}

void ClientConnection::closeTransaction(bool now) {
  if (!transactionOpen_.exchange(false)) return;
  // A client silent for a minute has left its typing session: its cached replies go with it.
  if (state_ && state_->queryCache()) state_->queryCache()->removeAllObjects();
  platform::TransactionTracker::Transaction transaction;
  {
    std::lock_guard lock(transactionLock_);
    transaction = std::move(transaction_);
  }
  if (now) return;  // ends here
  // The timer holds the IPC connection, whose queue it runs on, until it fires.
  auto held = std::make_shared<platform::TransactionTracker::Transaction>(std::move(transaction));
  env_->clock->after(platform::seconds(kIdleTransactionSeconds), connection_->queue(),
                         [held, connection = connection_] { held->reset(); });
}

void ClientConnection::send(std::uint64_t callId, proto::Envelope& out) {
  sendToClient(*connection_, answerFrame(*connection_, callId, out));
}

void ClientConnection::reply(std::uint64_t callId, proto::Envelope& out) {
  if (callId == 0) return;  // a call without an id cannot be answered
  sendToClient(*connection_, answerFrame(*connection_, callId, out));
}

void ClientConnection::handleIncomingMessage(const std::string& payload) {
  openOrExtendTransaction();
  proto::Envelope in;
  if (!in.ParseFromString(payload)) {
    connectionLog().error("malformed message of {} bytes from pid {}", payload.size(), connection_->peer().pid);
    return;
  }
  // Descriptors the daemon does not take are closed here rather than left to pile up.
  if (in.attached_fds() > 0) connection_->takeReceivedFds(in.attached_fds());

  const std::uint64_t callId = in.call_id();
  switch (in.message_case()) {
    case proto::Envelope::kConfigure: return configure(callId, in);
    case proto::Envelope::kBag: return bag(callId);
    case proto::Envelope::kRequest: return request(callId, in);
    case proto::Envelope::kFeedback: return feedback(callId);
    case proto::Envelope::kListenToFlusher: return listenToFlusher(callId);
    case proto::Envelope::kListSessions: return listSessions(callId);
    case proto::Envelope::kFileHandleAndAttributesForResource: return fileHandleAndAttributesForResource(callId, in);
    case proto::Envelope::kGetImageMap: return getImageMap(callId);
    case proto::Envelope::kReportFeedbackPayloadData:
      return reportFeedbackPayloadData(in.report_feedback_payload_data().data(),
                                       in.report_feedback_payload_data().query_id());
    case proto::Envelope::kClearEngagedCompletions:
    case proto::Envelope::kAddCompletion:
    case proto::Envelope::kUpdateParameters: return engagedCompletionMessage(in);
    case proto::Envelope::kNotify: return notify(callId, in);
    case proto::Envelope::kRunActivity: return runActivity(callId, in);
    case proto::Envelope::kListResources: return listResources(callId);
    default: return unknownMessage(callId, in);
  }
}

void ClientConnection::bag(std::uint64_t callId) {
  ensureState();
  if (!state_) return;  // no bound state, no reply: as for queries
  auto pending = std::make_shared<PendingCall>(connection_, callId);
  state_->bag(userAgent_, [pending](const std::shared_ptr<const TVXBag>& bag, const std::optional<TVXError>& error) {
    proto::Envelope out;
    if (bag) bagToWire(*bag, out.mutable_bag_reply()->mutable_bag());
    if (error) errorToWire(*error, out.mutable_bag_reply()->mutable_error());
    if (!bag && !error) out.mutable_bag_reply();
    pending->answer(out);
  });
}

void ClientConnection::listenToFlusher(std::uint64_t callId) {
  ensureState();
  proto::Envelope out;
  // The tool's end of a fresh flusher channel rides with the reply.
  auto* answer = out.mutable_listen_to_flusher_reply();
  platform::ipc::UniqueFd endpoint;
  if (env_->flusher) endpoint = env_->flusher->endpoint();
  if (!endpoint.valid()) {
    setError(answer->mutable_error(), 500, "not available");
    return reply(callId, out);
  }
  answer->set_has_endpoint(true);
  answerWithDescriptor(*connection_, callId, out, std::move(endpoint));
}

void ClientConnection::listSessions(std::uint64_t callId) {
  ensureState();
  proto::Envelope out;
  auto* answer = out.mutable_list_sessions_reply();
  for (const auto& session : env_->clientStates->sessions()) answer->add_sessions(platform::toJson(session));
  reply(callId, out);
}

void ClientConnection::fileHandleAndAttributesForResource(std::uint64_t callId, const proto::Envelope& in) {
  ensureState();
  proto::Envelope out;
  auto* answer = out.mutable_file_handle_and_attributes_for_resource_reply();
  if (!env_->downloads) {
    setError(answer->mutable_error(), 500, "not available");
    return reply(callId, out);
  }
  const std::string& identifier = in.file_handle_and_attributes_for_resource().identifier();
  platform::Dictionary attributes;
  TVXError error;
  auto fd = env_->downloads->fileHandleForResource(identifier, &attributes, &error);
  if (!fd.valid()) {
    setError(answer->mutable_error(), error.code, error.reason);
    return reply(callId, out);
  }
  answer->set_has_file_handle(true);
  answer->set_attributes_plist(platform::toXmlPlist(attributes));
  // The open file rides with the reply: the client reads it without any access to our folder.
  answerWithDescriptor(*connection_, callId, out, std::move(fd));
}

void ClientConnection::listResources(std::uint64_t callId) {
  proto::Envelope out;
  auto* answer = out.mutable_list_resources_reply();
  if (!env_->downloads) {
    setError(answer->mutable_error(), 500, "not available");
    return reply(callId, out);
  }
  for (const auto& status : env_->downloads->resourceStatuses()) {
    auto* r = answer->add_resources();
    r->set_identifier(status.identifier);
    r->set_url(status.url);
    r->set_version(status.version);
    r->set_has_file(status.fileSize.has_value());
    r->set_file_size(status.fileSize.value_or(0));
    if (status.fileModificationDate) r->set_file_modification_date(platform::toUnixSeconds(*status.fileModificationDate));
    r->set_downloading(status.downloading);
    r->set_download_started(status.downloadStarted);
    if (status.downloadBeginDate) r->set_download_begin_date(platform::toUnixSeconds(*status.downloadBeginDate));
    r->set_bytes_received(status.bytesReceived);
    r->set_bytes_expected(status.bytesExpected);
  }
  reply(callId, out);
}

void ClientConnection::getImageMap(std::uint64_t callId) {
  ensureState();
  proto::Envelope out;
  // Without a bound state the answer is empty, as for a bag without resources.
  auto bag = state_ ? state_->currentBag() : nullptr;
  auto* answer = out.mutable_get_image_map_reply();
  if (bag) answer->set_resources_json(platform::toJson(bag->resources()));
  reply(callId, out);
}

void ClientConnection::notify(std::uint64_t callId, const proto::Envelope& in) {
  proto::Envelope out;
  const std::string stream = in.notify().stream().empty() ? kNotifyStream : in.notify().stream();
  auto* answer = out.mutable_notify_reply();
  answer->set_delivered(env_->launchEvents && env_->launchEvents->deliver(stream, in.notify().name()));
  if (!answer->delivered()) setError(answer->mutable_error(), 404, "no handler for stream " + stream);
  reply(callId, out);
}

void ClientConnection::runActivity(std::uint64_t callId, const proto::Envelope& in) {
  proto::Envelope out;
  auto* answer = out.mutable_run_activity_reply();
  const std::string& name = in.run_activity().name();
  if (!env_->activities->state(name)) {
    setError(answer->mutable_error(), 404, "no activity " + name);
  } else if (!env_->activities->runNow(name)) {
    setError(answer->mutable_error(), 500, "activity " + name + " is running");
  }
  reply(callId, out);
}

void ClientConnection::unknownMessage(std::uint64_t callId, const proto::Envelope& in) {
  connectionLog().error("unknown message {} from pid {}", static_cast<int>(in.message_case()), connection_->peer().pid);
  proto::Envelope out;
  setError(out.mutable_call_failed(), 500, "unknown message");
  reply(callId, out);
}

void ClientConnection::ensureState() {
  if (!configuration_) return;
  if (configuration_->identifier.empty()) {
    sessionLog().fault("configuration requires identifier");
    return;
  }
  if (state_) {
    if (state_->identifier() != configuration_->identifier) sessionLog().fault("session identifier must match");
    return;
  }
  std::string fullUserAgent;
  if (!configuration_->userAgent.empty()) {
    // The factory's device answers are the process's: the system's version is read once.
    const auto& agent = configuration_->userAgent;
    fullUserAgent = createUserAgentString(agent, env_->requestFactory->deviceInformation()).value_or(agent);
  }
  // The identifier and the full user agent (the client's part and the device's, which defaults
  // may override) go out as header values: a CR LF in either would add a header of its own.
  for (const std::string* value : {&configuration_->identifier, &fullUserAgent}) {
    if (platform::http::isValidHeaderValue(*value)) continue;
    sessionLog().fault("configuration carries a control character: {}", printable(*value));
    return;
  }
  auto state = env_->clientStates->stateForClientIdentifier(configuration_->identifier);
  if (!state) return;
  // The tool re-labels its state with each connection's agent; other clients keep the state's
  // first one on purpose.
  if (configuration_->identifier == "tavix_tool") state->updateClient(fullUserAgent);
  if (auto shared = state->configuration()) {
    configuration_ = *shared;
  } else {
    state->setConfiguration(*configuration_);
  }
  if (fullUserAgent.empty()) {
    sessionLog().fault("configuration requires userAgent");
    return;
  }
  userAgent_ = std::move(fullUserAgent);
  state_ = std::move(state);
}

void ClientConnection::configure(std::uint64_t callId, const proto::Envelope& in) {
  const auto& config = in.configure().configuration();
  sessionLog().notice("client configuration {{identifier: {}, userAgent: {}}}", printable(config.identifier()),
                      printable(config.user_agent()));
  const auto previous = configuration_;
  if (!previous || previous->identifier == config.identifier()) {
    configuration_ = Configuration{config.identifier(), config.user_agent()};
  }
  ensureState();
  if (previous && previous->identifier != config.identifier()) {
    // The first identifier keeps the connection; a client cannot switch identities mid-way.
    sessionLog().fault("session identifier must match");
  }
  if (!state_) {
    configuration_.reset();
    env_->sessionManager->reportErrorAsTavixdFeedback(500, kTVXErrorDomain, "invalid configuration");
    // No reply at all: the client learns of it by the closed connection.
    sessionLog().fault("invalid configuration, closing connection");
    connection_->invalidate();
    return;
  }
  // The bag may take a fetch: it is handed over as bagDidLoad when it comes, without holding up
  // the reply or the client's next calls. A second configure of the same client waits for the
  // same bag (and later ones follow through bag changes) rather than asking again.
  if (!bagRequested_) {
    bagRequested_ = true;
    std::weak_ptr<ClientConnection> weak = weak_from_this();
    state_->bag(userAgent_, [weak](const std::shared_ptr<const TVXBag>& bag, const std::optional<TVXError>& error) {
      auto self = weak.lock();
      if (!self) return;
      self->connection_->queue().async([self, bag, error] { self->bagDidLoad(bag, error); });
    });
  }
  proto::Envelope out;
  out.mutable_configure_reply()->set_has_endpoint(false);
  reply(callId, out);
}

void ClientConnection::bagDidLoad(const std::shared_ptr<const TVXBag>& bag, const std::optional<TVXError>& error) {
  if (error) bagLog().error("error fetching bag: {}", error->reason);
  if (bag && !bag->feedbackEnabled()) {
    TavixLogForCategory(TavixLoggingCategoryFeedback)
        .debug("feedback collection disabled in bag for user agent {}", userAgent_);
  }
  bagLog().debug("sending bag with version: {} to client: {} error: {}", bag ? bag->version().value_or("(null)") : "(null)",
                 configuration_ ? configuration_->identifier : "(null)", error ? error->reason : "(null)");
  proto::Envelope out;
  if (bag) bagToWire(*bag, out.mutable_bag_did_load()->mutable_bag());
  if (error) errorToWire(*error, out.mutable_bag_did_load()->mutable_error());
  if (!bag && !error) out.mutable_bag_did_load();
  send(0, out);
  if (bag) setEngagedCompletionCacheValues(*bag);
  if (!bagObserver_) {
    std::weak_ptr<ClientConnection> weak = weak_from_this();
    bagObserver_ = env_->center->addObserver(
        kTVXBagChangeNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
          if (auto self = weak.lock()) self->bagChangeNotification(n);
        });
  }
  env_->clientStates->saveState();
}

void ClientConnection::bagChangeNotification(const platform::Notification& notification) {
  auto bag = bagOfNotification(notification);
  bagLog().info("bag change notification: {}", bag ? bag->version().value_or("(no version)") : "(null)");
  if (!bag) return;
  // Labelled for this client, as its state holds it.
  auto labelled = std::make_shared<const TVXBag>(bag->sharedRawBag(), userAgent_);
  proto::Envelope out;
  bagToWire(*labelled, out.mutable_bag_did_load()->mutable_bag());
  send(0, out);
  setEngagedCompletionCacheValues(*labelled);
}

void ClientConnection::setEngagedCompletionCacheValues(const TVXBag& bag) {
  if (!bag.smartHistoryEnabled()) return;
  EngagedCompletionParameters parameters;
  parameters.last1hour = bag.brovaneLast1hour();
  parameters.last1day = bag.brovaneLast1day();
  parameters.last1week = bag.brovaneLast1week();
  parameters.last1month = bag.brovaneLast1month();
  parameters.all = bag.brovaneAll();
  parameters.mostRecent = bag.brovaneMostRecent();
  parameters.minThresholdToSend = bag.minThresholdToSend();
  env_->engagedCompletions->updateParameters(parameters);
}

void ClientConnection::request(std::uint64_t callId, const proto::Envelope& in) {
  const pid_t pid = connection_->peer().pid;
  const auto& wire = in.request().request();
  if (wire.kind_case() == proto::TVXRequest::KIND_NOT_SET) {
    // A kind we do not route gets no reply at all, as a class we do not know would.
    connectionLog().error("request of unknown kind from pid {}", pid);
    return;
  }
  ensureState();
  if (!state_) {
    // Queries of an unbound connection are never answered; say so in the log at least.
    connectionLog().error("query {} from pid {} before a valid configuration: not answered", wire.query_id(), pid);
    return;
  }
  auto request = requestFromWire(wire);
  auto* defaults = env_->defaults.get();
  if (!request->keyboardInputMode) {
    request->keyboardInputMode = defaultKeyboardInputMode(defaults);
    connectionLog().debug("keyboardInputMode property not set, using {}", *request->keyboardInputMode);
  }
  if (request->scale == 0) {
    request->scale = mainScreenScale(defaults);
    connectionLog().debug("request scale property not set, using {:f}", request->scale);
  }

  const TraceCodes codes = traceCodesFor(wire.kind_case());
  if (codes.start) trace(codes.start);
  auto pending = std::make_shared<PendingCall>(connection_, callId);
  TVXReplyBlock reply = [pending, endCode = codes.end](std::uint64_t queryId, std::optional<TVXReply> r,
                                                       std::optional<TVXError> error) {
    proto::Envelope out;
    auto* wireReply = out.mutable_request_reply();
    wireReply->set_query_id(queryId);
    if (r) replyToWire(std::move(*r), wireReply->mutable_reply());
    if (error) errorToWire(*error, wireReply->mutable_error());
    pending->answer(out);
    if (endCode) trace(endCode);
  };
  switch (wire.kind_case()) {
    case proto::TVXRequest::kSearch:
      state_->search(std::static_pointer_cast<const TVXSearchRequest>(request), std::move(reply));
      break;
    case proto::TVXRequest::kMoreResults:
      state_->moreResults(std::static_pointer_cast<const TVXMoreResultsRequest>(request), std::move(reply));
      break;
    case proto::TVXRequest::kCard:
      state_->card(std::static_pointer_cast<const TVXCardRequest>(request), std::move(reply));
      break;
    case proto::TVXRequest::kZeroKeyword:
      state_->zeroKeyword(std::static_pointer_cast<const TVXZeroKeywordRequest>(request), std::move(reply));
      break;
    case proto::TVXRequest::kLookup:
      state_->lookup(std::static_pointer_cast<const TVXLookupRequest>(request), std::move(reply));
      break;
    case proto::TVXRequest::kFlightSearch:
      state_->flightSearch(std::static_pointer_cast<const TVXFlightSearchRequest>(request), std::move(reply));
      break;
    case proto::TVXRequest::KIND_NOT_SET:
      break;
  }
}

void ClientConnection::feedback(std::uint64_t callId) {
  trace(TVXTraceCodeFeedbackStart);
  ensureState();
  proto::Envelope out;
  out.mutable_feedback_reply();
  auto manager = state_ ? state_->sessionManager() : nullptr;
  if (!manager) {
    reply(callId, out);
    trace(TVXTraceCodeFeedbackEnd);
    return;
  }
  auto pending = std::make_shared<PendingCall>(connection_, callId);
  manager->currentSessionFeedbacks([pending, out](std::vector<std::string> feedbacks) mutable {
    for (auto& feedback : feedbacks) out.mutable_feedback_reply()->add_feedbacks(std::move(feedback));
    pending->answer(out);
    trace(TVXTraceCodeFeedbackEnd);
  });
}

void ClientConnection::engagedCompletionMessage(const proto::Envelope& in) {
  ensureState();
  auto cache = env_->engagedCompletions;
  switch (in.message_case()) {
    case proto::Envelope::kClearEngagedCompletions: {
      const auto& dates = in.clear_engaged_completions();
      if (!std::isfinite(dates.from_date()) || !std::isfinite(dates.to_date())) {
        connectionLog().error("clearEngagedCompletions from pid {}: the dates {} and {} are not both numbers",
                              connection_->peer().pid, dates.from_date(), dates.to_date());
        break;
      }
      const auto client = engagedCompletionClientForName(state_ ? state_->clientShortName().value_or("") : "");
      cache->clearCompletionsFromDate(platform::fromUnixSeconds(dates.from_date()),
                                      platform::fromUnixSeconds(dates.to_date()), client);
      break;
    }
    case proto::Envelope::kAddCompletion:
      cache->addCompletion(in.add_completion().completion(), in.add_completion().input());
      break;
    case proto::Envelope::kUpdateParameters: {
      auto bag = state_ ? state_->currentBag() : nullptr;
      if (!bag || !bag->smartHistoryEnabled()) return;
      const auto& p = in.update_parameters();
      EngagedCompletionParameters parameters;
      parameters.last1hour = p.brovane_last1hour();
      parameters.last1day = p.brovane_last1day();
      parameters.last1week = p.brovane_last1week();
      parameters.last1month = p.brovane_last1month();
      parameters.all = p.brovane_all();
      parameters.mostRecent = p.brovane_most_recent();
      parameters.minThresholdToSend = p.min_threshold_to_send();
      cache->updateParameters(parameters);
      break;
    }
    default:
      break;
  }
}

void ClientConnection::flushSessionInvalidation(std::function<void(bool flushed)> callback) {
  auto manager = state_ ? state_->sessionManager() : nullptr;
  if (!manager || userAgent_.empty()) {
    callback(false);
    return;
  }
  manager->flushSessionInvalidationWithAgent(userAgent_, std::move(callback));
}

}  // namespace tavix
