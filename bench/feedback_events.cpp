// Feedback events per second through ClientSessionManager::addTavixFeedback, all the way into
// session files on disk: stamping, the bag's feedback switch, the state machine, the session's
// append (encoding and write on the storage queue). Sessions are closed every 1 000 events, as a
// busy client's would be, and the waiting files are removed between batches outside the timing.
// Closed files are synced on the storage's own thread; "untimed_sync_wait_ms" is how long the
// removal still waited for that after the timed part.
//
// Arguments: shared sessions (0 or 1), client agents (1 or 4), results per event (0: a small
// engagement; 10: a visible-results list of ten web results).
#include <benchmark/benchmark.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "context/user_guid_controller.h"
#include "feedback/client_session_manager.h"
#include "feedback/persistent_storage.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/log.h"
#include "support/test_assembly.h"

namespace {

using namespace tavix;

constexpr int kEventsPerSession = 1000;

// The daemon's pool size (nested sync hops park threads) and a virtual clock: no session ever
// reaches its soft limit during a run.
struct Fixture : testing::TestAssembly {
  std::shared_ptr<ClientSessionManager> manager;

  explicit Fixture(bool shared) : testing::TestAssembly(0) {
    platform::setLogLevel(platform::LogLevel::Error);
    assembly.sharedSession = shared;
    defaults->registerDefaults({{"TVXSessionSoftLimitOverride", platform::PropertyValue(std::int64_t{600})},
                                {"TVXSessionIdleTimeOverride", platform::PropertyValue(std::int64_t{180})}});
    makeStorage();
    assembly.guidController = makeGUIDController();
    manager = std::make_shared<ClientSessionManager>(sessionManagerEnvironment(assembly), assembly.guidController, nullptr, "tavix");
  }
  ~Fixture() { pool.drain(); }

  // Deletes the waiting files and returns their total size. `syncWait` gains the time the
  // closed files took to become durable and listed beyond the timed part (they are synced on the
  // storage's own thread, so intake never waits for it).
  std::uint64_t clearWaiting(double* syncWait) {
    std::uint64_t bytes = 0;
    const auto start = std::chrono::steady_clock::now();
    const auto waiting = assembly.persistentStorage->getAvailableSessionHandles();
    *syncWait += std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
    for (auto& handle : waiting) {
      std::error_code ec;
      const auto size = platform::fs::file_size(handle->fileUrl(), ec);
      if (!ec) bytes += size;
      assembly.persistentStorage->deleteSessionWithFileContainer(handle);
    }
    pool.drain();
    return bytes;
  }
};

std::vector<FeedbackRef> makeEvents(int agents, int results) {
  std::vector<FeedbackRef> events;
  for (int i = 0; i < kEventsPerSession; ++i) {
    const std::string agent = "com.norvel.client" + std::to_string(i % agents) + "/17";
    if (results == 0) {
      proto::CTResultEngagementFeedback e;
      e.set_timestamp(1000000ull * i);
      e.mutable_result()->set_id("result-" + std::to_string(i));
      e.mutable_result()->set_section_bundle_id("com.norvel.tavix.web_index");
      events.push_back(makeTavixFeedbackWithCodable(e, i, "", agent));
    } else {
      proto::CTVisibleResultsFeedback v;
      v.set_timestamp(1000000ull * i);
      for (int r = 0; r < results; ++r) {
        auto* result = v.add_results();
        result->set_id("result-" + std::to_string(i) + "-" + std::to_string(r));
        result->set_section_bundle_id("com.norvel.tavix.web_index");
        result->mutable_punchout()->add_urls("https://www.example.com/articles/" + std::to_string(r) + "?ref=tavix");
      }
      events.push_back(makeTavixFeedbackWithCodable(v, i, "", agent));
    }
  }
  return events;
}

void BM_AddTavixFeedback(benchmark::State& state) {
  const bool shared = state.range(0) != 0;
  const int agents = static_cast<int>(state.range(1));
  const int results = static_cast<int>(state.range(2));
  Fixture f(shared);
  const auto templates = makeEvents(agents, results);
  std::uint64_t bytes = 0;
  double syncWait = 0;
  for (auto _ : state) {
    state.PauseTiming();
    // Fresh copies: the manager stamps the events it is given.
    std::vector<FeedbackRef> events;
    events.reserve(templates.size());
    for (const auto& t : templates) events.push_back(std::make_shared<proto::CTTavixFeedback>(*t));
    state.ResumeTiming();

    for (auto& e : events) f.manager->addTavixFeedback(std::move(e));
    f.manager->flushSession();
    f.manager->currentState();  // every event is through the manager
    f.pool.drain();             // ... and in its file

    state.PauseTiming();
    bytes += f.clearWaiting(&syncWait);
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * kEventsPerSession);
  state.SetBytesProcessed(static_cast<std::int64_t>(bytes));
  state.counters["untimed_sync_wait_ms"] = syncWait / static_cast<double>(state.iterations());
}

BENCHMARK(BM_AddTavixFeedback)
    ->ArgNames({"shared", "agents", "results"})
    ->Args({0, 1, 0})
    ->Args({1, 1, 0})
    ->Args({1, 4, 0})
    ->Args({0, 1, 10})
    ->Args({1, 4, 10})
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
