// The records that bracket every network request of a client state, the counters kept beside
// them, the proxy switch, and connection warming.
#include <fmt/format.h>

#include <algorithm>
#include <cctype>

#include "bag/tavix_bag_controller.h"
#include "bagview/tvx_bag.h"
#include "context/location.h"
#include "context/user_guid_controller.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "feedback/client_session_manager.h"
#include "feedback/tavix_feedback.h"
#include "feedback/vocabulary.h"
#include "network/request_factory.h"
#include "network/retryable_request.h"
#include "bagview/user_agent.h"
#include "platform/clock.h"
#include "platform/http/url_session.h"
#include "platform/json_value.h"
#include "query/client_state.h"
#include "query/client_state_internal.h"
#include "tavix_proto/feedback_records.pb.h"
#include "platform/strings.h"

namespace tavix {

using platform::http::URLSessionDataTask;
using platform::http::URLSessionTaskMetrics;
using query_internal::eventTimestamp;

namespace {

platform::Logger& searchLog() { return TavixLogForCategory(TavixLoggingCategorySearch); }

// The transport's phases, in seconds from the task's start, as the server's dashboards chart them.
void fillTimingData(proto::CTEndNetworkSearchFeedback& end, const URLSessionTaskMetrics& timing) {
  auto& data = *end.mutable_network_timing_data();
  data["domain_lookup"] = timing.domainLookupSeconds;
  data["connect"] = timing.connectSeconds;
  data["secure_connection"] = timing.secureConnectionSeconds;
  data["response_start"] = timing.firstByteSeconds;
  data["total"] = timing.totalSeconds;
  data["request_body_bytes"] = static_cast<double>(timing.requestBodyBytes);
  data["response_body_bytes"] = static_cast<double>(timing.responseBodyBytes);
  end.set_connection_reused(timing.reusedConnection);
  end.set_peer_address(timing.peerAddress);
}

proto::CTEndNetworkSearchFeedback makeEndRecord(const proto::CTStartNetworkSearchFeedback& start,
                                                std::uint64_t responseSize, long statusCode,
                                                const URLSessionTaskMetrics& timing, std::uint64_t timestamp) {
  proto::CTEndNetworkSearchFeedback end;
  end.set_timestamp(timestamp);
  end.set_uuid(start.uuid());
  end.set_endpoint_type(start.endpoint_type());
  end.set_status_code(static_cast<std::int32_t>(statusCode));
  end.set_response_size(static_cast<std::uint32_t>(std::min<std::uint64_t>(responseSize, UINT32_MAX)));
  fillTimingData(end, timing);
  return end;
}

}  // namespace

std::string ClientState::currentUserGuid() {
  return guidController_ ? guidController_->currentUserGUID() : std::string();
}

void ClientState::addCodable(const google::protobuf::Message& codable, std::uint64_t queryId, bool withUserGuid) {
  if (!sessionManager_) return;
  const std::string guid = withUserGuid ? currentUserGuid() : std::string();
  sessionManager_->addTavixFeedback(
      makeTavixFeedbackWithCodable(codable, static_cast<std::int64_t>(queryId), guid, userAgent().value_or("")));
}

void ClientState::recordSkipSearch(int reason, const std::string& input, std::uint64_t queryId) {
  proto::CTSkipSearchFeedback skip;
  skip.set_timestamp(eventTimestamp(*env_->clock));
  skip.set_input(input);
  skip.set_reason(static_cast<proto::SkipSearchType::Value>(reason));
  addCodable(skip, queryId, false);
}

void ClientState::recordDidGoToSearch(const TVXRequest& request, const std::string& input) {
  const auto agent = userAgent();
  if (!agent || request.triggerEvent != proto::TriggerSearchRequestEvent::return_key) return;
  const std::string lower = platform::asciiLowercased(*agent);
  if (lower.find("messages") == std::string::npos) return;
  proto::CTDidGoToSearchFeedback didGo;
  didGo.set_timestamp(eventTimestamp(*env_->clock));
  didGo.set_input(input);
  didGo.set_endpoint_type(proto::EndpointType::tavix_search);
  addCodable(didGo, request.queryId, true);
}

std::optional<std::string> ClientState::geoSessionEntityString() {
  auto session = env_->locationManager->getMapsUserSessionEntityAndReset(true);
  if (!session || session->sessionId.empty()) return std::nullopt;
  return fmt::format("{} {} {:f}", session->sessionId, session->sequenceNumber, session->relativeTimestamp);
}

ClientState::StartRecord ClientState::startSearchEventForRequest(const platform::http::URLRequest& request) {
  auto start = std::make_shared<proto::CTStartNetworkSearchFeedback>();
  start->set_timestamp(eventTimestamp(*env_->clock));
  start->set_url(request.url);
  auto& headers = *start->mutable_headers();
  for (const auto& [name, value] : request.headers.all()) headers[name] = value;
  start->set_uuid(makeRandomUUIDString());
  if (env_->requestFactory->useMarvola()) {
    start->set_marvola_status(env_->requestFactory->proxyGetStatus());
  }
  return start;
}

void ClientState::endNetworkFeedback(const StartRecord& start, const platform::PropertyValue* reply,
                                     std::uint64_t responseSize, long statusCode, const URLSessionTaskMetrics& timing,
                                     std::uint64_t queryId) {
  endNetworkFeedback(start, reply, responseSize, statusCode, timing, queryId, userAgent().value_or(""));
}

void ClientState::endNetworkFeedback(const StartRecord& start, const platform::PropertyValue* reply,
                                     std::uint64_t responseSize, long statusCode, const URLSessionTaskMetrics& timing,
                                     std::uint64_t queryId, const std::string& agent) {
  if (!start || !sessionManager_) return;
  auto end = makeEndRecord(*start, responseSize, statusCode, timing, eventTimestamp(*env_->clock));
  // The server's own account of the request sits in the first element of its reply.
  const auto* list = reply ? reply->array() : nullptr;
  const auto* first = list && !list->empty() ? list->front().dictionary() : nullptr;
  if (first) {
    auto string = [&](const char* key) -> const std::string* {
      const auto it = first->find(key);
      return it == first->end() ? nullptr : it->second.string();
    };
    if (const auto* status = string("status")) end.set_tavix_status(*status);
    if (const auto* fbq = string("fbq")) end.set_fbq(*fbq);
    if (const auto* ip = string("partial_client_ip")) end.set_tavix_partial_client_ip(*ip);
    if (const auto it = first->find("duration"); it != first->end()) {
      if (const auto* real = it->second.real()) end.set_tavix_duration(*real);
      if (const auto* integer = it->second.integer()) end.set_tavix_duration(static_cast<double>(*integer));
    }
  }
  // No proxy control connection on this platform: the record goes out at once.
  sessionManager_->addTavixFeedback(makeTavixFeedbackWithCodable(end, static_cast<std::int64_t>(queryId), "", agent));
}

void ClientState::failSearchFeedback(const std::optional<TVXError>& error, const TVXRequest& request,
                                     const StartRecord& start, std::uint64_t responseSize, long statusCode,
                                     const URLSessionTaskMetrics& timing) {
  const auto agent = userAgent();
  if (error) {
    if (auto shortName = agent ? extractClientNameFromString(*agent) : std::nullopt) {
      TavixDiagnosticDataReporter::addValue(1, createCounterKey(*shortName, "fedapicall.noconnection"));
    }
  }
  proto::CTErrorFeedback errorRecord;
  errorRecord.set_timestamp(eventTimestamp(*env_->clock));
  if (error) {
    errorRecord.set_code(static_cast<std::int32_t>(error->code));
    errorRecord.set_domain(error->domain);
    errorRecord.set_reason(error->reason);
  }
  addCodable(errorRecord, request.queryId, false);
  if (!start || !sessionManager_) return;
  auto end = makeEndRecord(*start, responseSize, statusCode, timing, eventTimestamp(*env_->clock));
  addCodable(end, request.queryId, false);
}

void ClientState::recordSearchResult(long statusCode) {
  const auto agent = userAgent();
  if (!agent) return;
  TavixDiagnosticDataReporter::addValue(
      1, fmt::format("{}{}", createCounterKey(*agent, "fedapicall.serverstatus"), statusCode));
}

void ClientState::setPerformedSearch() {
  env_->requestFactory->setPerformedSearch();
}

std::optional<std::string> ClientState::proxyForTask() const {
  if (env_->requestFactory->proxyGetStatus() != 1) return std::nullopt;
  auto proxy = env_->requestFactory->proxyURL();
  if (!proxy) TavixLogForCategory(TavixLoggingCategoryConnection).error("Enabling Marvola for request failed.");
  return proxy;
}

void ClientState::failUnbuiltRequest(const TVXRequest& request, const std::string& input, const TVXReplyBlock& reply,
                                     platform::Logger& log) {
  log.error("error with request {}", input);
  const TVXError error{platform::http::kURLErrorDomain, platform::http::URLErrorUnsupportedURL, "unsupported URL"};
  reply(request.queryId, std::nullopt, error);
  failSearchFeedback(error, request, nullptr, 0, 0, {});
}

void ClientState::warm() {
  const auto warmURL = env_->bagController->warmURL();
  if (!warmURL) {
    searchLog().debug("warm not required, bag fetch in process");
    return;
  }
  const auto now = env_->clock->now();
  {
    std::lock_guard lock(mutex_);
    if (lastNetworkRequest_ && now - *lastNetworkRequest_ < platform::seconds(30)) {
      searchLog().debug("warm not required, connection still warm");
      return;
    }
  }
  auto request = env_->requestFactory->warmRequest(*warmURL);
  if (!request) return;
  {
    // Taken now that a request exists, and checked again, so that of two warms racing one goes.
    std::lock_guard lock(mutex_);
    if (lastNetworkRequest_ && now - *lastNetworkRequest_ < platform::seconds(30)) return;
    lastNetworkRequest_ = now;
  }
  auto start = startSearchEventForRequest(*request);
  start->set_input("");
  start->set_trigger_event(proto::TriggerSearchRequestEvent::warm);
  start->set_endpoint_type(proto::EndpointType::tavix_warm);
  const std::string agent = userAgent().value_or("");
  // The start of a warm-up is the daemon's own record and goes to the daemon's session manager;
  // its end, like every end record, to the client's (the same one when sessions are shared).
  env_->sessionManager->addTavixFeedback(makeTavixFeedbackWithCodable(*start, 0, "", agent));
  std::weak_ptr<ClientState> weak = weak_from_this();
  auto task = dataTaskWithTiming(
      env_->session, *request,
      [weak, start, agent](std::string data, std::optional<platform::http::HTTPURLResponse> response,
                           std::optional<platform::http::URLError> error, const URLSessionTaskMetrics& timing) {
        const long status = response ? response->statusCode : 0;
        searchLog().notice("Status for warm request: ({}) error: ({})", status,
                           error ? error->description : std::string("none"));
        auto self = weak.lock();
        if (!self) return;
        const auto parsed = platform::parseJson(data);
        self->endNetworkFeedback(start, parsed ? &*parsed : nullptr, data.size(), status, timing, 0, agent);
      });
  // A pre-connect task: only the connection matters, so no cached answer may stand in for it.
  task->setValue("preconnect", true);
  if (auto proxy = proxyForTask()) task->setProxy(*proxy);
  task->resume();
}

}  // namespace tavix
