// The in-memory query cache: search replies kept by their completed query, so that a reply fetched
// for "ca" that completes to "camera" serves "cam", "came"... while the user keeps typing.
//
// Threading: QueryCache owns the serial queue "com.norvel.tavix.queryCache"; every read and write
// of its tree and cost runs there. set() hops on asynchronously; getRequest(), get() and
// removeAllObjects() run synchronously on it (never call them from that queue). Callers may come
// from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "cache/critbit.h"
#include "core/names.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/notification_center.h"
#include "platform/property_value.h"

namespace tavix {

namespace platform {
class MemoryPressureSource;
namespace http {
struct URLRequest;
}
}  // namespace platform

using QueryItems = std::vector<std::pair<std::string, std::optional<std::string>>>;

// The length of a query as the user typed it: its characters (code points), not its UTF-8 bytes,
// so that "café" is as long as "cafe".
std::size_t queryLength(std::string_view utf8);

// The query items of an absolute URL, percent-decoded, in order. An item without "=" has no value.
QueryItems queryItemsOfURL(const std::string& url);
// The value of the first item named `name` (exact, case-sensitive), or nullopt.
std::optional<std::string> findQueryParam(const QueryItems& items, const std::string& name);

// One cached reply. Immutable after construction.
class CachedResultSet : public RefCounted {
 public:
  // `reply` is the parsed reply dictionary: "query" (string), "completion_score" (number) and
  // "max_age" (number of seconds, 0 or absent: never expires) are read from it. `now` dates the
  // expiry. A request with no URL leaves qtype, suggest_queries and localCompletion empty.
  CachedResultSet(const std::string& input, const platform::http::URLRequest* request,
                  const platform::Dictionary& reply, std::string uuid, std::string data, platform::TimePoint now);

  const std::string& input() const { return input_; }
  const std::string& query() const { return query_; }
  // Never filled: consumers rebuild results from data().
  const platform::Dictionary* resultSet() const { return nullptr; }
  const std::optional<platform::TimePoint>& expireTime() const { return expireTime_; }
  const std::string& uuid() const { return uuid_; }
  double uiScale() const { return uiScale_; }
  float completionScore() const { return completionScore_; }
  const std::string& data() const { return data_; }
  const std::optional<std::string>& qtype() const { return qtype_; }
  const std::optional<std::string>& suggest_queries() const { return suggestQueries_; }
  const std::optional<std::string>& localCompletion() const { return localCompletion_; }
  std::uint64_t cost() const { return data_.size(); }

 private:
  std::string input_;
  std::string query_;
  std::optional<platform::TimePoint> expireTime_;
  std::string uuid_;
  double uiScale_ = 0;
  float completionScore_ = 0;
  std::string data_;
  std::optional<std::string> qtype_;
  std::optional<std::string> suggestQueries_;
  std::optional<std::string> localCompletion_;
};

// What a look-up needs of a search request: the typed text, the UI scale (0: any) and the extra
// query items the client asked for (a request with any is never served from the cache).
struct CacheSearchRequest {
  std::string queryString;
  double scale = 0;
  QueryItems queryItems;
};

class QueryCache : public std::enable_shared_from_this<QueryCache> {
 public:
  static constexpr std::uint64_t kEntryOverhead = 1024;
  static constexpr std::uint64_t kMaximumCost = 0x200000;
  static constexpr std::uint32_t kMemoryPressureMask = 0x20;

  // The pool, clock and centre must outlive it. Whatever changes the answers a search would get
  // (a new user identifier, locale, time zone, account, ...) is posted on `center` and empties it.
  static std::shared_ptr<QueryCache> create(platform::DispatchPool& pool, platform::Clock& clock,
                                            platform::NotificationCenter& center);
  ~QueryCache();
  QueryCache(const QueryCache&) = delete;
  QueryCache& operator=(const QueryCache&) = delete;

  // Caches `entry` under its completed query, asynchronously. Entries without data or query, whose
  // input is longer than their query, or that cost 2 MiB or more with overhead are not kept; a
  // total that would reach 2 MiB drops every entry first.
  void set(const Ref<CachedResultSet>& entry);
  // The best entry for the request: among unexpired entries whose key begins with the input,
  // fetched for an input no longer than it, at the same scale and with equal qtype,
  // suggest_queries and lc, the shortest completed query, then the highest positive score.
  Ref<CachedResultSet> getRequest(const CacheSearchRequest& request, const platform::http::URLRequest* httpRequest);
  Ref<CachedResultSet> get(const std::string& input);
  void removeAllObjects();
  std::uint64_t count();
  std::uint64_t currentCost();
  // Whether the memory-pressure source is installed (only while non-empty). For tests.
  bool listensForMemoryPressure();

 private:
  QueryCache(platform::DispatchPool& pool, platform::Clock& clock);
  void registerNotifications(platform::NotificationCenter& center);
  void clearCache();
  void didBecomeNonEmpty();
  void didBecomeEmpty();
  void listenForMemoryPressure();
  void stopListeningForMemoryPressure();

  platform::Clock& clock_;
  platform::SerialQueue queue_;
  std::unique_ptr<platform::MemoryPressureSource> source_;
  CritbitTree tree_;
  std::uint64_t currentCost_ = 0;
  std::vector<platform::NotificationCenter::Registration> registrations_;
};

}  // namespace tavix
