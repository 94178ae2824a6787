#include "cache/engaged_completion_cache.h"

#include <gtest/gtest.h>

#include <fstream>
#include <future>
#include <set>

#include "core/diagnostics.h"
#include "platform/counters.h"
#include "platform/defaults.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

using platform::seconds;

class EngagedCompletionCacheTest : public ::testing::Test {
 protected:
  EngagedCompletionCacheTest()
      : pool_(2), defaults_(home_.config(), "com.norvel.tavixd") {}

  std::shared_ptr<EngagedCompletionCache> open() {
    return EngagedCompletionCache::create({home_.cache() / "com.norvel.tavixd", &clock_, &pool_, &defaults_});
  }

  // Every completion found for `input`, in result order. Generous time-out: these tests are
  // about what is found, not how fast.
  std::vector<TVXSearchSuggestion> find(EngagedCompletionCache& cache, const std::string& input,
                                        unsigned long client = 0) {
    auto results = cache.completionsForInput(input, client, 10, 2000);
    return results ? *results : std::vector<TVXSearchSuggestion>{};
  }

  // The row count of each of `clients`.
  std::vector<int> rows(EngagedCompletionCache& cache, std::vector<unsigned long> clients) {
    std::vector<int> out;
    for (auto client : clients) out.push_back(cache.rowCountForClient(client));
    return out;
  }

  std::vector<std::string> names(const std::vector<TVXSearchSuggestion>& found) {
    std::vector<std::string> out;
    for (const auto& s : found) out.push_back(s.suggestion);
    return out;
  }

  testing::TempHome home_;
  platform::DispatchPool pool_;
  platform::VirtualClock clock_;
  platform::UserDefaults defaults_;
  std::shared_ptr<EngagedCompletionCache> cache = open();
};

TEST_F(EngagedCompletionCacheTest, APrivateDatabaseInTheCachesFolderKeepsItsRowsAcrossOpens) {
  const auto expected = home_.cache() / "com.norvel.tavixd/EngagedCompletions/Cache.db";
  EXPECT_EQ(platform::fs::status(expected).permissions(), platform::fs::perms(0600));
  cache->addCompletion("kept", "ke");
  cache.reset();

  // Reopening a current schema keeps the rows.
  cache = open();
  EXPECT_EQ(cache->rowCountForClient(0), 1);
}

TEST_F(EngagedCompletionCacheTest, FindsCompletionsByTypedInputOrNormalisedCompletion) {
  cache->addCompletion("Café Rouge", "Cafe", 1);
  cache->addCompletion("camera", "cam", 2);
  cache->addCompletion("carrot", "car", 0, 1);  // another client
  cache->addCompletion("東京タワー", "とうきょう");

  // "cafe r" matches neither stored input, only the transformed completion "cafe rouge".
  auto found = find(*cache, "cafe r");
  ASSERT_EQ(names(found), std::vector<std::string>{"Café Rouge"});
  EXPECT_EQ(found[0].type, 1);
  EXPECT_EQ(names(find(*cache, "CAFÉ")), std::vector<std::string>{"Café Rouge"});
  EXPECT_EQ(find(*cache, "ca").size(), 2u);
  EXPECT_EQ(names(find(*cache, "car", 1)), std::vector<std::string>{"carrot"});

  // Japanese text is matched as it stands, through the stored input or the completion.
  EXPECT_EQ(names(find(*cache, "とう")), std::vector<std::string>{"東京タワー"});
  EXPECT_EQ(names(find(*cache, "東京")), std::vector<std::string>{"東京タワー"});
}

