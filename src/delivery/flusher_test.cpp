#include <gtest/gtest.h>
#include <httplib.h>

#include <fcntl.h>
#include <sys/stat.h>

#include <fstream>
#include <nlohmann/json.hpp>

#include "bag/tavix_bag_controller.h"
#include "bagview/user_agent.h"
#include "core/assembly.h"
#include "core/custom_feedback_dirs.h"
#include "core/diagnostics.h"
#include "delivery/custom_feedback_flusher.h"
#include "delivery/feedback_flusher.h"
#include "delivery/upload_manager.h"
#include "devserver/devserver.h"
#include "feedback/client_session.h"
#include "feedback/persistent_storage.h"
#include "feedback/tavix_feedback.h"
#include "network/request_factory.h"
#include "platform/activity.h"
#include "platform/clock.h"
#include "platform/counters.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "platform/log.h"
#include "platform/notification_center.h"
#include "platform/transactions.h"
#include "support/test_assembly.h"
#include "tavix_proto/feedback_records.pb.h"

namespace tavix {
namespace {

using json = nlohmann::json;
using testing::waitFor;

constexpr const char* kActivity = "com.norvel.tavixd.flusher.background";

// The whole delivery path over real files and real HTTP: session files in a temporary caches
// folder, the devserver as the server, a bag fetched from it.
// Flushes chain synchronous hops: the default, deep enough, pool.
class FlusherTest : public ::testing::Test, protected testing::TestAssembly {
 protected:
  FlusherTest() : testing::TestAssembly(0) {
    home.exportEnvironment();
    std::string error;
    EXPECT_TRUE(server.start({}, &error)) << error;
    assembly.activityScheduler = &activities;
    defaults->setObject("TVXBagURL", server.baseURL() + "/bag");
    makeRequestFactory();
  }
  ~FlusherTest() override {
    pool.drain();
    if (assembly.bagController) assembly.bagController->invalidate();
    assembly.uploadManager.reset();
    session.reset();
    transport.reset();
    pool.drain();
  }

  // Serves `extra` merged into the devserver's own bag, then waits until the daemon has it.
  void start(json extra = json::object()) {
    httplib::Client control("127.0.0.1", server.port());
    json bag = json::parse(control.Get("/bag")->body);
    bag.update(extra);
    control.Post("/_faults", json{{"path", "/bag"}, {"body", bag.dump()}}.dump(), "application/json");
    control.Post("/_reset_recordings", "", "application/json");
    makeStorage();
    session = BackgroundUploadSession::create(transport, home.cache() / "journal", pool);
    assembly.uploadManager = UploadManager::create(pool, *center, assembly.requestFactory, session);
    assembly.bagController = TavixBagController::create(bagControllerEnvironment(assembly));
    assembly.bagController->currentBag();
    ASSERT_TRUE(waitFor([&] { return assembly.uploadManager->feedbackEndpoint().has_value(); }));
    // The fetch leaves a session of its own; the tests count only the sessions they write.
    ASSERT_TRUE(waitFor([&] {
      bool found = false;
      for (auto& handle : assembly.persistentStorage->getAvailableSessionHandles()) {
        auto record = handle->peekRecord();
        if (!record || record->agent() != tavixdUserAgent()) continue;
        assembly.persistentStorage->deleteSessionWithFileContainer(handle);
        found = true;
      }
      return found;
    }));
  }

  // The flushers' services, taken from the assembly as it stands.
  TavixFeedbackFlusher::Environment feedbackFlusherEnvironment() {
    return {feedbackEnvironment(assembly), assembly.uploadManager, assembly.flusherIPCListener, &transactions};
  }
  TavixCustomFeedbackFlusher::Environment customFeedbackFlusherEnvironment() {
    return {home.cache(), assembly.cachesFolder(), feedbackEnvironment(assembly), assembly.bagController,
            assembly.uploadManager};
  }

