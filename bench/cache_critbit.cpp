// Crit-bit tree against std::map (exact look-up, prefix enumeration by lower_bound), and the
// query cache's look-up with 1 000 entries (median and p99 per call).
#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "cache/critbit.h"
#include "cache/query_cache.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/http/url_request.h"
#include "platform/notification_center.h"

namespace {

using namespace tavix;

struct Value : RefCounted {};

std::vector<std::string> makeKeys(std::size_t n, unsigned seed) {
  std::mt19937 rng(seed);
  std::uniform_int_distribution<int> len(4, 16), ch('a', 'z');
  std::vector<std::string> keys;
  keys.reserve(n);
  while (keys.size() < n) {
    std::string k;
    for (int i = len(rng); i > 0; --i) k.push_back(static_cast<char>(ch(rng)));
    keys.push_back(std::move(k));
  }
  return keys;
}

struct Fixture {
  Fixture() : keys(makeKeys(100000, 7)) {
    for (const auto& k : keys) {
      tree.setObject(makeRef<Value>(), k);
      map.emplace(k, makeRef<Value>());
    }
    probes = keys;
    std::shuffle(probes.begin(), probes.end(), std::mt19937(3));
    prefixes = {"a", "ab", "abc", "q", "qu", "zz", "mno", "e"};
  }
  std::vector<std::string> keys, probes, prefixes;
  CritbitTree tree;
  std::map<std::string, Ref<Value>> map;
};

Fixture& fixture() {
  static Fixture f;
  return f;
}

void BM_CritbitLookup(benchmark::State& state) {
  auto& f = fixture();
  std::size_t i = 0;
  for (auto _ : state) benchmark::DoNotOptimize(f.tree.objectForKey(f.probes[i++ % f.probes.size()]));
}
BENCHMARK(BM_CritbitLookup);

void BM_MapLookup(benchmark::State& state) {
  auto& f = fixture();
  std::size_t i = 0;
  for (auto _ : state) benchmark::DoNotOptimize(f.map.find(f.probes[i++ % f.probes.size()]));
}
BENCHMARK(BM_MapLookup);

void BM_CritbitPrefix(benchmark::State& state) {
  auto& f = fixture();
  std::size_t i = 0, visited = 0;
  for (auto _ : state) {
    f.tree.keysMatchingPrefix(f.prefixes[i++ % f.prefixes.size()], [&](std::string_view k, bool*) {
      visited += k.size();
    });
  }
  benchmark::DoNotOptimize(visited);
}
BENCHMARK(BM_CritbitPrefix);

void BM_MapPrefix(benchmark::State& state) {
  auto& f = fixture();
  std::size_t i = 0, visited = 0;
  for (auto _ : state) {
    const std::string& p = f.prefixes[i++ % f.prefixes.size()];
    for (auto it = f.map.lower_bound(p); it != f.map.end() && it->first.compare(0, p.size(), p) == 0; ++it)
      visited += it->first.size();
  }
  benchmark::DoNotOptimize(visited);
}
BENCHMARK(BM_MapPrefix);

void BM_QueryCacheGetRequest(benchmark::State& state) {
  platform::DispatchPool pool(2);
  platform::VirtualClock clock;
  platform::NotificationCenter center;
  auto cache = QueryCache::create(pool, clock, center);
  platform::http::URLRequest request;
  request.url = "https://s.example/search?q=x&qtype=web";
  auto keys = makeKeys(1000, 11);
  for (const auto& k : keys) {
    platform::Dictionary reply{{"query", k}, {"completion_score", 0.5}};
    cache->set(makeRef<CachedResultSet>(k.substr(0, 2), &request, reply, "u", std::string(200, 'r'), clock.now()));
  }
  cache->count();
  std::vector<double> micros;
  std::size_t i = 0;
  for (auto _ : state) {
    const std::string& k = keys[i++ % keys.size()];
    CacheSearchRequest search{k.substr(0, 3), 0, {}};
    auto start = std::chrono::steady_clock::now();
    benchmark::DoNotOptimize(cache->getRequest(search, &request));
    micros.push_back(std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start).count());
  }
  std::sort(micros.begin(), micros.end());
  state.counters["median_us"] = micros[micros.size() / 2];
  state.counters["p99_us"] = micros[micros.size() * 99 / 100];
}
BENCHMARK(BM_QueryCacheGetRequest)->Iterations(20000);

}  // namespace

BENCHMARK_MAIN();
