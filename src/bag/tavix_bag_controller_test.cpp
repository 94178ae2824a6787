// The bag controller against the development server over loopback HTTP, its files in a temp
// home and its time on a virtual clock.
#include "bag/tavix_bag_controller.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <mutex>
#include <thread>
#include <nlohmann/json.hpp>

#include "bagview/tvx_bag.h"
#include "core/diagnostics.h"
#include "devserver/devserver.h"
#include "platform/clock.h"
#include "platform/counters.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "platform/log.h"
#include "platform/notification_center.h"
#include "support/devserver_control.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

using platform::Dictionary;
using platform::PropertyValue;
using tavix::testing::waitFor;

class BagControllerTest : public ::testing::Test, protected testing::TestAssembly {
 protected:
  BagControllerTest() {
    EXPECT_TRUE(server.start({}, nullptr));
    defaults->setObject("TVXLocale", "fr_FR");
    defaults->setObject("TVXBagURL", server.baseURL() + "/bag");
    makeRequestFactory();
    changes = center->addObserver(kTVXBagChangeNotification, nullptr, nullptr, [this](const platform::Notification& n) {
      std::lock_guard hold(lock);
      EXPECT_EQ(n.sender, nullptr);
      posted.push_back(bagOfNotification(n));
    });
    news = center->addObserver("", nullptr, nullptr, [this](const platform::Notification& n) {
      if (n.name != kTVXNotifyEnabled && n.name != kTVXNotifyDisabled) return;
      std::lock_guard hold(lock);
      newsPosts.push_back(n.name);
    });
    make();
  }
  ~BagControllerTest() override {
    controller.reset();
    pool.drain();
    assembly.requestFactory.reset();
  }

  void make() { controller = TavixBagController::create(bagControllerEnvironment(assembly)); }

  std::string call(const std::string& path, const std::string& method = "GET", std::string body = {}) {
    return testing::devserverCall(*control, server.baseURL(), path, method, std::move(body));
  }
  void fault(const nlohmann::json& f) { call("/_faults", "POST", f.dump()); }
  std::vector<nlohmann::json> bagRequests() {
    std::vector<nlohmann::json> out;
    for (const auto& r : nlohmann::json::parse(call("/_recorded"))) {
      if (r["path"] == "/bag") out.push_back(r);
    }
    return out;
  }

  // Runs one fetch to its end: the failure, if any.
  std::optional<TVXBagError> fetch(std::optional<std::string> version = std::nullopt) {
    std::promise<std::optional<TVXBagError>> done;
    EXPECT_TRUE(controller->fetchBagStateWithVersion(version, [&](auto, auto error) { done.set_value(error); }));
    auto error = done.get_future().get();
    // The flag comes down just after the completion.
    EXPECT_TRUE(waitFor([&] { return !controller->fetchInProgress(); }));
    return error;
  }
  // Lets queued triggers run; a fetch they started is still in flight afterwards.
  void settle() { pool.drain(); }
  void waitForIdle() { ASSERT_TRUE(waitFor([&] { return !controller->fetchInProgress(); })); }

  platform::fs::path bagFile() const { return home.cache() / "com.norvel.tavixd" / "bag.plist"; }
  Dictionary readBagFile() const {
    std::string bytes;
    EXPECT_FALSE(platform::readFile(bagFile(), &bytes));
    EXPECT_EQ(bytes.rfind("bplist00", 0), 0u) << "not a binary property list";
    auto value = platform::parsePlist(bytes);
    return value && value->dictionary() ? *value->dictionary() : Dictionary{};
  }
  void writeBagFile(const PropertyValue& d) const {
    ASSERT_FALSE(platform::createDirectory(bagFile().parent_path(), true));
    ASSERT_FALSE(platform::writeFileAtomically(bagFile(), platform::toBinaryPlist(d)));
  }
  double now() const { return platform::toUnixSeconds(clock.now()); }
  std::size_t postedCount() {
    std::lock_guard hold(lock);
    return posted.size();
  }
  void clearPosted() {
    std::lock_guard hold(lock);
    posted.clear();
    newsPosts.clear();
  }

