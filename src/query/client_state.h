// ClientState: everything the daemon keeps for one client identifier, shared by all of that
// client's connections and outliving them: its user agent and configuration, its own copy of the
// bag (labelled with its user agent), its query cache, its user GUID controller and feedback
// session manager, and the query paths (search, zero-keyword, more results, card, look-up,
// flight) with the feedback records around their network requests.
//
// Threading: any method may be called from any thread; the fields below are guarded by one mutex.
// ensureBag() (the query paths' wait) may block the caller for up to
// kTVXFirstLaunchBagSemaphoreWait while the bag controller fetches; bag() never blocks. The query
// methods run their synchronous part on the caller's queue and finish on the URL session's queue;
// their reply block is called exactly once.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "core/requests.h"
#include "feedback/client_session_manager.h"
#include "platform/dispatch.h"
#include "platform/notification_center.h"
#include "platform/time.h"

namespace google::protobuf {
class Message;
}

namespace tavix {

struct ClientStateQueryKind;
class ClientSessionManager;
class EngagedCompletionCache;
class LocationManager;
class QueryCache;
class TavixBagController;
class TavixUserGUIDController;
class TVXBag;
class TVXNetworkRequestFactory;

namespace proto {
class CTStartNetworkSearchFeedback;
}
namespace platform {
class Logger;
class PropertyValue;
class SerialQueue;
class UserDefaults;
namespace http {
class URLSession;
class URLSessionDataTask;
struct URLSessionTaskMetrics;
}  // namespace http
}  // namespace platform

// The domain of the error that comes with a reply body that is not JSON.
inline constexpr const char* kTVXJSONErrorDomain = "TavixJSONErrorDomain";
// Its one code: the text could not be read as the JSON expected.
inline constexpr long kTVXJSONErrorCodeNotJSON = 3840;
// The domain of a server's HTTP status that failed a request (the code is the status), kept apart
// from kTVXErrorDomain, whose codes are the daemon's own.
inline constexpr const char* kTVXHTTPStatusErrorDomain = "TavixHTTPStatusErrorDomain";

// How long a query waits for a bag that is being fetched, in milliseconds: longer on a device that
// has never recorded resources (first launch), where the bag is certainly on its way.
inline constexpr int kTVXFirstLaunchBagSemaphoreWait = 600;
inline constexpr int kTVXDefaultBagSemaphoreWait = 300;

class ClientState : public std::enable_shared_from_this<ClientState> {
 public:
  using BagReply = std::function<void(std::shared_ptr<const TVXBag> bag, std::optional<TVXError> error)>;

  // What every client state works with: one struct, made at start-up and shared by all states.
  struct Environment {
    platform::DispatchPool* pool = nullptr;
    platform::Clock* clock = nullptr;
    std::shared_ptr<platform::UserDefaults> defaults;
    std::shared_ptr<platform::NotificationCenter> center;  // bag changes; the query caches' purges
    std::shared_ptr<TVXNetworkRequestFactory> requestFactory;
    std::shared_ptr<TavixBagController> bagController;
    std::shared_ptr<EngagedCompletionCache> engagedCompletionCache;
    std::shared_ptr<LocationManager> locationManager;
    std::shared_ptr<platform::http::URLSession> session;  // the queries'
    // The daemon's GUID controller and session manager: shared by every state when
    // `sessions.sharedSession` is set; the manager also records the warm-up requests.
    std::shared_ptr<TavixUserGUIDController> guidController;
    std::shared_ptr<ClientSessionManager> sessionManager;
    // What a state's own session manager is made with when sessions are not shared.
    ClientSessionManager::Environment sessions;
  };

  // Reads "TVXNoQueryCache"; shares the daemon's GUID controller and session manager when
  // sessions are shared, else makes its own (the manager keyed by `identifier`).
  static std::shared_ptr<ClientState> create(std::shared_ptr<const Environment> env, std::string identifier);
  ~ClientState();
  ClientState(const ClientState&) = delete;
  ClientState& operator=(const ClientState&) = delete;

  // ---- The bag

  // Adopts `userAgent` when non-empty and new (re-labelling the bag, emptying the query cache),
  // then answers the bag: error code 1 "no UserAgent" without a user agent, "timeout" when none
  // came within the bag wait. Never blocks: `reply` runs at once when the bag is held (or there
  // is no user agent), else on the state's queue when a bag arrives or the wait is over.
  void bag(const std::string& userAgent, BagReply reply);
  // Whether a bag is held, fetching and waiting for one when not.
  bool ensureBag();
  // The tool's connections re-label the state with their user agent; an empty one leaves the
  // state without.
  void updateClient(const std::string& userAgent);

