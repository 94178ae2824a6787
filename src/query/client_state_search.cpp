// The search path: what the user has typed so far, answered from the local completions, the query
// cache or the server.
#include <fmt/format.h>

#include "bag/tavix_bag_controller.h"
#include "bagview/tvx_bag.h"
#include "cache/engaged_completion_cache.h"
#include "cache/query_cache.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
#include "feedback/client_session_manager.h"
#include "feedback/tavix_feedback.h"
#include "feedback/vocabulary.h"
#include "network/retryable_request.h"
#include "platform/clock.h"
#include "platform/http/url_session.h"
#include "platform/json_value.h"
#include "query/client_state.h"
#include "query/client_state_internal.h"
#include "tavix_proto/feedback_records.pb.h"

namespace tavix {

using platform::http::HTTPURLResponse;
using platform::http::URLError;
using platform::http::URLRequest;

namespace {

platform::Logger& searchLog() { return TavixLogForCategory(TavixLoggingCategorySearch); }
platform::Logger& protocolLog() { return TavixLogForCategory(TavixLoggingCategoryProtocol); }

}  // namespace

std::vector<std::string> ClientState::completionCacheSuggestions() const {
  std::lock_guard lock(mutex_);
  return completionCacheSuggestions_;
}

void ClientState::search(std::shared_ptr<const TVXSearchRequest> request, TVXReplyBlock reply) {
  const std::string input = request->queryString;
  const std::uint64_t queryId = request->queryId;
  searchLog().notice("session {} performing query[{}] {}, reply {}", identifier_, queryId, input,
                     static_cast<const void*>(&reply));
  if (clientShortName_) TavixDiagnosticDataReporter::addValue(1, createCounterKey(*clientShortName_, "keystrokes"));

  // Paths that end here answer first and write their bookkeeping after, so the client never
  // waits for it.
  if (!ensureBag()) {
    searchLog().error("Bag fetch failed, can't complete non-cached query {}.", input);
    reply(queryId, std::nullopt, TVXError{kTVXErrorDomain, 1, "timeout"});
    recordSkipSearch(proto::SkipSearchType::bag_fetch_failed, input, queryId);
    return;
  }
  const auto bag = currentBag();
  if (!bag->isEnabled()) {
    searchLog().notice("no search, bag disabled");
    reply(queryId, std::nullopt, std::nullopt);
    recordSkipSearch(proto::SkipSearchType::bag_disabled, input, queryId);
    return;
  }

  const auto local = localCompletionsForSearch(*request, *bag);
  const auto length = static_cast<std::int64_t>(queryLength(input));
  if (length < bag->minimumQueryLength() && local.kept.empty()) {
    searchLog().notice("query[{}] input '{}' less than {}", queryId, input, bag->minimumQueryLength());
    reply(queryId, std::nullopt, std::nullopt);
    recordSkipSearch(proto::SkipSearchType::less_than_minimum_query_length, input, queryId);
    return;
  }

  recordDidGoToSearch(*request, input);

  const std::string guid = currentUserGuid();
  auto built = env_->requestFactory->searchRequest(*request, *bag, guid);
  if (!built) {
    failUnbuiltRequest(*request, input, reply, searchLog());
    return;
  }
  const auto httpRequest = std::make_shared<const URLRequest>(std::move(*built));
  if (protocolLog().wants(platform::LogLevel::Info)) {
    protocolLog().info("request: {} header: {}", httpRequest->url, query_internal::headersText(httpRequest->headers));
  }
  if (answerSearchFromQueryCache(*request, *httpRequest, local.others, reply)) return;
  sendSearch(std::move(request), std::move(reply), httpRequest, local.others);
}

ClientState::LocalCompletions ClientState::localCompletionsForSearch(const TVXSearchRequest& request,
                                                                     const TVXBag& bag) {
  // The browser's completions, and the search screen's for suggestion-bearing keystrokes.
  const std::string& input = request.queryString;
  const auto length = static_cast<std::int64_t>(queryLength(input));
  const std::int64_t smartMinimum = bag.smartHistoryMinimumQueryLength();
  const std::string clientName = bag.clientName().value_or("");
  const bool seekaraTrigger = request.triggerEvent == proto::TriggerSearchRequestEvent::suggest_queries ||
                              request.triggerEvent == TVXTriggerEventSuggestWithResults;
  LocalCompletions local;
  if (!((smartMinimum == 0 || length >= smartMinimum - 1) && bag.smartHistoryEnabled() &&
        (clientName == "brovane" || (clientName == "seekara" && seekaraTrigger)))) {
    local.kept = completionCacheSuggestions();
    return local;
  }
  proto::CTStartLocalSearchFeedback start;
  start.set_timestamp(query_internal::eventTimestamp(*env_->clock));
  start.set_input(input);
  start.set_trigger_event(length < smartMinimum ? proto::TriggerSearchRequestEvent::warm
                                                : proto::TriggerSearchRequestEvent::new_character);
  start.set_index_type(proto::IndexType::engaged_completion_cache);
  start.set_query_id(request.queryId);
  addCodable(start, request.queryId, true);

  const bool brovane = clientName == "brovane";
  const unsigned long client = brovane ? kEngagedCompletionClientBrovane : kEngagedCompletionClientSeekara;
  unsigned long count = 1;
  if (!brovane) {
    const auto asked = bag.smartHistoryCompletionReturnCount();
    count = asked > 0 ? static_cast<unsigned long>(asked) : 3;
  }
  const auto timeout = static_cast<unsigned long>(std::max<std::int64_t>(bag.smartHistoryTimeout(), 0));
  auto found = env_->engagedCompletionCache->completionsForInput(input, client, count, timeout);
  if (!found || found->empty()) {
    TavixLogForCategory(TavixLoggingCategoryDefault).notice("Local completion not found: input {}", input);
  } else {
    local.kept.push_back(found->front().suggestion);
    for (std::size_t i = 1; i < found->size(); ++i) local.others.push_back((*found)[i].suggestion);
    if (found->size() > 1) {
      searchLog().notice("{} Total completions found for {}, {} remaining", found->size(), input, local.others.size());
    }
  }
  std::lock_guard lock(mutex_);
  completionCacheSuggestions_ = local.kept;
  return local;
}

bool ClientState::answerSearchFromQueryCache(const TVXSearchRequest& request, const URLRequest& httpRequest,
                                             const std::vector<std::string>& localSuggestions,
                                             const TVXReplyBlock& reply) {
  if (!queryCache_) return false;
  CacheSearchRequest lookup{request.queryString, request.scale, {}};
  for (const auto& item : request.queryItems) lookup.queryItems.emplace_back(item.name, item.value);
  auto hit = queryCache_->getRequest(lookup, &httpRequest);
  if (!hit) return false;
  TVXReply cached;
  cached.scale = request.scale;
  cached.data = hit->data();
  cached.geoSessionEntityString = geoSessionEntityString();
  cached.localSuggestions = localSuggestions;
  reply(request.queryId, std::move(cached), std::nullopt);
  if (clientShortName_) {
    TavixDiagnosticDataReporter::addValue(1, createCounterKey(*clientShortName_, "ondevicecachehits"));
  }
  if (!sessionManager_) return true;
  // The record is made on the session queue: a hit is the fast path, and the client already has
  // its answer.
  sessionManager_->addTavixFeedbackMadeBy(
      [timestamp = query_internal::eventTimestamp(*env_->clock), input = request.queryString, uuid = request.uuid,
       queryId = request.queryId, agent = userAgent().value_or("")] {
        proto::CTCacheHitFeedback cacheHit;
        cacheHit.set_timestamp(timestamp);
        cacheHit.set_input(input);
        cacheHit.set_uuid(uuid);
        cacheHit.set_reason(proto::SkipSearchType::cache_hit);
        return makeTavixFeedbackWithCodable(cacheHit, static_cast<std::int64_t>(queryId), "", agent);
      });
  return true;
}

void ClientState::sendSearch(std::shared_ptr<const TVXSearchRequest> request, TVXReplyBlock reply,
                             std::shared_ptr<const URLRequest> httpRequest, std::vector<std::string> localSuggestions) {
  const std::uint64_t queryId = request->queryId;
  auto start = startSearchEventForRequest(*httpRequest);
  start->set_input(request->queryString);
  start->set_trigger_event(static_cast<proto::TriggerSearchRequestEvent::Value>(request->triggerEvent));
  start->set_endpoint_type(proto::EndpointType::tavix_search);
  addCodable(*start, queryId, false);
  searchLog().notice("Dispatching network request for (id, query): ({}, {})", queryId, request->queryString);

  auto self = shared_from_this();
  auto task = dataTaskWithTiming(
      env_->session, *httpRequest,
      [self, request, reply, httpRequest, start, localSuggestions = std::move(localSuggestions)](
          std::string data, std::optional<HTTPURLResponse> response, std::optional<URLError> error,
          const platform::http::URLSessionTaskMetrics& timing) {
        self->searchResponseArrived(*request, reply, *httpRequest, start, localSuggestions,
                                    SearchResponse{std::move(data), std::move(response), std::move(error)}, timing);
      });
  if (auto proxy = proxyForTask()) task->setProxy(*proxy);
  task->resume();
  TavixDiagnosticDataReporter::addValue(1, TavixSearchCounterKey);
  setPerformedSearch();
  markNetworkRequest();
}

void ClientState::searchResponseArrived(const TVXSearchRequest& request, const TVXReplyBlock& reply,
                                        const URLRequest& httpRequest, const StartRecord& start,
                                        const std::vector<std::string>& localSuggestions, SearchResponse answer,
                                        const platform::http::URLSessionTaskMetrics& timing) {
  const std::uint64_t queryId = request.queryId;
  const std::string& input = request.queryString;
  std::string& data = answer.data;
  const auto& response = answer.response;
  const long status = response ? response->statusCode : 0;
  if (response) recordSearchResult(status);
  searchLog().notice("Got network response for (id, query): ({}, {})", queryId, input);
  protocolLog().info("resp: {}", response ? fmt::format("{} {}", status, response->url) : std::string("none"));

  if (answer.error || data.empty()) {
    searchLog().error("error with request {}", httpRequest.url);
    std::optional<TVXError> failure;
    if (answer.error) failure = TVXError{answer.error->domain, answer.error->code, answer.error->description};
    reply(queryId, std::nullopt, failure);
    failSearchFeedback(failure, request, start, data.size(), status, timing);
    return;
  }
  if (!response) {
    searchLog().error("not http response? {}", httpRequest.url);
    TVXError failure{kTVXErrorDomain, 500, "invalid response class"};
    reply(queryId, std::nullopt, failure);
    failSearchFeedback(failure, request, start, data.size(), status, timing);
    return;
  }

  std::string parseError;
  const auto parsed = platform::parseJson(data, &parseError);
  std::optional<TVXError> jsonError;
  if (!parsed) {
    jsonError = TVXError{kTVXJSONErrorDomain, kTVXJSONErrorCodeNotJSON, parseError.empty() ? "not JSON" : parseError};
  } else if (queryCache_) {
    // The server's reply is a list; its first dictionary names the completed query.
    const platform::Dictionary* first = parsed->dictionary();
    if (const auto* list = parsed->array(); list && !list->empty()) first = list->front().dictionary();
    if (first) {
      auto now = env_->clock->now();
      queryCache_->set(Ref<CachedResultSet>(new CachedResultSet(input, &httpRequest, *first, request.uuid, data, now)));
    }
  }
  const std::size_t responseSize = data.size();
  TVXReply result;
  result.scale = request.scale;
  if (request.verboseReply) {
    result.httpRequest = httpRequest;
    result.httpResponse = *response;
  }
  result.data = std::move(data);  // the cache took its own copy
  result.geoSessionEntityString = geoSessionEntityString();
  result.localSuggestions = localSuggestions;
  reply(queryId, std::move(result), jsonError);
  // The client has its answer; the bookkeeping follows.
  endNetworkFeedback(start, parsed ? &*parsed : nullptr, responseSize, status, timing, queryId);

  if (auto forceFetch = response->headers.get("X-Norvel-ForceFetch")) {
    const auto value = platform::parseJson(*forceFetch);
    if (value && value->dictionary()) {
      env_->bagController->forceFetchBag(*value->dictionary());
    } else {
      searchLog().error("Failed to deserialize X-Norvel-ForceFetch header data into a dictionary: {}", *forceFetch);
    }
  }
}

}  // namespace tavix