  devserver::DevServer server;
  std::shared_ptr<platform::http::URLSession> control = std::make_shared<platform::http::URLSession>();
  std::shared_ptr<TavixBagController> controller;

  std::mutex lock;
  std::vector<std::shared_ptr<const TVXBag>> posted;
  std::vector<std::string> newsPosts;
  platform::NotificationCenter::Registration changes;
  platform::NotificationCenter::Registration news;
};

TEST_F(BagControllerTest, BagURLHonoursTheOverrideOnlyWhenUsable) {
  EXPECT_EQ(controller->bagFetchURLWithCountry("FR"), server.baseURL() + "/bag");

  for (const char* url : {"not a url", "http://bag.example.com/bag", "ftp://127.0.0.1/bag"}) {
    defaults->setObject("TVXBagURL", url);
    EXPECT_EQ(controller->bagFetchURLWithCountry("fr"), kTVXDefaultBagURL) << url;
    EXPECT_EQ(controller->bagFetchURLWithCountry("cn"), kTVXDefaultBagURLForCN) << url;
  }

  for (const char* url : {"https://bag.example.com/bag", "http://localhost:8080/bag", "http://[::1]:9/bag"}) {
    defaults->setObject("TVXBagURL", url);
    EXPECT_EQ(controller->bagFetchURLWithCountry("CN"), url);
  }
}

TEST_F(BagControllerTest, FirstFetchStoresTheAugmentedBagAndAnnouncesIt) {
  EXPECT_EQ(controller->currentBag(), nullptr) << "nothing cached yet";
  ASSERT_TRUE(waitFor([&] { return postedCount() == 1; }));
  waitForIdle();

  auto bag = controller->currentBag();
  ASSERT_TRUE(bag && posted.front());
  EXPECT_EQ(posted.front()->rawBag(), bag->rawBag()) << "the notification carries the installed bag";
  EXPECT_EQ(newsPosts, std::vector<std::string>{kTVXNotifyEnabled});
  EXPECT_EQ(bagRequests().size(), 1u);

  // On disk: the server's keys plus the bookkeeping, as in memory.
  Dictionary file = readBagFile();
  EXPECT_EQ(file, bag->rawBag());
  EXPECT_DOUBLE_EQ(*file.at("__expiration").real(), now() + 14400);
  const std::string bagURL = *file.at("__bagurl").string();
  EXPECT_EQ(bagURL.rfind(server.baseURL() + "/bag?", 0), 0u) << bagURL;
  EXPECT_EQ(bagURL.find("key="), std::string::npos) << "the cache identity carries no access key";
  EXPECT_NE(bagURL.find("agent="), std::string::npos);
}

