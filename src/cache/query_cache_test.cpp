#include "cache/query_cache.h"

#include <gtest/gtest.h>

#include "platform/http/url_request.h"
#include "platform/memory_pressure.h"

namespace tavix {
namespace {

using platform::seconds;

class QueryCacheTest : public ::testing::Test {
 protected:
  QueryCacheTest() : pool_(2) { cache_ = QueryCache::create(pool_, clock_, center_); }

  Ref<CachedResultSet> entry(const std::string& input, const std::string& query, platform::Dictionary reply = {},
                             std::string url = "https://s.example/search?q=x", std::size_t bytes = 10,
                             const char* scale = nullptr) {
    platform::http::URLRequest request;
    request.url = std::move(url);
    if (scale) request.headers.set("X-Norvel-UI-Scale", scale);
    reply["query"] = query;
    return makeRef<CachedResultSet>(input, &request, reply, "uuid-" + query, std::string(bytes, 'r'), clock_.now());
  }

  // set() is asynchronous; count() runs after it on the same queue.
  void store(const Ref<CachedResultSet>& e) {
    cache_->set(e);
    cache_->count();
  }

  std::string hit(const std::string& input, double scale = 0, const std::string& url = "https://s.example/search?q=x") {
    platform::http::URLRequest request;
    request.url = url;
    CacheSearchRequest search{input, scale, {}};
    Ref<CachedResultSet> found = cache_->getRequest(search, &request);
    return found ? found->uuid() : "";
  }

  platform::DispatchPool pool_;
  platform::VirtualClock clock_;
  platform::NotificationCenter center_;
  std::shared_ptr<QueryCache> cache_;
};

TEST_F(QueryCacheTest, ServesLongerInputsUpToTheCompletedQuery) {
  store(entry("ca", "camera"));
  for (const char* typed : {"ca", "cam", "CAME", "camer", "camera"}) EXPECT_EQ(hit(typed), "uuid-camera") << typed;
  EXPECT_EQ(hit("c"), "");        // fetched for a longer input
  EXPECT_EQ(hit("cameras"), "");  // not a prefix of the key

  // Requests with extra query items never hit; nor do ones that differ in qtype, suggest or lc.
  EXPECT_FALSE(cache_->getRequest({"cam", 0, {{"extra", "1"}}}, nullptr));
  EXPECT_EQ(hit("cam", 0, "https://s.example/search?q=x&qtype=web"), "");
  store(entry("ca", "cat", {}, "https://s.example/search?qtype=web&lc=1"));
  EXPECT_EQ(hit("ca", 0, "https://s.example/search?lc=1&qtype=web"), "uuid-cat");
  EXPECT_EQ(hit("ca", 0, "https://s.example/search?lc=2&qtype=web"), "");

  // A positive scale must match the entry's; scale 0 matches any.
  store(entry("bi", "bird", {}, "https://s.example/search?q=x", 10, "3"));
  EXPECT_EQ(hit("bi", 2), "");
  EXPECT_EQ(hit("bi", 3), "uuid-bird");
  EXPECT_EQ(hit("bi", 0), "uuid-bird");
}

TEST_F(QueryCacheTest, PrefersTheShortestCompletionThenTheHighestPositiveScore) {
  store(entry("ap", "apple", {{"completion_score", 0.5}}));
  store(entry("ap", "apply", {{"completion_score", 0.7}}));
  store(entry("ap", "apricot", {{"completion_score", 0.9}}));
  EXPECT_EQ(hit("ap"), "uuid-apply");

  store(entry("b", "bat"));
  store(entry("b", "bay"));
  EXPECT_EQ(hit("b"), "uuid-bat");  // scores 0 and 0: first in key order
  store(entry("c", "cab", {{"completion_score", -1.0}}));
  store(entry("c", "cat", {{"completion_score", -0.5}}));
  EXPECT_EQ(hit("c"), "uuid-cab");  // a negative score never displaces the first

  // Lengths are characters: "caé" is one longer than "ca", though two bytes longer.
  store(entry("ca", "cabb", {{"completion_score", 0.9}}));
  store(entry("ca", "caé", {{"completion_score", 0.1}}));
  EXPECT_EQ(hit("ca"), "uuid-caé");
  // An input no longer than its completed query in characters is cached and served, though it
  // takes more bytes.
  store(entry("ññ", "gnu"));
  EXPECT_EQ(hit("gnu"), "uuid-gnu");
}

TEST_F(QueryCacheTest, ExpiresEntriesOnLookUp) {
  store(entry("ne", "never"));
  store(entry("ne", "news", {{"max_age", 30}}));
  EXPECT_EQ(hit("new"), "uuid-news");
  clock_.advance(seconds(29));
  EXPECT_EQ(hit("new"), "uuid-news");
  clock_.advance(seconds(1));
  const auto cost = cache_->currentCost();
  EXPECT_EQ(hit("ne"), "uuid-never");
  EXPECT_EQ(cache_->count(), 1u);
  EXPECT_EQ(cache_->currentCost(), cost);  // expiry does not give the cost back
}

TEST_F(QueryCacheTest, BoundsTheCostAndFlushesWhenItWouldBeReached) {
  store(entry("bi", "big", {}, "https://s.example/search", QueryCache::kMaximumCost - 1024));  // 2 096 128
  EXPECT_EQ(cache_->count(), 0u);
  store(entry("bi", "big", {}, "https://s.example/search", QueryCache::kMaximumCost - 1025));  // 2 096 127
  EXPECT_EQ(cache_->count(), 1u);
  EXPECT_EQ(cache_->currentCost(), QueryCache::kMaximumCost - 1);

  store(entry("sm", "small"));  // would reach the bound: everything goes first
  EXPECT_EQ(cache_->count(), 1u);
  EXPECT_EQ(cache_->currentCost(), 10u + 1024u);
  EXPECT_EQ(hit("sm"), "uuid-small");

  store(entry("longer input", "long"));  // refused: the input is longer than its completed query
  EXPECT_EQ(cache_->count(), 1u);
}

TEST_F(QueryCacheTest, ClearsOnNotificationsAndMemoryPressure) {
  EXPECT_FALSE(cache_->listensForMemoryPressure());
  for (const char* name : {"TVXUserGUIDChangeNotification", "TVXSessionSoftLimitNotification",
                           "TVXSessionMaxLimitNotification", kCountryCodeDidChangeNotification,
                           kSystemTimeZoneDidChangeNotification, kCurrentLocaleDidChangeNotification,
                           kManagedSettingsDidChangeNotification, kAccountStoreDidChangeNotification,
                           kAccountCredentialsDidChangeNotification}) {
    store(entry("a", "abc"));
    EXPECT_TRUE(cache_->listensForMemoryPressure());
    center_.post(name);
    EXPECT_EQ(cache_->count(), 0u) << name;
    EXPECT_EQ(cache_->currentCost(), 0u);
    EXPECT_FALSE(cache_->listensForMemoryPressure());
  }
  center_.post("SomethingElse");

  store(entry("a", "abc"));
  platform::raiseMemoryPressure(platform::MemoryPressureWarn);  // not in the mask
  EXPECT_EQ(cache_->count(), 1u);
  platform::raiseMemoryPressure(platform::MemoryPressureProcessLimitCritical);
  EXPECT_EQ(cache_->count(), 0u);
  EXPECT_FALSE(cache_->listensForMemoryPressure());
}

}  // namespace
}  // namespace tavix
