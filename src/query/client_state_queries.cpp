// The kinds besides search: zero-keyword, more results, card, look-up and flight. They share one
// shape (bag, request, start record, send, end or failure record, reply) and differ in the table
// of kinds below.
#include <fmt/format.h>

#include <algorithm>
#include <cctype>
#include <fstream>
#include <sstream>

#include "bagview/tvx_bag.h"
#include "core/logging.h"
#include "core/names.h"
#include "network/request_factory.h"
#include "network/retryable_request.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url.h"
#include "platform/http/url_session.h"
#include "platform/json_value.h"
#include "query/client_state.h"
#include "query/client_state_internal.h"
#include "resources/lookup_hints.h"
#include "tavix_proto/feedback_records.pb.h"

namespace tavix {

using platform::http::HTTPURLResponse;
using platform::http::URLError;
using platform::http::URLRequest;
using Request = TVXNetworkRequestFactory::Request;

// How one kind differs from the others.
struct ClientStateQueryKind {
  TavixLoggingCategory category;
  // Log messages; empty where the kind has none.
  const char* performing;
  const char* bagFailed;
  const char* bagDisabled;
  const char* dispatching;
  const char* gotResponse;
  const char* fetchFailed;        // more results and card
  const char* requestLog = "request: {} header: {}";
  bool ensuresBag;
  // What the records carry as input.
  std::function<std::string(const TVXRequest&, const URLRequest&)> input;
  std::function<Request(TVXNetworkRequestFactory&, const TVXRequest&, const TVXBag&, const std::string& guid)> build;
  // The start record's trigger event: the request's own when unset.
  std::optional<int> triggerEvent;
  int endpoint;
  // The zero-keyword start record is made from the request alone, without an identifier.
  bool startWithoutUUID = false;
  // Look-ups and flights are retried on transport errors until the bag's render deadline. Cards
  // and more results go out once: they have no deadline, and a request without one is never
  // retried (only the bag fetch, which has no client waiting on it, retries without a deadline).
  bool retriedUntilRenderDeadline = false;
  // More results and card: success is status 200 with a JSON list.
  bool requiresListWith200 = false;
  bool setsPerformedSearch = false;
  bool messagesRule = false;
  // Look-ups pass on only the results whose instructions the typed query meets.
  bool filtersLookupResults = false;
};

namespace {

std::string emptyInput(const TVXRequest&, const URLRequest&) { return {}; }

// The value of the "q" item of the built URL, decoded ("+" is a blank).
std::string queryItemQ(const TVXRequest&, const URLRequest& http) {
  const auto url = platform::http::URL::parse(http.url);
  const auto query = url ? url->query() : std::nullopt;
  if (!query) return {};
  std::string plusAsBlank = *query;
  for (std::size_t at = 0; (at = plusAsBlank.find('+', at)) != std::string::npos;) plusAsBlank.replace(at, 1, "%20");
  for (const auto& [name, value] : platform::http::decodedQueryItems(plusAsBlank)) {
    if (name == "q") return value.value_or("");
  }
  return {};
}

const ClientStateQueryKind& zeroKeywordKind();
const ClientStateQueryKind& moreResultsKind();
const ClientStateQueryKind& cardKind();
const ClientStateQueryKind& lookupKind();
const ClientStateQueryKind& flightKind();

}  // namespace

void ClientState::zeroKeyword(std::shared_ptr<const TVXZeroKeywordRequest> request, TVXReplyBlock reply) {
  performQuery(zeroKeywordKind(), std::move(request), std::move(reply));
}

void ClientState::moreResults(std::shared_ptr<const TVXMoreResultsRequest> request, TVXReplyBlock reply) {
  performQuery(moreResultsKind(), std::move(request), std::move(reply));
}

void ClientState::card(std::shared_ptr<const TVXCardRequest> request, TVXReplyBlock reply) {
  performQuery(cardKind(), std::move(request), std::move(reply));
}

void ClientState::lookup(std::shared_ptr<const TVXLookupRequest> request, TVXReplyBlock reply) {
  performQuery(lookupKind(), std::move(request), std::move(reply));
}

void ClientState::flightSearch(std::shared_ptr<const TVXFlightSearchRequest> request, TVXReplyBlock reply) {
  if (env_->defaults->boolForKey("TVXFlightUseDebugData")) {
    debugFlightSearch(*request, reply);
    return;
  }
  performQuery(flightKind(), std::move(request), std::move(reply));
}

void ClientState::performQuery(const ClientStateQueryKind& kind, std::shared_ptr<const TVXRequest> request,
                               TVXReplyBlock reply) {
  auto& log = TavixLogForCategory(kind.category);
  log.notice(fmt::runtime(kind.performing), identifier_, static_cast<const void*>(&reply));

  std::shared_ptr<const TVXBag> bag;
  if (!bagForQuery(kind, *request, reply, &bag)) return;
  auto built = bag ? kind.build(*env_->requestFactory, *request, *bag, currentUserGuid()) : std::nullopt;
  if (!built) {
    failUnbuiltRequest(*request, kind.input(*request, URLRequest{}), reply, log);
    return;
  }
  const auto httpRequest = std::make_shared<const URLRequest>(std::move(*built));
  TavixLogForCategory(TavixLoggingCategoryProtocol)
      .info(fmt::runtime(kind.requestLog), httpRequest->url, query_internal::headersText(httpRequest->headers));
  if (kind.messagesRule) recordDidGoToSearch(*request, kind.input(*request, *httpRequest));

  const StartRecord start = startRecordForQuery(kind, *request, *httpRequest);
  addCodable(*start, request->queryId, false);
  if (kind.dispatching[0] != '\0') log.notice(fmt::runtime(kind.dispatching));

  auto self = shared_from_this();
  auto completion = [self, &kind, request, reply, httpRequest, start](
                        std::string data, std::optional<HTTPURLResponse> response, std::optional<URLError> error,
                        const platform::http::URLSessionTaskMetrics& timing) {
    self->queryResponseArrived(kind, *request, reply, *httpRequest, start,
                               SearchResponse{std::move(data), std::move(response), std::move(error)}, timing);
  };

  const auto proxy = proxyForTask();
  std::shared_ptr<platform::http::URLSessionDataTask> task;
  if (kind.retriedUntilRenderDeadline) {
    const auto expire = env_->clock->now() +
                        platform::seconds(static_cast<double>(bag->searchRenderTimeout()) / 1000.0) -
                        platform::seconds(0.5);
    auto retryable = std::make_shared<const TVXRetryableNetworkRequest>(*httpRequest, expire, false, proxy);
    task = dataTaskWithRetryableRequest(env_->session, retryable, 1, 3, *env_->clock, *retryQueue_,
                                        std::move(completion));
  } else {
    task = dataTaskWithTiming(env_->session, *httpRequest, std::move(completion));
    if (proxy) task->setProxy(*proxy);
  }
  task->resume();
  if (kind.setsPerformedSearch) setPerformedSearch();
  markNetworkRequest();
}

bool ClientState::bagForQuery(const ClientStateQueryKind& kind, const TVXRequest& request, const TVXReplyBlock& reply,
                              std::shared_ptr<const TVXBag>* bag) {
  if (!kind.ensuresBag) {
    // These kinds follow a result the client already has, so they never wait for a bag: without
    // one there is no URL to ask.
    *bag = currentBag();
    return true;
  }
  auto& log = TavixLogForCategory(kind.category);
  // The recorded input of these kinds does not depend on the built request.
  const std::string input = kind.input(request, URLRequest{});
  if (!ensureBag()) {
    log.error(fmt::runtime(kind.bagFailed));
    recordSkipSearch(proto::SkipSearchType::bag_fetch_failed, input, request.queryId);
    reply(request.queryId, std::nullopt, TVXError{kTVXErrorDomain, 1, "timeout"});
    return false;
  }
  *bag = currentBag();
  if (!(*bag)->isEnabled()) {
    log.notice(fmt::runtime(kind.bagDisabled));
    recordSkipSearch(proto::SkipSearchType::bag_disabled, input, request.queryId);
    reply(request.queryId, std::nullopt, std::nullopt);
    return false;
  }
  return true;
}

ClientState::StartRecord ClientState::startRecordForQuery(const ClientStateQueryKind& kind, const TVXRequest& request,
                                                          const URLRequest& httpRequest) {
  StartRecord start;
  if (kind.startWithoutUUID) {
    start = std::make_shared<proto::CTStartNetworkSearchFeedback>();
    start->set_timestamp(query_internal::eventTimestamp(*env_->clock));
    start->set_url(httpRequest.url);
    for (const auto& [name, value] : httpRequest.headers.all()) (*start->mutable_headers())[name] = value;
  } else {
    start = startSearchEventForRequest(httpRequest);
  }
  start->set_input(kind.input(request, httpRequest));
  start->set_trigger_event(
      static_cast<proto::TriggerSearchRequestEvent::Value>(kind.triggerEvent.value_or(request.triggerEvent)));
  start->set_endpoint_type(static_cast<proto::EndpointType::Value>(kind.endpoint));
  if (const auto* lookup = dynamic_cast<const TVXLookupRequest*>(&request)) {
    start->set_lookup_selection_type(lookup->lookupSelectionType == TVXLookupSelectionTypeExplicit
                                         ? proto::LookupSelectionType::lookup_explicit
                                     : lookup->lookupSelectionType == TVXLookupSelectionTypeHint
                                         ? proto::LookupSelectionType::lookup_hint_tap
                                         : proto::LookupSelectionType::lookup_default);
  }
  return start;
}

void ClientState::queryResponseArrived(const ClientStateQueryKind& kind, const TVXRequest& request,
                                       const TVXReplyBlock& reply, const URLRequest& httpRequest,
                                       const StartRecord& start, SearchResponse answer,
                                       const platform::http::URLSessionTaskMetrics& timing) {
  auto& log = TavixLogForCategory(kind.category);
  const std::uint64_t queryId = request.queryId;
  const auto& response = answer.response;
  const auto& error = answer.error;
  std::string& data = answer.data;
  const long status = response ? response->statusCode : 0;
  if (response) recordSearchResult(status);
  if (kind.gotResponse[0] != '\0') log.notice(fmt::runtime(kind.gotResponse));
  TavixLogForCategory(TavixLoggingCategoryProtocol)
      .info("resp: {}", response ? fmt::format("{} {}", status, response->url) : std::string("none"));

  std::optional<TVXError> transport;
  if (error) transport = TVXError{error->domain, error->code, error->description};
  std::optional<TVXError> jsonError;
  std::optional<platform::PropertyValue> parsed;
  if (kind.requiresListWith200) {
    if (error || status != 200) {
      log.error("{}", fmt::format(fmt::runtime(kind.fetchFailed), status,
                                  error ? error->description : std::string("none")));
      // The server's status is not one of the daemon's own codes: it travels in a domain of its own.
      const TVXError statusError{kTVXHTTPStatusErrorDomain, status, fmt::format("statusCode {}", status)};
      reply(queryId, std::nullopt, transport ? *transport : statusError);
      failSearchFeedback(transport, request, start, data.size(), status, timing);
      return;
    }
    std::string parseError;
    const auto parsed = platform::parseJson(data, &parseError);
    if (!parsed || !parsed->array()) {
      log.error("Failed to deserialize card details for into a dictionary. Error: {}. Response data: \"{}\"",
                parsed ? std::string("not a list") : parseError, data);
      reply(queryId, std::nullopt, TVXError{kTVXJSONErrorDomain, kTVXJSONErrorCodeNotJSON, "not a list"});
      failSearchFeedback(std::nullopt, request, start, data.size(), status, timing);
      return;
    }
    endNetworkFeedback(start, &*parsed, data.size(), 200, timing, queryId);
  } else {
    if (error || data.empty()) {
      log.error("error with request {}", httpRequest.url);
      reply(queryId, std::nullopt, transport);
      failSearchFeedback(transport, request, start, data.size(), status, timing);
      return;
    }
    if (!response) {
      log.error("not http response? {}", httpRequest.url);
      TVXError failure{kTVXErrorDomain, 500, "invalid response class"};
      reply(queryId, std::nullopt, failure);
      failSearchFeedback(failure, request, start, data.size(), status, timing);
      return;
    }
    // Flight answers are not JSON; the others pass a body that does not parse on to the client
    // with the parse error, as a search does. One parse serves that check, the end record and the
    // look-up filter.
    std::string parseError;
    parsed = platform::parseJson(data, &parseError);
    if (!parsed && kind.endpoint != proto::EndpointType::tavix_flight) {
      jsonError = TVXError{kTVXJSONErrorDomain, kTVXJSONErrorCodeNotJSON, parseError.empty() ? "not JSON" : parseError};
    }
    endNetworkFeedback(start, parsed ? &*parsed : nullptr, data.size(), status, timing, queryId);
  }

  if (kind.filtersLookupResults && parsed) {
    // Untouched bytes when nothing is dropped: the client gets exactly what the server sent.
    auto kept = filterLookupResults(request.queryString, *parsed);
    if (kept != *parsed) data = platform::toJson(kept);
  }

  TVXReply result;
  result.scale = request.scale;
  if (request.verboseReply) {
    result.httpRequest = httpRequest;
    result.httpResponse = response;
  }
  result.data = std::move(data);
  result.geoSessionEntityString = geoSessionEntityString();
  reply(queryId, std::move(result), jsonError);
}

// Answers from a local JSON file instead of the server: a list (or a single object) of flights,
// each with "carrier_code" and "flight_number"; the query "UA 123" or "ua123" finds carrier "UA",
// number "123". The reply's data is the JSON list of the flights found.
void ClientState::debugFlightSearch(const TVXFlightSearchRequest& request, const TVXReplyBlock& reply) {
  auto& log = TavixLogForCategory(TavixLoggingCategoryFlight);
  std::string location = "file:///tmp/flight_dummy_data.json";
  if (auto configured = env_->defaults->stringForKey("TVXFlightDebugDataLocation")) location = *configured;
  const std::string path = location.rfind("file://", 0) == 0 ? location.substr(7) : location;
  std::ifstream file(path, std::ios::binary);
  std::ostringstream text;
  text << file.rdbuf();
  if (!file) {
    log.error("Failed to load flight test data. Error: {}", "cannot read " + path);
    reply(request.queryId, std::nullopt, TVXError{kTVXErrorDomain, 404, "no flight test data"});
    return;
  }
  std::string parseError;
  const auto parsed = platform::parseJson(text.str(), &parseError);
  if (!parsed || (!parsed->array() && !parsed->dictionary())) {
    log.error("Failed to parse flight test data json. Error: {}", parseError.empty() ? "not a list" : parseError);
    reply(request.queryId, std::nullopt, TVXError{kTVXJSONErrorDomain, kTVXJSONErrorCodeNotJSON, "flight test data is not JSON"});
    return;
  }
  auto squeeze = [](std::string s) {
    std::string out;
    for (unsigned char c : s) {
      if (!std::isspace(c)) out += static_cast<char>(std::toupper(c));
    }
    return out;
  };
  auto text_of = [](const platform::Dictionary& d, const char* key) -> std::string {
    const auto it = d.find(key);
    if (it == d.end()) return {};
    if (const auto* s = it->second.string()) return *s;
    if (const auto* i = it->second.integer()) return std::to_string(*i);
    return {};
  };
  const std::string wanted = squeeze(request.flightQuery);
  platform::PropertyValue::Array found;
  auto consider = [&](const platform::PropertyValue& value) {
    const auto* flight = value.dictionary();
    if (!flight) return;
    const std::string number = squeeze(text_of(*flight, "flight_number"));
    const std::string carrier = squeeze(text_of(*flight, "carrier_code"));
    if (!number.empty() && (wanted == carrier + number || (carrier.empty() && wanted == number))) {
      found.push_back(value);
    }
  };
  if (const auto* list = parsed->array()) {
    std::for_each(list->begin(), list->end(), consider);
  } else {
    consider(*parsed);
  }
  TVXReply answer;
  answer.scale = request.scale;
  answer.data = platform::toJson(platform::PropertyValue(std::move(found)));
  reply(request.queryId, std::move(answer), std::nullopt);
}

namespace {

const ClientStateQueryKind& zeroKeywordKind() {
  static const ClientStateQueryKind kind{
      .category = TavixLoggingCategoryZeroKeyword,
      .performing = "session {} performing zkw query, reply {}",
      .bagFailed = "Bag fetch failed, can't complete non-cached zkw query.",
      .bagDisabled = "no zkw, bag disabled",
      .dispatching = "Dispatching network request for zkw query",
      .gotResponse = "Got network response for zkw query",
      .fetchFailed = "",
      .ensuresBag = true,
      .input = emptyInput,
      .build = [](TVXNetworkRequestFactory& f, const TVXRequest& r, const TVXBag& bag, const std::string& guid) {
        return f.zeroKeywordRequest(static_cast<const TVXZeroKeywordRequest&>(r), bag, guid);
      },
      .triggerEvent = std::nullopt,
      .endpoint = proto::EndpointType::tavix_search,
      .startWithoutUUID = true,
      .messagesRule = true,
  };
  return kind;
}

const ClientStateQueryKind& moreResultsKind() {
  static const ClientStateQueryKind kind{
      .category = TavixLoggingCategoryMoreResults,
      .performing = "session {} performing more results query, reply {}",
      .bagFailed = "",
      .bagDisabled = "",
      .dispatching = "",
      .gotResponse = "",
      .fetchFailed = "More results fetch failed with HTTP status code {} error {}",
      .ensuresBag = false,
      .input = queryItemQ,
      .build = [](TVXNetworkRequestFactory& f, const TVXRequest& r, const TVXBag& bag, const std::string& guid) {
        return f.moreResultsRequest(static_cast<const TVXMoreResultsRequest&>(r), bag, guid);
      },
      .triggerEvent = std::nullopt,
      .endpoint = proto::EndpointType::tavix_search,
      .requiresListWith200 = true,
      .messagesRule = true,
  };
  return kind;
}

const ClientStateQueryKind& cardKind() {
  static const ClientStateQueryKind kind{
      .category = TavixLoggingCategoryCard,
      .performing = "session {} performing card query, reply {}",
      .bagFailed = "",
      .bagDisabled = "",
      .dispatching = "",
      .gotResponse = "",
      .fetchFailed = "Card fetch failed with HTTP status code {} error {}",
      .requestLog = "card request: {} header: {}",
      .ensuresBag = false,
      .input = emptyInput,
      .build = [](TVXNetworkRequestFactory& f, const TVXRequest& r, const TVXBag& bag, const std::string& guid) {
        return f.cardRequest(static_cast<const TVXCardRequest&>(r), bag, guid);
      },
      .triggerEvent = std::nullopt,
      .endpoint = proto::EndpointType::tavix_card,
      .requiresListWith200 = true,
  };
  return kind;
}

const ClientStateQueryKind& lookupKind() {
  static const ClientStateQueryKind kind{
      .category = TavixLoggingCategoryLookUp,
      .performing = "session {} performing lookup query, reply {}",
      .bagFailed = "Bag fetch failed, can't complete non-cached lookup query.",
      .bagDisabled = "no lookup, bag disabled",
      .dispatching = "Dispatching network request for lookup query",
      .gotResponse = "Got network response for lookup query",
      .fetchFailed = "",
      .ensuresBag = true,
      .input = [](const TVXRequest& r, const URLRequest&) { return r.queryString; },
      .build = [](TVXNetworkRequestFactory& f, const TVXRequest& r, const TVXBag& bag, const std::string& guid) {
        return f.lookupRequest(static_cast<const TVXLookupRequest&>(r), bag, guid);
      },
      .triggerEvent = proto::TriggerSearchRequestEvent::lookup,
      .endpoint = proto::EndpointType::tavix_search,
      .retriedUntilRenderDeadline = true,
      .setsPerformedSearch = true,
      .filtersLookupResults = true,
  };
  return kind;
}

const ClientStateQueryKind& flightKind() {
  static const ClientStateQueryKind kind{
      .category = TavixLoggingCategoryFlight,
      .performing = "session {} performing flight query, reply {}",
      .bagFailed = "Bag fetch failed, can't complete flight query.",
      .bagDisabled = "no flights, bag disabled",
      .dispatching = "Dispatching network request for flight query",
      .gotResponse = "Got network response for flight query",
      .fetchFailed = "",
      .ensuresBag = true,
      .input = [](const TVXRequest& r, const URLRequest&) {
        return static_cast<const TVXFlightSearchRequest&>(r).flightQuery;
      },
      .build = [](TVXNetworkRequestFactory& f, const TVXRequest& r, const TVXBag& bag, const std::string& guid) {
        return f.flightSearchRequest(static_cast<const TVXFlightSearchRequest&>(r), bag, guid);
      },
      .triggerEvent = proto::TriggerSearchRequestEvent::flight,
      .endpoint = proto::EndpointType::tavix_flight,
      .retriedUntilRenderDeadline = true,
      .setsPerformedSearch = true,
  };
  return kind;
}

}  // namespace

}  // namespace tavix
