// Local completion search on 10 000 rows of one client: latency of completionsForInput (median,
// p99, share over the 5 ms budget), the query plan of its statement, and the same statement with
// "between ... U+FFEE" ranges against a LIKE 'prefix%' form, both run on a second connection.
#include <benchmark/benchmark.h>
#include <sqlite3.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <random>
#include <string>
#include <vector>

#include "cache/engaged_completion_cache.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "support/temp_home.h"

namespace {

using namespace tavix;

constexpr const char* kBetweenSQL =
    "SELECT completion, origin, SUM(CASE WHEN engagement_date > ?1 THEN 10.0 WHEN engagement_date > ?2 then 1.0 WHEN  "
    "engagement_date > ?3 THEN 0.1 WHEN engagement_date > ?4 THEN 0.01 WHEN engagement_date > ?5 THEN 0.001 ELSE 0 "
    "END) + (1.0 * MAX(engagement_date) / ?6) AS score FROM completion_cache_engagement WHERE (input between ?7 and ?8 "
    "OR transformed between ?9 and ?10) AND client == ?11 GROUP BY completion ORDER BY score DESC LIMIT 10";
constexpr const char* kLikeSQL =
    "SELECT completion, origin, SUM(CASE WHEN engagement_date > ?1 THEN 10.0 WHEN engagement_date > ?2 then 1.0 WHEN  "
    "engagement_date > ?3 THEN 0.1 WHEN engagement_date > ?4 THEN 0.01 WHEN engagement_date > ?5 THEN 0.001 ELSE 0 "
    "END) + (1.0 * MAX(engagement_date) / ?6) AS score FROM completion_cache_engagement WHERE (input LIKE ?7 "
    "OR transformed LIKE ?9) AND client == ?11 GROUP BY completion ORDER BY score DESC LIMIT 10";

struct Fixture {
  Fixture() : pool(2) {
    cache = EngagedCompletionCache::create({home.cache(), &clock, &pool, nullptr});
    sqlite3_open_v2(cache->databasePath().c_str(), &db, SQLITE_OPEN_READWRITE, nullptr);
    std::mt19937 rng(5);
    std::uniform_int_distribution<int> len(3, 12), ch('a', 'z'), age(0, 200 * 86400);
    const auto now = static_cast<long long>(platform::toUnixSeconds(clock.now()));
    sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr);
    sqlite3_stmt* insert = nullptr;
    sqlite3_prepare_v2(db,
                       "INSERT INTO completion_cache_engagement (completion, input, engagement_date, origin, client, "
                       "transformed) VALUES (?, ?, ?, 'se', 1, ?)",
                       -1, &insert, nullptr);
    for (int i = 0; i < 10000; ++i) {
      std::string completion;
      for (int n = len(rng); n > 0; --n) completion.push_back(static_cast<char>(ch(rng)));
      completion[0] = static_cast<char>(std::toupper(completion[0]));
      const std::string input = completion.substr(0, 2);
      const std::string transformed = EngagedCompletionCache::normalizeString(completion);
      sqlite3_bind_text(insert, 1, completion.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_text(insert, 2, input.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_int64(insert, 3, now - age(rng));
      sqlite3_bind_text(insert, 4, transformed.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_step(insert);
      sqlite3_reset(insert);
      inputs.push_back(transformed.substr(0, 2 + i % 3));
    }
    sqlite3_finalize(insert);
    sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr);
    std::shuffle(inputs.begin(), inputs.end(), rng);
  }
  ~Fixture() { sqlite3_close(db); }

  testing::TempHome home;
  platform::DispatchPool pool;
  platform::VirtualClock clock;
  std::shared_ptr<EngagedCompletionCache> cache;
  sqlite3* db = nullptr;
  std::vector<std::string> inputs;
};

Fixture& fixture() {
  static Fixture f;
  return f;
}

void report(benchmark::State& state, std::vector<double>& micros) {
  std::sort(micros.begin(), micros.end());
  state.counters["median_us"] = micros[micros.size() / 2];
  state.counters["p99_us"] = micros[micros.size() * 99 / 100];
  state.counters["over_5ms_pct"] =
      100.0 * static_cast<double>(micros.end() - std::upper_bound(micros.begin(), micros.end(), 5000.0)) /
      static_cast<double>(micros.size());
}

void BM_CompletionsForInput(benchmark::State& state) {
  auto& f = fixture();
  std::vector<double> micros;
  std::size_t i = 0, timeouts = 0;
  for (auto _ : state) {
    auto start = std::chrono::steady_clock::now();
    auto found = f.cache->completionsForInput(f.inputs[i++ % f.inputs.size()], 1, 10, 1000);
    micros.push_back(std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start).count());
    if (!found) ++timeouts;
  }
  report(state, micros);
  state.counters["timeouts"] = static_cast<double>(timeouts);
}
BENCHMARK(BM_CompletionsForInput)->Iterations(3000);

void runDirect(benchmark::State& state, const char* sql, bool like) {
  auto& f = fixture();
  sqlite3_stmt* s = nullptr;
  sqlite3_prepare_v2(f.db, sql, -1, &s, nullptr);
  const auto now = static_cast<long long>(platform::toUnixSeconds(f.clock.now()));
  const long long buckets[] = {3600, 86400, 604800, 2592000, 31536000};
  std::vector<double> micros;
  std::size_t i = 0;
  for (auto _ : state) {
    const std::string& input = f.inputs[i++ % f.inputs.size()];
    auto start = std::chrono::steady_clock::now();
    for (int b = 0; b < 5; ++b) sqlite3_bind_int64(s, b + 1, now - buckets[b]);
    sqlite3_bind_int64(s, 6, now);
    const std::string low = like ? input + "%" : input, high = input + "\xEF\xBF\xAE";
    sqlite3_bind_text(s, 7, low.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_bind_text(s, 9, low.c_str(), -1, SQLITE_TRANSIENT);
    if (!like) {
      sqlite3_bind_text(s, 8, high.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_text(s, 10, high.c_str(), -1, SQLITE_TRANSIENT);
    }
    sqlite3_bind_int64(s, 11, 1);
    while (sqlite3_step(s) == SQLITE_ROW) benchmark::DoNotOptimize(sqlite3_column_double(s, 2));
    sqlite3_reset(s);
    micros.push_back(std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start).count());
  }
  sqlite3_finalize(s);
  report(state, micros);
}

void BM_DirectBetween(benchmark::State& state) { runDirect(state, kBetweenSQL, false); }
void BM_DirectLike(benchmark::State& state) { runDirect(state, kLikeSQL, true); }
BENCHMARK(BM_DirectBetween)->Iterations(3000);
BENCHMARK(BM_DirectLike)->Iterations(3000);

void printPlan(const char* title, const char* sql) {
  auto& f = fixture();
  std::printf("EXPLAIN QUERY PLAN (%s):\n", title);
  sqlite3_stmt* s = nullptr;
  std::string explain = std::string("EXPLAIN QUERY PLAN ") + sql;
  if (sqlite3_prepare_v2(f.db, explain.c_str(), -1, &s, nullptr) == SQLITE_OK) {
    while (sqlite3_step(s) == SQLITE_ROW) std::printf("  %s\n", reinterpret_cast<const char*>(sqlite3_column_text(s, 3)));
  }
  sqlite3_finalize(s);
}

}  // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  printPlan("between", kBetweenSQL);
  printPlan("LIKE", kLikeSQL);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
