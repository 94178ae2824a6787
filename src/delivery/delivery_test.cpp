// The delivery path over real files and real HTTP: session files and upload journals in a temp
// home, the in-process devserver as the server.
#include "delivery/upload_manager.h"

#include <gtest/gtest.h>
#include <httplib.h>

#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <future>
#include <nlohmann/json.hpp>

#include "bag/tavix_bag_controller.h"
#include "bagview/tvx_bag.h"
#include "bagview/user_agent.h"
#include "core/custom_feedback_dirs.h"
#include "core/diagnostics.h"
#include "delivery/custom_feedback_flusher.h"
#include "delivery/feedback_flusher.h"
#include "devserver/devserver.h"
#include "feedback/client_session.h"
#include "feedback/tavix_feedback.h"
#include "platform/activity.h"
#include "platform/counters.h"
#include "platform/http/url_session.h"
#include "platform/json_value.h"
#include "platform/log.h"
#include "support/test_assembly.h"
#include "tavix_proto/feedback_records.pb.h"

namespace tavix {
namespace {

using json = nlohmann::json;
using testing::waitFor;


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

  int completions = 0;
  TavixCustomFeedbackFlusher(customFeedbackFlusherEnvironment(), reports).flushCustomFeedbackWithCompletionHandler([&] { ++completions; });
  EXPECT_EQ(completions, 1);
  EXPECT_TRUE(waitFor([&] { return itemsLeft() == 1; })) << "each item goes once its upload is journalled";
  EXPECT_TRUE(platform::fs::exists(root() / kTVXEngagedCompletionDir / "fresh")) << "left for a later run";
  EXPECT_EQ(counter("com.norvel.tavixd.customfeedback.BrovaneAutoFill.filetoolarge"), tooLarge + 1);
  EXPECT_EQ(reports->reportsNotYetSubmitted().size(), 0u);

  ASSERT_TRUE(waitFor([&] { return received().size() == 3; }));
  std::map<std::string, std::size_t> sizes;  // type (or path) -> size
  for (const auto& upload : received()) {
    sizes[upload["path"] == "/crowdsourcing" ? "crowdsourcing" : upload["type"].get<std::string>()] = upload["size"];
  }
  EXPECT_EQ(sizes, (std::map<std::string, std::size_t>{{"BrovaneAutoFill", 1000}, {"Quillet", 2097152}, {"crowdsourcing", 8}}));

  // The two oversize items became error sessions, waiting for the next feedback flush.
  ASSERT_TRUE(waitFor([&] { return waitingSessions() == 2; }));
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

// A TCP port that takes connections into its backlog and never answers: uploads to it stay
// pending until they are cancelled.
class BlackHole {
 public:
  BlackHole() {
    fd_ = ::socket(AF_INET, SOCK_STREAM, 0);
    int on = 1;
    ::setsockopt(fd_, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ::bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address);
    ::listen(fd_, 512);
    socklen_t size = sizeof address;
    ::getsockname(fd_, reinterpret_cast<sockaddr*>(&address), &size);
    port_ = ntohs(address.sin_port);
  }
  ~BlackHole() { close(); }
  void close() {
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
  }
  int port() const { return port_; }
  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_); }

 private:
  int fd_ = -1;
  int port_ = 0;
};

class UploadManagerTest : public FlusherTest {
 protected:
  ~UploadManagerTest() override { manager.reset(); }

  void make(std::string journal = "journal") {
    session = BackgroundUploadSession::create(transport, home.cache() / journal, pool);
    manager = UploadManager::create(pool, *center, assembly.requestFactory, session);
  }
  void postBag(json raw) {
    auto bag = std::make_shared<const TVXBag>(*platform::parseJson(raw.dump())->dictionary(), "tavixd/1");
    center->post(kTVXBagChangeNotification, nullptr, {}, bagChangeUserInfo(*bag));
  }
  json devserverBag(const std::string& base) {
    return {{"feedback_enabled", true}, {"feedback_url", base + "/feedback"}, {"crowdsourcing_url", base + "/crowdsourcing"}};
  }
  std::size_t pendingTasks() {
    std::promise<std::size_t> count;
    session->getAllTasks([&](auto tasks) { count.set_value(tasks.size()); });
    return count.get_future().get();
  }

  std::shared_ptr<UploadManager> manager;
};