TEST_F(EngagedCompletionCacheTest, ScoresByRecencyBucketsAndDropsBelowThreshold) {
  cache->addCompletion("twice", "tw");
  cache->addCompletion("twice", "tw");
  clock_.advance(seconds(2 * 86400));
  cache->addCompletion("twin", "tw");
  clock_.advance(seconds(60));

  auto found = find(*cache, "tw");
  ASSERT_EQ(found.size(), 2u);
  EXPECT_EQ(found[0].suggestion, "twin");
  // One engagement in the last hour: 10, plus the recency term just under 1. Two engagements two
  // days ago fall in the week bucket: 0.1 each, plus that term.
  EXPECT_NEAR(found[0].score, 10.995, 0.005);
  EXPECT_NEAR(found[1].score, 1.195, 0.005);

  EngagedCompletionParameters p;
  p.minThresholdToSend = 5;
  cache->updateParameters(p);
  EXPECT_EQ(names(find(*cache, "tw")), std::vector<std::string>{"twin"});

  p.last1hour = 0;
  cache->updateParameters(p);
  EXPECT_TRUE(find(*cache, "tw").empty());

  // Weights as large as a bag may send still make a whole statement.
  p.last1hour = p.last1day = p.last1week = p.last1month = p.all = p.mostRecent = 1e300;
  p.minThresholdToSend = 0;
  cache->updateParameters(p);
  EXPECT_EQ(find(*cache, "tw").size(), 2u);
}

TEST_F(EngagedCompletionCacheTest, AgesOutOldRowsAndTrimsEachClientToItsLimit) {
  cache->addCompletion("old", "o", 0, 2);
  clock_.advance(seconds(40 * 86400));
  cache->addCompletion("new", "n", 0, 1);  // any client's add ages out every client's rows
  EXPECT_EQ(rows(*cache, {2, 1}), (std::vector<int>{0, 1}));

  for (int i = 0; i < 3; ++i) {
    cache->addCompletion("row" + std::to_string(i), "r", 0, 5, 3);
    clock_.advance(seconds(10));
  }
  cache->addCompletion("row3", "r", 0, 5, 3);  // exactly three: no fourth-newest row to cut at
  EXPECT_EQ(cache->rowCountForClient(5), 4);
  clock_.advance(seconds(10));
  cache->addCompletion("row4", "r", 0, 5, 3);  // cuts at the fourth-newest, the oldest row
  EXPECT_EQ(cache->rowCountForClient(5), 4);
  std::set<std::string> left;
  for (const auto& s : find(*cache, "r", 5)) left.insert(s.suggestion);
  EXPECT_EQ(left, (std::set<std::string>{"row1", "row2", "row3", "row4"}));
  EXPECT_EQ(cache->rowCountForClient(1), 1);
}

TEST_F(EngagedCompletionCacheTest, ClearsByDateOrEverything) {
  const auto t0 = clock_.now();
  cache->addCompletion("a", "a", 0, 1);
  clock_.advance(seconds(4));
  cache->addCompletion("b", "b", 0, 1);
  clock_.advance(seconds(100));
  cache->addCompletion("c", "c", 0, 1);
  cache->addCompletion("d", "d", 0, 2);

  cache->clearCompletionsFromDate(t0, t0, 1);  // widened to 5 s either side: a and b
  EXPECT_EQ(rows(*cache, {1, 2}), (std::vector<int>{1, 1}));

  cache->addCompletion("e", "e", 0, 3);
  cache->clearAllClientCompletionsFromDate(clock_.now() - seconds(1), clock_.now() + seconds(1));
  EXPECT_EQ(rows(*cache, {1, 2, 3}), (std::vector<int>{0, 0, 0}));
}

TEST(EngagedCompletionCacheTimeout, SearchThatOutlivesItsTimeoutReturnsNothing) {
  testing::TempHome home;
  platform::DispatchPool pool(1);
  platform::VirtualClock clock;
  auto cache = EngagedCompletionCache::create({home.cache(), &clock, &pool, nullptr});
  cache->addCompletion("late", "la");

  // A write holds the database, so the search cannot start before the deadline.
  auto busy = cache->holdDatabaseForTesting();
  auto late = std::async(std::launch::async, [&] { return cache->completionsForInput("la", 0, 5, 20); });
  clock.awaitParked(1);
  clock.advance(platform::seconds(0.019));
  EXPECT_EQ(clock.parkedWaiters(), 1u) << "still waiting 1 ms before its deadline";
  clock.advance(platform::seconds(0.001));
  EXPECT_FALSE(late.get());
  busy.unlock();
  pool.drain();  // the late block runs to its end; its results go nowhere

  EXPECT_EQ(cache->completionsForInput("la", 0, 5, 2000).value_or(std::vector<TVXSearchSuggestion>{}).size(), 1u);
}