  // ---- Connection warming: a warm-up request when the bag names one and no request went out in
  // the last 30 seconds.
  void warm();

  // ---- Queries. Each calls `reply` exactly once.
  void search(std::shared_ptr<const TVXSearchRequest> request, TVXReplyBlock reply);
  void zeroKeyword(std::shared_ptr<const TVXZeroKeywordRequest> request, TVXReplyBlock reply);
  void moreResults(std::shared_ptr<const TVXMoreResultsRequest> request, TVXReplyBlock reply);
  void card(std::shared_ptr<const TVXCardRequest> request, TVXReplyBlock reply);
  void lookup(std::shared_ptr<const TVXLookupRequest> request, TVXReplyBlock reply);
  void flightSearch(std::shared_ptr<const TVXFlightSearchRequest> request, TVXReplyBlock reply);

  // ---- Fields
  const std::string& identifier() const { return identifier_; }
  const std::optional<std::string>& clientShortName() const { return clientShortName_; }
  std::optional<std::string> userAgent() const;
  void setUserAgent(std::optional<std::string> userAgent);  // as loaded from the persisted list
  std::optional<TVXSessionConfiguration> configuration() const;
  void setConfiguration(TVXSessionConfiguration configuration);
  // The client's bag, none until one was loaded.
  std::shared_ptr<const TVXBag> currentBag() const;
  // None when "TVXNoQueryCache" is set.
  const std::shared_ptr<QueryCache>& queryCache() const { return queryCache_; }
  const std::shared_ptr<TavixUserGUIDController>& guidController() const { return guidController_; }
  const std::shared_ptr<ClientSessionManager>& sessionManager() const { return sessionManager_; }
  std::optional<platform::TimePoint> lastNetworkRequest() const;

  // The engaged completion kept for the last keystroke (none or one).
  std::vector<std::string> completionCacheSuggestions() const;

  // A network request went out for this client now (warming is skipped for 30 seconds).
  void markNetworkRequest();
  // No resource has ever been recorded ("download_resources" absent from the defaults).
  bool isProbablyFirstLaunchEver() const;

 private:
  ClientState(std::shared_ptr<const Environment> env, std::string identifier);
  void bagChangeNotification(const platform::Notification& notification);
  // Replaces the held bag (if any) by one labelled with `userAgent`. Under mutex_.
  void relabelBagLocked();
  void observeBagChangesLocked();
  // Adopts a new non-empty user agent; answers whether the query cache must be emptied, or an
  // error when the state has no user agent at all. Under mutex_.
  std::optional<TVXError> adoptUserAgentLocked(const std::string& userAgent, bool* relabelled);
  // A fetch is under way: the wait of ensureBag(), in milliseconds.
  int bagWaitMilliseconds() const;

  // ---- Network feedback (client_state_feedback.cpp)
  using StartRecord = std::shared_ptr<proto::CTStartNetworkSearchFeedback>;
  // A start record for `request` (URL, headers, a new UUID), not yet added anywhere.
  StartRecord startSearchEventForRequest(const platform::http::URLRequest& request);
  // Adds the end record: server values from the first element of the reply as the caller parsed
  // it (none when it is null or not a list of dictionaries), size, status and the task's timing.
  void endNetworkFeedback(const StartRecord& start, const platform::PropertyValue* reply, std::uint64_t responseSize,
                          long statusCode, const platform::http::URLSessionTaskMetrics& timing, std::uint64_t queryId);
  void endNetworkFeedback(const StartRecord& start, const platform::PropertyValue* reply, std::uint64_t responseSize,
                          long statusCode, const platform::http::URLSessionTaskMetrics& timing, std::uint64_t queryId,
                          const std::string& userAgent);
  // The error record and the end record of a request that failed; counts transport errors.
  void failSearchFeedback(const std::optional<TVXError>& error, const TVXRequest& request, const StartRecord& start,
                          std::uint64_t responseSize, long statusCode,
                          const platform::http::URLSessionTaskMetrics& timing);
  // Counts the server's HTTP status per user agent.
  void recordSearchResult(long statusCode);
  void setPerformedSearch();
  // The proxy a task goes through: the network-service proxy's while its status is 1 (logged
  // when its URL cannot be used), else none.
  std::optional<std::string> proxyForTask() const;
  // A request the factory could not build (no bag, or the bag lacks the URL): the client hears it
  // as the transport would say it, and the failure is recorded like any other.
  void failUnbuiltRequest(const TVXRequest& request, const std::string& input, const TVXReplyBlock& reply,
                          platform::Logger& log);
  // Wraps `codable` with this client's user agent (and the current GUID when asked) and adds it.
  void addCodable(const google::protobuf::Message& codable, std::uint64_t queryId, bool withUserGuid);
  void recordSkipSearch(int reason, const std::string& input, std::uint64_t queryId);
  void recordDidGoToSearch(const TVXRequest& request, const std::string& input);
  std::optional<std::string> geoSessionEntityString();
  std::string currentUserGuid();