TEST_F(UploadManagerTest, EndpointsFollowTheBag) {
  make();
  EXPECT_FALSE(manager->feedbackEndpoint());
  // No bag yet: not now, rather than never.
  std::vector<UploadOutcome> outcomes;
  auto note = [&](UploadOutcome outcome) { outcomes.push_back(outcome); };
  manager->uploadJSONFeedback(R"({"fb":[]})", kFeedbackEndpoint, note);
  postBag({{"feedback_enabled", true},
           {"feedback_url", "https://fb.example/upload?client=1"},
           {"crowdsourcing_url", "https://cs.example/reports"}});
  EXPECT_EQ(manager->feedbackEndpoint(), "https://fb.example/upload?client=1&v=2");
  EXPECT_EQ(manager->crowdsourcingEndpoint(), "https://cs.example/reports");

  // Feedback switched off: no endpoints, JSON uploads stop silently, file uploads say why.
  postBag({{"feedback_enabled", false},
           {"feedback_url", "https://fb.example/upload"},
           {"crowdsourcing_url", "https://cs.example/reports"}});
  EXPECT_FALSE(manager->feedbackEndpoint());
  EXPECT_FALSE(manager->crowdsourcingEndpoint());
  EXPECT_TRUE(manager->uploadJSONFeedback(R"({"fb":[]})", kFeedbackEndpoint, note));
  const auto file = home.root() / "item";
  std::ofstream(file) << "custom";
  manager->uploadFeedback(file, "BrovaneAutoFill", kFeedbackEndpoint, note);
  EXPECT_EQ(outcomes, (std::vector<UploadOutcome>{UploadOutcome::kNotNow, UploadOutcome::kNoEndpoint,
                                                  UploadOutcome::kNoEndpoint}));
  EXPECT_EQ(pendingTasks(), 0u);
  EXPECT_TRUE(received().empty());

  // A notification without a bag changes nothing.
  postBag(devserverBag(server.baseURL()));
  center->post(kTVXBagChangeNotification);
  EXPECT_EQ(manager->feedbackEndpoint(), server.baseURL() + "/feedback?v=2");
}

TEST_F(UploadManagerTest, AHundredPendingUploadsDropTheNext) {
  BlackHole hole;
  make();
  postBag(devserverBag(hole.url()));
  const auto body = home.root() / "body";
  std::ofstream(body) << "x";
  platform::http::URLRequest request;
  request.url = hole.url() + "/feedback";
  request.method = "POST";
  for (int i = 0; i < 98; ++i) ASSERT_TRUE(session->uploadTask(request, body, 1));
  ASSERT_EQ(pendingTasks(), 98u);

  platform::LogCapture logs;
  EXPECT_TRUE(manager->uploadJSONFeedback(R"({"a":1})", kFeedbackEndpoint));
  ASSERT_TRUE(testing::waitFor([&] { return pendingTasks() == 99u; }));
  EXPECT_TRUE(manager->uploadJSONFeedback(R"({"a":2})", kFeedbackEndpoint));  // 99 pending: still sent
  ASSERT_TRUE(testing::waitFor([&] { return pendingTasks() == 100u; }));
  EXPECT_TRUE(manager->uploadJSONFeedback(R"({"a":3})", kFeedbackEndpoint));
  ASSERT_TRUE(testing::waitFor([&] { return logs.contains("too many uploads pending: 100"); }));
  EXPECT_EQ(pendingTasks(), 100u);
}

TEST_F(UploadManagerTest, PendingUploadsSurviveARestartAndAreSentOnce) {
  auto hole = std::make_unique<BlackHole>();
  const int port = hole->port();
  make();
  postBag(devserverBag(hole->url()));
  const json record = {{"fb", json::array()}, {"agent", "news/2"}};
  ASSERT_TRUE(manager->uploadJSONFeedback(record.dump(), kFeedbackEndpoint));
  ASSERT_TRUE(testing::waitFor([&] { return pendingTasks() == 1u; }));

  // The daemon stops with the upload in flight: it stays journalled.
  manager.reset();
  session.reset();
  transport.reset();
  pool.drain();
  std::size_t entries = 0;
  for (const auto& e : platform::fs::directory_iterator(home.cache() / "journal")) entries += e.path().extension() == ".task";
  EXPECT_EQ(entries, 1u);

  // Next start, the server is back on that address.
  hole.reset();
  devserver::DevServer restarted;
  std::string error;
  devserver::Options options;
  options.port = port;
  ASSERT_TRUE(restarted.start(options, &error)) << error;
  transport = std::make_shared<platform::http::URLSession>(platform::http::URLSessionConfiguration{});
  const auto sentBefore = counter("com.norvel.tavixd.feedbacksent");
  // What a crash between a body and its task, or inside an atomic write, leaves: removed at start.
  std::ofstream(home.cache() / "journal" / "upload.99.body") << "orphan";
  std::ofstream(home.cache() / "journal" / ".upload.98.body.Xy12Ab") << "half";
  make();
  ASSERT_TRUE(testing::waitFor([&] { return counter("com.norvel.tavixd.feedbacksent") == sentBefore + 2; }));
  httplib::Client client("127.0.0.1", port);
  auto got = json::parse(client.Get("/_feedback")->body);
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(got[0]["json"], record);
  EXPECT_TRUE(platform::fs::is_empty(home.cache() / "journal")) << "a third start would find nothing to send";
  manager.reset();
  session.reset();
  transport.reset();  // its idle connection would hold the server's stop for the keep-alive time
}

}  // namespace
}  // namespace tavix
