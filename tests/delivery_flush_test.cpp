// Feedback delivery end to end: session files left on disk, the real daemon restarted, the
// flusher activity and the tool's dump, the devserver as the feedback server (it inflates each
// body and accepts it only when its digest matches).
#include <gtest/gtest.h>
#include <httplib.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <map>
#include <nlohmann/json.hpp>

#include "core/assembly.h"
#include "feedback/client_session.h"
#include "feedback/persistent_storage.h"
#include "feedback/tavix_feedback.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "support/daemon_process.h"
#include "support/devserver_process.h"
#include "support/temp_home.h"
#include "tavix_proto/feedback_records.pb.h"

namespace tavix {
namespace {

using json = nlohmann::json;
using testing::waitFor;

constexpr const char* kFlusherActivity = "com.norvel.tavixd.flusher.background";

int runTool(const std::string& args, std::string* out) {
  const std::string command = std::string(TAVIX_TOOL_BINARY) + " " + args + " 2>&1";
  FILE* p = popen(command.c_str(), "r");
  out->clear();
  char buf[512];
  while (std::fgets(buf, sizeof buf, p)) *out += buf;
  const int status = pclose(p);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// Writes finished sessions the way the daemon does, as another run of it would have left them.
void writeSessions(const testing::TempHome& home, const std::vector<std::string>& agents) {
  platform::DispatchPool pool;
  platform::VirtualClock clock;
  Assembly assembly;
  assembly.dispatchPool = &pool;
  assembly.clock = &clock;
  assembly.paths = platform::Paths::fromEnvironment();
  assembly.userDefaults = std::make_shared<platform::UserDefaults>(home.config() / "scratch", "scratch");
  assembly.userDefaults->registerDefaults({{"TVXSessionSizeLimit", platform::PropertyValue(std::int64_t{2097152})},
                                           {"TVXSessionMaxAge", platform::PropertyValue(std::int64_t{172800})}});
  assembly.persistentStorage = std::make_shared<TavixPersistentStorage>(assembly);
  for (const auto& agent : agents) {
    proto::CTErrorFeedback event;
    event.set_code(500);
    event.set_domain("tests");
    event.set_reason("from " + agent);
    auto session = ClientSession::open(assembly, makeTavixFeedbackWithCodable(event, 0, "", agent));
    event.set_reason("again from " + agent);
    session->addFeedback(makeTavixFeedbackWithCodable(event, 0, "", agent));
    session->sessionComplete();
  }
  pool.drain();
}

// The session files of the test's own clients: the daemon's bag fetches leave sessions of
// their own (agent "... tavixd/0.1"), which are not counted.
std::size_t sessionFiles(const testing::TempHome& home) {
  std::size_t n = 0;
  std::error_code ec;
  for (const auto& e : platform::fs::directory_iterator(home.cache() / "com.norvel.tavixd", ec)) {
    if (e.path().filename().string().rfind("session.", 0) != 0) continue;
    std::ifstream in(e.path(), std::ios::binary);
    const std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    for (const char* agent : {"seekara/1", "brovane/2", "news/3"}) {
      if (bytes.find(agent) != std::string::npos) {
        ++n;
        break;
      }
    }
  }
  return n;
}

struct Daemon : testing::DaemonProcess {
  // Each run logs to a file of its own, so that one run's lines never answer for the next's.
  Daemon(const testing::TempHome& home, const std::string& logName)
      : DaemonProcess(TAVIXD_BINARY, home, {"--log-level", "debug"}, logName) {
    EXPECT_TRUE(waitForLog("tavixd started"));
    // Uploads need the endpoints the bag names.
    EXPECT_TRUE(waitForLog("bag change notification received", 10000)) << log();
  }
};

class DeliveryDaemon : public ::testing::Test {
 protected:
  DeliveryDaemon() {
    home.exportEnvironment();
    platform::UserDefaults defaults(home.config() / "com.norvel.tavixd", "com.norvel.tavixd");
    defaults.setObject("TVXBagURL", server.base + "/bag");
  }
  // Agent → number of uploads that carried its session.
  std::map<std::string, int> uploadsByAgent() {
    const auto port = std::stoi(server.base.substr(server.base.rfind(':') + 1));
    httplib::Client client("127.0.0.1", port);
    auto res = client.Get("/_feedback");
    std::map<std::string, int> agents;
    if (!res) return agents;
    for (const auto& upload : json::parse(res->body)) {
      // The tool's own comings and goings are feedback too; only the written sessions count here.
      const std::string agent = upload["json"]["agent"].get<std::string>();
      if (agent.find("tavix_tool") != std::string::npos) continue;
      // Nor the daemon's own bag-fetch sessions.
      if (agent.ends_with(" tavixd/0.1")) continue;
      EXPECT_EQ(upload["path"], "/feedback");
      EXPECT_EQ(upload["v"], "2");
      EXPECT_EQ(upload["json"]["fb"].size(), 2u);
      ++agents[upload["json"]["agent"].get<std::string>()];
    }
    return agents;
  }

  testing::TempHome home;
  testing::DevServerProcess server{DEVSERVER_BINARY};
};

TEST_F(DeliveryDaemon, EverySessionReachesTheServerOnceAcrossRestartsDumpsAndPeriodicRuns) {
  ASSERT_FALSE(server.base.empty()) << server.firstLine;
  std::string out;
  writeSessions(home, {"seekara/1", "brovane/2", "news/3"});
  ASSERT_EQ(sessionFiles(home), 3u);

  {
    // A start and a stop leave waiting sessions where they are.
    Daemon d(home, "tavixd-1.log");
    EXPECT_EQ(d.stop(), 0);
  }
  ASSERT_EQ(sessionFiles(home), 3u);

  {
    Daemon d(home, "tavixd-2.log");
    // Periodic flushing stopped: a run reads and deletes nothing.
    ASSERT_EQ(runTool("stop-flushing", &out), 0) << out << d.log();
    EXPECT_NE(out.find("periodic flushing stopped"), std::string::npos) << out;
    ASSERT_EQ(runTool(std::string("activity run ") + kFlusherActivity, &out), 0) << out;
    EXPECT_TRUE(d.waitForLog("Flusher bailing because periodic flush is disabled")) << d.log();
    // (The tool's own connections leave sessions of the daemon's beside the written ones.)
    EXPECT_GE(sessionFiles(home), 3u);
    EXPECT_TRUE(uploadsByAgent().empty());

    // A dump sends everything, shows each body as it goes, and turns periodic flushing back on.
    ASSERT_EQ(runTool("dump", &out), 0) << out << d.log();
    EXPECT_NE(out.find("flushed session 3 ("), std::string::npos) << out;
    EXPECT_NE(out.find("dump complete: "), std::string::npos) << out;
    EXPECT_TRUE(waitFor([&] { return uploadsByAgent().size() == 3; }, 10000)) << d.log();
    EXPECT_EQ(runTool("defaults read TVXFeedbackFlushDisabled", &out), 1) << out;
    EXPECT_EQ(d.stop(), 0);
  }

  // Two more sessions from a later run; the periodic activity sends them after a restart.
  writeSessions(home, {"vocly/4", "lookup/5"});
  {
    Daemon d(home, "tavixd-3.log");
    ASSERT_EQ(runTool(std::string("activity run ") + kFlusherActivity, &out), 0) << out;
    EXPECT_TRUE(d.waitForLog("All periodic flush tasks completed.")) << d.log();
    EXPECT_TRUE(waitFor([&] { return uploadsByAgent().size() == 5; }, 10000)) << d.log();
    // Nothing left for another run.
    ASSERT_EQ(runTool(std::string("activity run ") + kFlusherActivity, &out), 0) << out;
    EXPECT_TRUE(waitFor([&] { return d.log().find("All periodic flush tasks completed.") !=
                                     d.log().rfind("All periodic flush tasks completed."); }));
    EXPECT_EQ(d.stop(), 0);
  }
  const auto agents = uploadsByAgent();
  EXPECT_EQ(agents, (std::map<std::string, int>{
                        {"brovane/2", 1}, {"lookup/5", 1}, {"news/3", 1}, {"seekara/1", 1}, {"vocly/4", 1}}));
}

// tavix_tool running in the background, its stdout read line by line.
class BackgroundTool {
 public:
  explicit BackgroundTool(std::vector<std::string> args) {
    int fds[2];
    EXPECT_EQ(::pipe(fds), 0);
    pid_ = ::fork();
    if (pid_ == 0) {
      ::dup2(fds[1], 1);
      ::close(fds[0]);
      std::vector<char*> argv{const_cast<char*>(TAVIX_TOOL_BINARY)};
      for (auto& a : args) argv.push_back(a.data());
      argv.push_back(nullptr);
      ::execv(TAVIX_TOOL_BINARY, argv.data());
      ::_exit(127);
    }
    ::close(fds[1]);
    out_ = ::fdopen(fds[0], "r");
  }
  ~BackgroundTool() {
    ::kill(pid_, SIGTERM);
    ::waitpid(pid_, nullptr, 0);
    std::fclose(out_);
  }
  std::string readLine() {
    char buffer[65536];
    return std::fgets(buffer, sizeof buffer, out_) ? std::string(buffer) : std::string();
  }

 private:
  pid_t pid_ = -1;
  FILE* out_ = nullptr;
};

TEST_F(DeliveryDaemon, WatchUploadsShowsEachBodyAsItIsSent) {
  ASSERT_FALSE(server.base.empty()) << server.firstLine;
  writeSessions(home, {"messages/7"});
  Daemon d(home, "tavixd-watch.log");
  BackgroundTool watcher({"watch-uploads", "--inflate"});
  ASSERT_TRUE(d.waitForLog("new listener for flusher client sessions")) << d.log();

  std::string out;
  ASSERT_EQ(runTool("dump", &out), 0) << out << d.log();
  // The watcher subscribed first, so the bodies go to it, inflated back to the records sent.
  bool seen = false;
  for (int i = 0; i < 5 && !seen; ++i) {
    const json line = json::parse(watcher.readLine(), nullptr, false);
    ASSERT_TRUE(line.is_object()) << d.log();
    EXPECT_GT(line["compressed_size"].get<int>(), 0);
    seen = line["json"]["agent"] == "messages/7";
  }
  EXPECT_TRUE(seen);
  EXPECT_TRUE(waitFor([&] { return uploadsByAgent().count("messages/7") == 1; }, 10000));
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
}  // namespace tavix