  // ---- The steps of search() (client_state_search.cpp)
  // The engaged completions for the input: the first is kept for the keystroke (and remembered
  // for the next ones), the rest go back with the reply.
  struct LocalCompletions {
    std::vector<std::string> kept;
    std::vector<std::string> others;
  };
  LocalCompletions localCompletionsForSearch(const TVXSearchRequest& request, const TVXBag& bag);
  // Answers from the query cache when it holds this request; records the hit.
  bool answerSearchFromQueryCache(const TVXSearchRequest& request, const platform::http::URLRequest& httpRequest,
                                  const std::vector<std::string>& localSuggestions, const TVXReplyBlock& reply);
  void sendSearch(std::shared_ptr<const TVXSearchRequest> request, TVXReplyBlock reply,
                  std::shared_ptr<const platform::http::URLRequest> httpRequest,
                  std::vector<std::string> localSuggestions);
  struct SearchResponse {
    std::string data;
    std::optional<platform::http::HTTPURLResponse> response;
    std::optional<platform::http::URLError> error;
  };
  void searchResponseArrived(const TVXSearchRequest& request, const TVXReplyBlock& reply,
                             const platform::http::URLRequest& httpRequest, const StartRecord& start,
                             const std::vector<std::string>& localSuggestions, SearchResponse answer,
                             const platform::http::URLSessionTaskMetrics& timing);

  // ---- The kinds besides search (client_state_queries.cpp)
  void performQuery(const ClientStateQueryKind& kind, std::shared_ptr<const TVXRequest> request, TVXReplyBlock reply);
  // The steps of performQuery(). The bag to build with; false when the query was answered
  // already (no bag could be had, or the bag is disabled).
  bool bagForQuery(const ClientStateQueryKind& kind, const TVXRequest& request, const TVXReplyBlock& reply,
                   std::shared_ptr<const TVXBag>* bag);
  StartRecord startRecordForQuery(const ClientStateQueryKind& kind, const TVXRequest& request,
                                  const platform::http::URLRequest& httpRequest);
  void queryResponseArrived(const ClientStateQueryKind& kind, const TVXRequest& request, const TVXReplyBlock& reply,
                            const platform::http::URLRequest& httpRequest, const StartRecord& start,
                            SearchResponse answer, const platform::http::URLSessionTaskMetrics& timing);
  void debugFlightSearch(const TVXFlightSearchRequest& request, const TVXReplyBlock& reply);

  const std::shared_ptr<const Environment> env_;
  const std::string identifier_;
  const std::optional<std::string> clientShortName_;
  std::shared_ptr<QueryCache> queryCache_;
  std::shared_ptr<TavixUserGUIDController> guidController_;
  std::shared_ptr<ClientSessionManager> sessionManager_;

  mutable std::mutex mutex_;
  std::condition_variable bagSignal_;
  unsigned bagSignals_ = 0;  // the semaphore's count: a signal without a waiter is kept
  std::optional<std::string> userAgent_;
  std::optional<TVXSessionConfiguration> configuration_;
  std::shared_ptr<const TVXBag> bag_;
  std::optional<platform::TimePoint> lastNetworkRequest_;
  std::vector<std::string> completionCacheSuggestions_;  // found for the previous keystroke
  platform::NotificationCenter::Registration bagObserver_;
  // Callers of bag() waiting for a bag; answered on waitQueue_.
  std::vector<std::shared_ptr<BagReply>> bagWaiters_;
  std::unique_ptr<platform::SerialQueue> waitQueue_;
  // Where retried attempts of the retryable kinds are started.
  std::unique_ptr<platform::SerialQueue> retryQueue_;
};

}  // namespace tavix
