// The upload manager over real files and real HTTP: upload journals in a temp home, the
// in-process devserver as the server.
#include "delivery/upload_manager.h"

#include <gtest/gtest.h>
#include <httplib.h>

#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <fstream>
#include <future>
#include <nlohmann/json.hpp>

#include "bagview/tvx_bag.h"
#include "core/diagnostics.h"
#include "devserver/devserver.h"
#include "platform/counters.h"
#include "platform/http/url_session.h"
#include "platform/json_value.h"
#include "platform/log.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

using json = nlohmann::json;

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
  ~BlackHole() { ::close(fd_); }
  int port() const { return port_; }
  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_); }

 private:
  int fd_ = -1;
  int port_ = 0;
};

class UploadManagerTest : public ::testing::Test, protected testing::TestAssembly {
 protected:
  UploadManagerTest() : testing::TestAssembly(0) {
    std::string error;
    EXPECT_TRUE(server.start({}, &error)) << error;
    makeRequestFactory();
  }
  ~UploadManagerTest() override {
    manager.reset();
    session.reset();
    transport.reset();
    pool.drain();
  }

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

  json received() {
    httplib::Client client("127.0.0.1", server.port());
    return json::parse(client.Get("/_feedback")->body);
  }
  static std::int64_t counter(const std::string& key) { return TavixDiagnosticDataReporter::store().value(key); }

  devserver::DevServer server;
  std::shared_ptr<platform::http::URLSession> transport =
      std::make_shared<platform::http::URLSession>(platform::http::URLSessionConfiguration{});
  std::shared_ptr<BackgroundUploadSession> session;
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