  std::size_t waitingSessions() { return assembly.persistentStorage->getAvailableSessionHandles().size(); }
  json received() {
    httplib::Client client("127.0.0.1", server.port());
    return json::parse(client.Get("/_feedback")->body);
  }
  static std::int64_t counter(const std::string& key) { return TavixDiagnosticDataReporter::store().value(key); }

  devserver::DevServer server;
  platform::SerialQueue activityQueue{pool, "activities"};
  platform::ActivityScheduler activities{clock, activityQueue, transactions};
  std::shared_ptr<platform::http::URLSession> transport =
      std::make_shared<platform::http::URLSession>(platform::http::URLSessionConfiguration{});
  std::shared_ptr<BackgroundUploadSession> session;
};

class CustomFeedbackTest : public FlusherTest {
 protected:
  platform::fs::path root() { return home.cache() / "com.norvel.tavixd" / kTVXCustomFeedbackDir; }
  void makeDirectories() {
    for (int type = kTVXFirstCustomFeedbackType; type <= kTVXLastCustomFeedbackType; ++type) {
      if (auto name = customFeedbackDirectoryForType(type)) platform::fs::create_directories(root() / *name);
    }
  }
  void writeItem(std::string_view type, const std::string& name, std::size_t size) {
    std::string bytes(size, 'a');
    for (std::size_t i = 0; i < size; i += 13) bytes[i] = static_cast<char>('a' + i % 26);
    std::ofstream(root() / type / name, std::ios::binary) << bytes;
  }
  std::size_t itemsLeft() {
    std::size_t n = 0;
    for (const auto& e : platform::fs::recursive_directory_iterator(root())) n += e.is_regular_file();
    return n;
  }
};

TEST_F(CustomFeedbackTest, ItemsUpToTheLimitAreUploadedLargerOnesReportedAndAllDeleted) {
  makeDirectories();
  start({{"custom_feedback_max_bytes", {{"BrovaneAutoFill", 1000}}}});
  writeItem(kTVXBrovaneAutoFillDir, "exact", 1000);
  writeItem(kTVXBrovaneAutoFillDir, "over", 1001);
  writeItem(kTVXQuilletDir, "default-limit", 2097152);
  writeItem(kTVXQuilletDir, "over-default", 2097153);
  // Written a moment ago, by the clock: its writer may not be done with it.
  writeItem(kTVXEngagedCompletionDir, "fresh", 10);
  const double now = platform::toUnixSeconds(clock.now()) - 1;
  const timespec times[2] = {{static_cast<time_t>(now), 0}, {static_cast<time_t>(now), 0}};
  ::utimensat(AT_FDCWD, (root() / kTVXEngagedCompletionDir / "fresh").c_str(), times, 0);
  auto reports = std::make_shared<CrowdsourcingReportStore>(home.cache() / "reports");
  platform::fs::create_directories(reports->folder());
  std::ofstream(reports->folder() / "report-1") << R"({"dp":1})";
  std::ofstream(reports->folder() / ".hidden") << "x";
  const auto tooLarge = counter("com.norvel.tavixd.customfeedback.BrovaneAutoFill.filetoolarge");

  platform::LogCapture logs;
  int completions = 0;
  TavixCustomFeedbackFlusher(customFeedbackFlusherEnvironment(), reports).flushCustomFeedbackWithCompletionHandler([&] { ++completions; });
  EXPECT_EQ(completions, 1);
  EXPECT_TRUE(waitFor([&] { return itemsLeft() == 1; })) << "each item goes once its upload is journalled";
  EXPECT_TRUE(platform::fs::exists(root() / kTVXEngagedCompletionDir / "fresh")) << "left for a later run";
  EXPECT_EQ(counter("com.norvel.tavixd.customfeedback.BrovaneAutoFill.filetoolarge"), tooLarge + 1);
  EXPECT_EQ(logs.count("Custom feedback item BrovaneAutoFill too big to process: 1001"), 1u);
  EXPECT_EQ(logs.count("Custom feedback item Quillet too big to process: 2097153"), 1u);
  EXPECT_EQ(logs.count("No SeekaraResultFeatures custom feedback available for flushing"), 1u);
  EXPECT_EQ(reports->reportsNotYetSubmitted().size(), 0u);

  ASSERT_TRUE(waitFor([&] { return received().size() == 3; }));
  std::map<std::string, std::size_t> sizes;  // type (or path) -> size
  for (const auto& upload : received()) {
    sizes[upload["path"] == "/crowdsourcing" ? "crowdsourcing" : upload["type"].get<std::string>()] = upload["size"];
  }
  EXPECT_EQ(sizes, (std::map<std::string, std::size_t>{{"BrovaneAutoFill", 1000}, {"Quillet", 2097152}, {"crowdsourcing", 8}}));

  // The two oversize items became error sessions, waiting for the next feedback flush.
  ASSERT_TRUE(waitFor([&] { return waitingSessions() == 2; }));
  std::vector<std::string> bodies;
  auto flusher = TavixFeedbackFlusher::create(feedbackFlusherEnvironment());
  bool done = false;
  flusher->forceFlushWithCompletion([&] { done = true; });
  ASSERT_TRUE(waitFor([&] { return done && received().size() == 5; }));
  std::map<std::string, json> oversize;  // type -> the error's user info
  for (const auto& upload : received()) {
    if (!upload.contains("json") || !upload["json"].contains("fb")) continue;
    for (const auto& event : upload["json"]["fb"]) {
      if (event.value("code", 0) != 4 || event.value("domain", "") != "kTVXErrorDomain") continue;
      EXPECT_FALSE(event.contains("reason")) << event;
      oversize[event["user_info"].value("type", "")] = event["user_info"];
    }
  }
  ASSERT_EQ(oversize.size(), 2u);
  EXPECT_EQ(oversize["BrovaneAutoFill"]["size"], 1001);
  EXPECT_EQ(oversize["Quillet"]["size"], 2097153);
}

TEST_F(CustomFeedbackTest, AMissingTypeFolderEndsTheRunEarly) {
  makeDirectories();
  start();
  writeItem(kTVXSeekaraResultFeaturesDir, "features", 10);
  writeItem(kTVXBrovaneAutoPlayDir, "play", 10);
  platform::fs::remove_all(root() / kTVXBrovaneAutoFillDir);
  auto reports = std::make_shared<CrowdsourcingReportStore>(home.cache() / "reports");
  platform::fs::create_directories(reports->folder());
  std::ofstream(reports->folder() / "report-1") << "dp";

  int completions = 0;
  TavixCustomFeedbackFlusher(customFeedbackFlusherEnvironment(), reports).flushCustomFeedbackWithCompletionHandler([&] { ++completions; });
  EXPECT_EQ(completions, 0);
  EXPECT_TRUE(waitFor([&] { return !platform::fs::exists(root() / kTVXSeekaraResultFeaturesDir / "features"); }));
  EXPECT_TRUE(platform::fs::exists(root() / kTVXBrovaneAutoPlayDir / "play"));
  EXPECT_EQ(reports->reportsNotYetSubmitted().size(), 1u);
  ASSERT_TRUE(waitFor([&] { return received().size() == 1; }));
  pool.drain();
  EXPECT_EQ(received().size(), 1u);
  EXPECT_EQ(received()[0]["type"], "SeekaraResultFeatures");

  // No CustomFeedback folder at all: nothing to do, no completion either.
  platform::fs::remove_all(root());
  TavixCustomFeedbackFlusher(customFeedbackFlusherEnvironment(), reports).flushCustomFeedbackWithCompletionHandler([&] { ++completions; });
  EXPECT_EQ(completions, 0);
}

}  // namespace
}  // namespace tavix