TEST_F(BagControllerTest, DiskBagServesAndIsRefetchedOnlyWhenDue) {
  ASSERT_FALSE(fetch());
  const Dictionary good = readBagFile();
  controller.reset();
  settle();

  // A restart over `d` as the bag file: the fetches it made.
  auto restart = [&](Dictionary d) {
    controller.reset();
    writeBagFile(PropertyValue(d));
    const auto before = bagRequests().size();
    clearPosted();
    make();
    settle();
    waitForIdle();
    return bagRequests().size() - before;
  };

  // Fresh: installed at once and announced, but no news change from a disk bag.
  EXPECT_EQ(restart(good), 0u);
  ASSERT_EQ(postedCount(), 1u);
  EXPECT_TRUE(newsPosts.empty());

  Dictionary d = good;
  d["__expiration"] = PropertyValue(now() + 601);
  EXPECT_EQ(restart(d), 0u) << "601 s ahead is still fresh";

  d["__expiration"] = PropertyValue(now() + 599);
  EXPECT_EQ(restart(d), 1u) << "599 s ahead is inside the margin";
  EXPECT_GT(*readBagFile().at("__expiration").real(), now() + 14000) << "the refetched bag replaced the file";

  d = good;
  d["__bagurl"] = PropertyValue("https://elsewhere.example/bag?locale=de_DE");
  EXPECT_EQ(restart(d), 1u) << "a bag fetched for another context is refetched";

  // Time passes: the bag in memory turns stale and the next read refetches in the background.
  EXPECT_EQ(restart(good), 0u);
  const auto before = bagRequests().size();
  clock.advance(platform::seconds(14400 - 599));
  EXPECT_TRUE(controller->currentBag()) << "a stale bag still serves";
  settle();
  waitForIdle();
  EXPECT_EQ(bagRequests().size(), before + 1);
  // A file whose top is not a dictionary is left: nothing is installed from it.
  controller.reset();
  writeBagFile(PropertyValue::Array{"a"});
  clearPosted();
  make();
  settle();
  EXPECT_FALSE(controller->inMemoryBag());
  EXPECT_EQ(postedCount(), 0u);
}

TEST_F(BagControllerTest, FailedFetchesReportTheirReasonAndKeepTheOldBag) {
  ASSERT_FALSE(fetch());
  auto old = controller->currentBag();
  const Dictionary oldFile = readBagFile();
  const auto failedBefore = TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.bag.fetchesfailed");

  const std::vector<std::pair<nlohmann::json, std::string>> cases = {
      {{{"path", "/bag"}, {"status", 304}, {"body", ""}, {"times", 1}}, "statusCode 304"},
      {{{"path", "/bag"}, {"body", "[1, 2]"}, {"times", 1}}, "not JSON object"},
  };
  for (const auto& [f, reason] : cases) {
    fault(f);
    auto error = fetch();
    ASSERT_TRUE(error) << reason;
    EXPECT_EQ(std::tuple(error->domain, error->code, error->reason),
              std::tuple(std::string("kTVXErrorDomain"), 2L, reason));
    EXPECT_EQ(controller->currentBag(), old);
  }
  EXPECT_EQ(readBagFile(), oldFile);
  EXPECT_EQ(postedCount(), 1u);
  EXPECT_EQ(TavixDiagnosticDataReporter::store().value("com.norvel.tavixd.bag.fetchesfailed"), failedBefore + 2);
}

