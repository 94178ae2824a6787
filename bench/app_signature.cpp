// The installed-app signature for a 5 000-app whitelist and 300 installed desktop entries (200 of
// them whitelisted): the scan of the application folders, the whitelist parse and signature, and
// both together as one generation does them; and what a client's request pays for the signature
// while generations run back to back on the background queue.
#include <benchmark/benchmark.h>

#include <stdlib.h>

#include <algorithm>
#include <fstream>
#include <numeric>
#include <random>
#include <string>
#include <vector>

#include "context/app_signature.h"
#include "context/app_whitelist_controller.h"
#include "context/desktop_entries.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/json_value.h"
#include "platform/transactions.h"

namespace {

using namespace tavix;
namespace fs = platform::fs;

constexpr int kWhitelisted = 5000;
constexpr int kInstalled = 300;

std::string appId(int i) { return "org.example.app" + std::to_string(i); }

struct Fixture {
  fs::path root;
  std::vector<fs::path> folders;
  std::string whitelist;

  Fixture() {
    std::string pattern = (fs::temp_directory_path() / "tavix-bench-apps-XXXXXX").string();
    root = ::mkdtemp(pattern.data());
    folders = applicationFolders(root / "home", (root / "usr").string());
    // Installed: every 25th whitelisted app (200), plus 100 that the whitelist does not know.
    for (int i = 0; i < kInstalled; ++i) {
      const std::string id = i < 200 ? appId(i * 25) : "org.other.app" + std::to_string(i);
      const fs::path& folder = folders[i % 2];
      fs::create_directories(folder);
      std::ofstream(folder / (id + ".desktop"))
          << "[Desktop Entry]\nType=Application\nName=App " << i << "\nName[de]=Programm " << i
          << "\nExec=/usr/bin/app" << i << " %U\nIcon=app" << i << "\nCategories=Utility;\nX-AppVersion=1." << i
          << "\n\n[Desktop Action new-window]\nName=New Window\nExec=/usr/bin/app" << i << " --new\n";
    }
    // Encoding ids shuffled over 1..5000, each app with a history of two entries.
    std::vector<int> ids(kWhitelisted);
    std::iota(ids.begin(), ids.end(), 1);
    std::shuffle(ids.begin(), ids.end(), std::mt19937(42));
    platform::Dictionary apps;
    for (int i = 0; i < kWhitelisted; ++i) {
      apps[appId(i)] = platform::PropertyValue::Array{platform::Dictionary{{"encoding_id", ids[i] + 10000}},
                                                      platform::Dictionary{{"encoding_id", ids[i]}}};
    }
    const std::string inner = platform::toJson(platform::Dictionary{{"version", "0a1b2c3d"}, {"apps", apps}});
    whitelist = platform::toJson(platform::Dictionary{{"apps", inner}, {"compression", "RLE"}, {"encoding", "bitmap"}});
  }
  ~Fixture() {
    std::error_code ignored;
    fs::remove_all(root, ignored);
  }
};

Fixture& fixture() {
  static Fixture f;
  return f;
}

void BM_ScanDesktopEntries(benchmark::State& state) {
  Fixture& f = fixture();
  for (auto _ : state) {
    auto apps = installedApps(f.folders);
    if (apps.size() != kInstalled) state.SkipWithError("wrong app count");
    benchmark::DoNotOptimize(apps);
  }
}
BENCHMARK(BM_ScanDesktopEntries)->Unit(benchmark::kMillisecond);

void BM_ProcessWhitelist(benchmark::State& state) {
  Fixture& f = fixture();
  const auto apps = installedApps(f.folders);
  for (auto _ : state) {
    auto signature = processWhitelist(f.whitelist, apps);
    if (!signature) state.SkipWithError("no signature");
    benchmark::DoNotOptimize(signature);
  }
  state.counters["whitelist_bytes"] = static_cast<double>(f.whitelist.size());
  state.counters["signature_chars"] = static_cast<double>(processWhitelist(f.whitelist, apps)->size());
}
BENCHMARK(BM_ProcessWhitelist)->Unit(benchmark::kMillisecond);

void BM_GenerateSignature(benchmark::State& state) {
  Fixture& f = fixture();
  for (auto _ : state) {
    auto signature = processWhitelist(f.whitelist, installedApps(f.folders));
    benchmark::DoNotOptimize(signature);
  }
}
BENCHMARK(BM_GenerateSignature)->Unit(benchmark::kMillisecond);

// The request factory reads the signature for every search; generation must never hold it up.
// Argument 1: a generation is asked for every 1 000 reads (one runs nearly all the time); 0: none,
// the baseline.
void BM_SignatureRead(benchmark::State& state) {
  Fixture& f = fixture();
  const fs::path caches = f.root / "caches";
  fs::create_directories(caches);
  std::ofstream(caches / kTVXInstalledAppWhitelist, std::ios::trunc) << f.whitelist;
  platform::TransactionTracker transactions;
  platform::DispatchPool pool(2);
  platform::VirtualClock clock;
  auto center = std::make_shared<platform::NotificationCenter>();
  auto defaults = std::make_shared<platform::UserDefaults>(f.root / "config", "com.norvel.tavixd");
  auto controller =
      AppWhitelistController::create({&pool, &clock, &transactions, center, defaults, caches, f.folders});
  controller->drainQueue();
  const bool generating = state.range(0) != 0;
  std::int64_t reads = 0;
  for (auto _ : state) {
    if (generating && ++reads % 1000 == 0) controller->generateWhitelistSignature();
    benchmark::DoNotOptimize(controller->whitelistSignature());
  }
  controller->drainQueue();
}
BENCHMARK(BM_SignatureRead)->Arg(0)->Arg(1)->Unit(benchmark::kNanosecond);

}  // namespace

BENCHMARK_MAIN();
