// The requests that clients send: plain values. The IPC layer maps its wire records onto these;
// the query paths and the request factory read them.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/http/url_request.h"
#include "platform/property_value.h"

namespace tavix {

// A query item; an item without a value is sent as its name alone ("?flag").
struct TVXQueryItem {
  std::string name;
  std::optional<std::string> value;
  bool operator==(const TVXQueryItem&) const = default;
};

// The trigger events the request paths act on, by their wire numbers; the feedback vocabulary
// (TriggerSearchRequestEvent) names every event up to 23.
enum TVXTriggerEvent : std::int64_t {
  TVXTriggerEventSuggestion = 8,
  TVXTriggerEventPartialSuggestion = 10,
  TVXTriggerEventSuggestQueries = 21,
  TVXTriggerEventSearchOnly = 22,
  TVXTriggerEventReturnKey = 23,
  TVXTriggerEventSuggestWithResults = 24,
};

// The fields every kind carries.
struct TVXRequest {
  virtual ~TVXRequest() = default;

  std::uint64_t queryId = 0;      // chosen by the client
  std::string queryString;        // the user's input; empty for kinds without one
  std::int64_t triggerEvent = 0;  // what caused the query (typing, explicit search...)
  double scale = 0;               // display scale; 0 means "not set"
  std::optional<std::string> keyboardInputMode;  // e.g. "en_US", "ja_JP-Kana"
  std::vector<TVXQueryItem> queryItems;          // the client's own items, forced into the request
  std::optional<platform::PropertyValue> topTopics;  // sent as JSON text
  std::optional<std::string> l2ModelVersion;
  std::optional<std::string> l3ModelVersion;
  std::optional<std::string> bundleIdentifier;   // of the calling client
  std::string uuid;                              // names the request in feedback
  bool verboseReply = false;                     // the reply carries the HTTP request and response
};

// A suggestion the user engaged with, as the client saw it.
struct TVXEngagedSuggestion {
  std::string suggestion;
  std::optional<std::string> fbr;  // server-opaque feedback blob: base64 of a JSON object
};

// A completion found on the device before the server is asked.
struct TVXLocalSuggestion {
  std::string completion;
  // Where it came from: "se" search, "ss" browser search, "ut" typed URL, "co" completion
  // history, "3d" third-party, "en" engaged.
  std::string origin;
  double score = 0;
};

struct TVXSearchRequest : TVXRequest {
  std::optional<TVXEngagedSuggestion> engagedSuggestion;
  std::vector<TVXLocalSuggestion> localSuggestions;
};

struct TVXZeroKeywordRequest : TVXRequest {};

struct TVXMoreResultsRequest : TVXRequest {};

struct TVXCardRequest : TVXRequest {};

// Lookup selection types.
enum TVXLookupSelectionType : int {
  TVXLookupSelectionTypeDefault = 0,
  TVXLookupSelectionTypeExplicit = 1,
  TVXLookupSelectionTypeHint = 2,
};

struct TVXLookupRequest : TVXRequest {
  std::optional<std::string> lookupHintDomain;
  int lookupSelectionType = TVXLookupSelectionTypeDefault;
  std::optional<std::string> lookupContext;  // the text around the selection
};

struct TVXFlightSearchRequest : TVXRequest {
  std::string flightQuery;
};

// What a client says about itself when it connects: its identifier keys its state, its user agent
// is the client's own part of the full user agent.
struct TVXSessionConfiguration {
  std::string identifier;
  std::string userAgent;
  bool operator==(const TVXSessionConfiguration&) const = default;
};

// An error answered to a client: a domain (kTVXErrorDomain for the daemon's own, the transport's
// otherwise), a code and the "reason".
struct TVXError {
  std::string domain;
  std::int64_t code = 0;
  std::string reason;
};

// The daemon's answer to a query.
struct TVXReply {
  double scale = 0;
  std::string data;  // the server's body, as it came (or as cached)
  std::optional<platform::http::URLRequest> httpRequest;       // verbose replies only
  std::optional<platform::http::HTTPURLResponse> httpResponse;  // verbose replies only
  std::optional<std::string> geoSessionEntityString;
  std::vector<std::string> localSuggestions;  // engaged completions found on the device
};

// Called exactly once per query: the request's query id, then a reply or none, an error or none.
using TVXReplyBlock =
    std::function<void(std::uint64_t queryId, std::optional<TVXReply> reply, std::optional<TVXError> error)>;

}  // namespace tavix
