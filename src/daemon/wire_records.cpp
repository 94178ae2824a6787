#include "daemon/wire_records.h"

#include "bagview/tvx_bag.h"
#include "platform/json_value.h"
#include "tavix_proto/ipc.pb.h"

namespace tavix {

namespace {

std::optional<std::string> nonEmpty(const std::string& s) {
  if (s.empty()) return std::nullopt;
  return s;
}

void commonFields(const proto::TVXRequest& wire, TVXRequest& request) {
  request.queryId = wire.query_id();
  request.queryString = wire.query_string();
  request.triggerEvent = wire.trigger_event();
  request.uuid = wire.uuid();
  request.scale = wire.scale();
  request.keyboardInputMode = nonEmpty(wire.keyboard_input_mode());
  request.verboseReply = wire.verbose_reply();
  for (const auto& item : wire.query_items()) request.queryItems.push_back({item.name(), item.value()});
  if (!wire.top_topics_json().empty()) {
    // Topics that do not parse are sent as the text they are.
    auto parsed = platform::parseJson(wire.top_topics_json());
    request.topTopics = parsed ? *parsed : platform::PropertyValue(wire.top_topics_json());
  }
  request.l2ModelVersion = nonEmpty(wire.l2_version());
  request.l3ModelVersion = nonEmpty(wire.l3_version());
  request.bundleIdentifier = nonEmpty(wire.bundle_identifier());
}

void headersToWire(const platform::http::HeaderFields& headers,
                   google::protobuf::RepeatedPtrField<proto::TVXHeader>* wire) {
  for (const auto& [name, value] : headers.all()) {
    auto* header = wire->Add();
    header->set_name(name);
    header->set_value(value);
  }
}

}  // namespace

std::shared_ptr<TVXRequest> requestFromWire(const proto::TVXRequest& wire) {
  std::shared_ptr<TVXRequest> request;
  switch (wire.kind_case()) {
    case proto::TVXRequest::kSearch: {
      auto search = std::make_shared<TVXSearchRequest>();
      if (!wire.engaged_suggestion().empty()) search->engagedSuggestion = TVXEngagedSuggestion{wire.engaged_suggestion(), {}};
      request = search;
      break;
    }
    case proto::TVXRequest::kZeroKeyword:
      request = std::make_shared<TVXZeroKeywordRequest>();
      break;
    case proto::TVXRequest::kMoreResults:
      request = std::make_shared<TVXMoreResultsRequest>();
      break;
    case proto::TVXRequest::kCard:
      request = std::make_shared<TVXCardRequest>();
      break;
    case proto::TVXRequest::kLookup: {
      auto lookup = std::make_shared<TVXLookupRequest>();
      lookup->lookupSelectionType = wire.lookup().lookup_selection_type();
      lookup->lookupHintDomain = nonEmpty(wire.lookup().lookup_domain());
      request = lookup;
      break;
    }
    case proto::TVXRequest::kFlightSearch: {
      auto flight = std::make_shared<TVXFlightSearchRequest>();
      flight->flightQuery = wire.flight_search().flight_query();
      request = flight;
      break;
    }
    case proto::TVXRequest::KIND_NOT_SET:
      return nullptr;
  }
  commonFields(wire, *request);
  return request;
}

void replyToWire(TVXReply&& reply, proto::TVXReply* wire) {
  wire->set_scale(reply.scale);
  wire->set_data(std::move(reply.data));
  if (reply.httpRequest) {
    auto* request = wire->mutable_http_request();
    request->set_method(reply.httpRequest->method);
    request->set_url(reply.httpRequest->url);
    headersToWire(reply.httpRequest->headers, request->mutable_headers());
  }
  if (reply.httpResponse) {
    auto* response = wire->mutable_http_response();
    response->set_url(reply.httpResponse->url);
    response->set_status_code(static_cast<int>(reply.httpResponse->statusCode));
    headersToWire(reply.httpResponse->headers, response->mutable_headers());
  }
  if (reply.geoSessionEntityString) wire->set_geo_session_entity(*reply.geoSessionEntityString);
  for (const auto& suggestion : reply.localSuggestions) wire->add_local_suggestions(suggestion);
}

void errorToWire(const TVXError& error, proto::TVXError* wire) {
  wire->set_domain(error.domain);
  wire->set_code(error.code);
  wire->set_reason(error.reason);
}

void bagToWire(const TVXBag& bag, proto::TVXBagData* wire) {
  wire->set_json(platform::toJson(platform::PropertyValue(bag.rawBag())));
  wire->set_user_agent(bag.userAgent());
  if (auto version = bag.version()) wire->set_version(*version);
}

}  // namespace tavix