// A clock that moves a millisecond each time it is read: every search looks slow to it.
class CreepingClock final : public platform::Clock {
 public:
  platform::TimePoint now() const override { return start_ + std::chrono::milliseconds(reads_++); }
  platform::TimerHandle after(platform::Duration, platform::SerialQueue&, platform::Task) override { return {}; }
  bool waitFor(std::unique_lock<std::mutex>& lock, std::condition_variable& signal, platform::Duration timeout,
               const std::function<bool()>& ready) override {
    return signal.wait_for(lock, timeout, ready);
  }

 private:
  const platform::TimePoint start_ = platform::fromUnixSeconds(1767225600);
  mutable std::atomic<int> reads_{0};
};

TEST(EngagedCompletionCacheTimeout, SearchOnTheCallersThreadIsHeldToItsDeadline) {
  testing::TempHome home;
  platform::DispatchPool pool(1);
  CreepingClock clock;
  auto cache = EngagedCompletionCache::create({home.cache(), &clock, &pool, nullptr});
  for (int i = 0; i < 200; ++i) cache->addCompletion("slow" + std::to_string(i), "sl");
  // Its few own readings of the clock fit in 5 ms; the statement is stopped while it runs.
  EXPECT_FALSE(cache->completionsForInput("sl", 0, 5, 5));
  EXPECT_EQ(cache->completionsForInput("sl", 0, 5, 60000).value_or(std::vector<TVXSearchSuggestion>{}).size(), 5u);
}

TEST_F(EngagedCompletionCacheTest, RebuildsACorruptDatabaseAndGoesOn) {
  const auto dir = home_.cache() / "com.norvel.tavixd/EngagedCompletions";
  cache.reset();
  { std::ofstream(dir / "Cache.db", std::ios::binary | std::ios::trunc) << std::string(8192, 'x'); }
  cache = open();
  cache->addCompletion("fresh", "fr");
  EXPECT_EQ(names(find(*cache, "fr")), std::vector<std::string>{"fresh"});

  // Damage the file under the open handle: the next add notices, rebuilds and the one after works.
  { std::ofstream(dir / "Cache.db", std::ios::binary | std::ios::trunc) << std::string(8192, '\x5a'); }
  cache->addCompletion("after", "af");
  cache->addCompletion("after", "af");
  EXPECT_EQ(names(find(*cache, "af")), std::vector<std::string>{"after"});
}

TEST_F(EngagedCompletionCacheTest, CountsRecentEngagementsAndReportsRoundedStatistics) {
  for (int i = 0; i < 123; ++i) cache->addCompletion("stat" + std::to_string(i), "st");
  EXPECT_EQ(TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.brovane.localCompletionIndex.entries"), 120);
  EXPECT_GT(TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.brovane.localCompletionIndex.size"), 0);

  std::promise<std::map<std::string, std::int64_t>> counts;
  cache->featureCountsForInput("st", 0, [&](std::map<std::string, std::int64_t> m) { counts.set_value(m); });
  EXPECT_EQ(counts.get_future().get(), (std::map<std::string, std::int64_t>{{"h", 123}}));
}

TEST(EngagedCompletionText, NormalisesCompatibilityFormsAndReadsKana) {
  // Search matches by these; the plain cases are the search tests'.
  EXPECT_EQ(EngagedCompletionCache::normalizeString("ﬁ①"), "fi1");  // compatibility forms
  EXPECT_EQ(EngagedCompletionCache::normalizeString("Tōkyō タワー"), "Tōkyō タワー");
  EXPECT_TRUE(EngagedCompletionCache::containsKanjiOrKatakana("ｶ"));   // half-width katakana
  EXPECT_FALSE(EngagedCompletionCache::containsKanjiOrKatakana("・"));  // the middle dot is excluded
  EXPECT_EQ(EngagedCompletionCache::kanize("sushi"), "すし");
  EXPECT_EQ(EngagedCompletionCache::significantValueFromString(""), 0);
}

}  // namespace
}  // namespace tavix