TEST_F(BagControllerTest, TriggersDuringAFetchMergeIntoItAndTransportFailuresAreRetried) {
  // The first fetch is held at the server while the triggers come; the reset lets it answer.
  fault({{"path", "/bag"}, {"hang", true}, {"times", 1}});
  platform::LogCapture attempts;
  for (int i = 0; i < 10; ++i) controller->currentBag();
  EXPECT_FALSE(controller->fetchBagStateWithVersion("7"));
  settle();
  EXPECT_EQ(attempts.count("Initiating bag fetch attempt"), 1u);
  ASSERT_TRUE(waitFor([&] { return bagRequests().size() == 1u; }));
  call("/_reset", "POST");
  ASSERT_TRUE(waitFor([&] { return postedCount() == 1; }));
  waitForIdle();
  EXPECT_EQ(attempts.count("Initiating bag fetch attempt"), 1u);

  // A dropped connection is retried after a pause on the clock, and the retry succeeds.
  fault({{"path", "/bag"}, {"drop", true}, {"times", 1}});
  std::promise<std::optional<TVXBagError>> done;
  ASSERT_TRUE(controller->fetchBagStateWithVersion(std::nullopt, [&](auto, auto e) { done.set_value(e); }));
  ASSERT_TRUE(waitFor([&] { return clock.pendingTimers() == 1; }));
  EXPECT_TRUE(controller->fetchInProgress());
  clock.advance(platform::seconds(1.5));
  EXPECT_FALSE(done.get_future().get());
  waitForIdle();
  EXPECT_EQ(bagRequests().size(), 2u) << "since the reset";
  EXPECT_EQ(postedCount(), 2u);

  // Shutdown: a fetch on the wire ends quietly and no new one starts.
  fault({{"path", "/bag"}, {"hang", true}, {"times", 1}});
  std::atomic<bool> called = false;
  platform::LogCapture log;
  ASSERT_TRUE(controller->fetchBagStateWithVersion(std::nullopt, [&](auto, auto) { called = true; }));
  ASSERT_TRUE(waitFor([&] { return bagRequests().size() == 3u; }));
  controller->invalidate();
  EXPECT_FALSE(controller->fetchBagStateWithVersion(std::nullopt));
  call("/_reset", "POST");  // the held reply, a good bag, goes out only now
  ASSERT_TRUE(waitFor([&] { return log.contains("resp: "); }));
  // The bag session delivers completions one at a time: once a later one is back, the fetch's
  // own has run to its end.
  platform::http::URLRequest probe;
  probe.url = server.baseURL() + "/_recorded";
  std::promise<void> behind;
  assembly.bagSession()->dataTask(probe, [&](auto, auto, auto) { behind.set_value(); })->resume();
  behind.get_future().wait();
  EXPECT_FALSE(called);
  EXPECT_EQ(postedCount(), 2u);

  // A controller that goes while its fetch waits to retry takes the retries with it.
  controller = TavixBagController::create(bagControllerEnvironment(assembly));
  fault({{"path", "/bag"}, {"drop", true}});
  ASSERT_TRUE(controller->fetchBagStateWithVersion(std::nullopt));
  ASSERT_TRUE(waitFor([&] { return clock.pendingTimers() == 1; }));
  controller.reset();
  clock.advance(platform::seconds(60));
  settle();
  EXPECT_EQ(bagRequests().size(), 1u) << "counted since the reset";
}

TEST_F(BagControllerTest, ForcedFetchComparesVersionsNumerically) {
  controller->forceFetchBag({{"bag", PropertyValue(12)}});
  settle();
  EXPECT_FALSE(controller->fetchInProgress()) << "no bag, no version to compare";

  auto install = [&](const char* version) {
    Dictionary d{{"version", PropertyValue(version)}, {"__expiration", PropertyValue(now() + 14400)}};
    controller->cacheBagState(std::make_shared<const TVXBag>(d, "tavixd/0.1"), true);
  };
  for (const char* current : {"12", "100"}) {
    install(current);
    controller->forceFetchBag({{"bag", PropertyValue(12)}});
    EXPECT_FALSE(controller->fetchInProgress()) << current;
  }
  install("9");
  controller->forceFetchBag({{"bag", PropertyValue("twelve")}});
  EXPECT_FALSE(controller->fetchInProgress());
  controller->forceFetchBag({{"bag", PropertyValue(12)}});
  EXPECT_TRUE(controller->fetchInProgress());
  waitForIdle();
  auto requests = bagRequests();
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(requests[0]["query"]["version"], "12");

  EXPECT_LT(compareNumericStrings("1.9", "1.10"), 0);
  EXPECT_LT(compareNumericStrings("12", "12a"), 0);
}

TEST_F(BagControllerTest, LocaleChangeRefetchesThroughTheFactorysRequest) {
  ASSERT_FALSE(fetch());
  // A context notice that changes nothing leaves the bag alone.
  center->post(kTVXBagRefreshRequiredNotification, assembly.requestFactory.get());
  EXPECT_FALSE(controller->fetchInProgress());

  defaults->setObject("TVXLocale", "de_DE");
  ASSERT_TRUE(waitFor([&] { return postedCount() == 2; }));
  waitForIdle();
  auto requests = bagRequests();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[1]["query"]["locale"], "de_DE");
  EXPECT_NE(readBagFile().at("__bagurl").string()->find("locale=de_DE"), std::string::npos);
}

}  // namespace
}  // namespace tavix
