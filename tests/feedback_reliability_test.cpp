// A daemon killed with SIGKILL while it writes feedback sessions: every session file it reported
// is afterwards read back whole or cleanly discarded, never accepted torn, and the restarted
// daemon recovers the files and goes on numbering after them. (Files cut short at any byte are the
// file container's cases.) The test prints its seed; TAVIX_TEST_SEED replays it.
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <map>
#include <random>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "feedback/persistent_storage.h"
#include "bagview/user_agent.h"
#include "platform/dispatch.h"
#include "support/raw_frames.h"
#include "support/tavixd.h"
#include "support/test_seed.h"
#include "tavix_proto/feedback_session.pb.h"
#include "tavix_proto/ipc.pb.h"

namespace tavix {
namespace {

constexpr int kAgents = 6;
constexpr std::uint64_t kMaxFileSize = 2097152;

std::string agentName(int i) { return "reliability-" + std::to_string(i) + "/1.0"; }

using Daemon = testing::Tavixd;

// Connects, says who it is, waits for the answer and hangs up: the daemon then records the
// connection's invalidation as feedback of that agent. False when the daemon is not there.
bool connectAndLeave(const std::string& path, const std::string& agent) {
  const int fd = testing::rawConnect(path, 2);
  if (fd < 0) return false;
  // Not rawSend: a daemon killed mid-conversation is expected here, not a failure.
  const std::string frame = testing::rawFrame(testing::configureFrame("reliability", agent, 1));
  bool ok = ::send(fd, frame.data(), frame.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(frame.size());
  char buf[256];
  if (ok) ok = ::recv(fd, buf, sizeof buf, 0) > 0;  // the configure reply
  ::close(fd);
  return ok;
}

// The session files that a daemon's log says it created, by number.
std::map<int, std::string> reportedFiles(const std::string& log) {
  static const std::regex line(R"(new file url (\S*session\.(\d+)))");
  std::map<int, std::string> files;
  for (std::sregex_iterator it(log.begin(), log.end(), line), end; it != end; ++it) {
    files[std::stoi((*it)[2])] = (*it)[1];
  }
  return files;
}

// A session file read back as the flusher will read it.
auto readSession(const platform::fs::path& path, platform::SerialQueue& queue) {
  return FileContainer(path, tavixdSessionFileVersion(), queue, kMaxFileSize).readRecord();
}

// Reads every session file in the folder as the flusher will, and checks that what is accepted
// is whole: a known header and only complete events of the kinds this daemon writes. Answers how
// many files it accepted.
int checkFolder(const platform::fs::path& folder, platform::SerialQueue& queue) {
  // The daemon's own agent, or a client's as the daemon completes it ("<daemon> (<device>) <client>").
  const auto known = [](const std::string& agent) {
    if (agent == tavixdUserAgent()) return true;
    for (int i = 0; i < kAgents; ++i) {
      const std::string client = " " + agentName(i);
      if (agent.size() > client.size() && agent.compare(agent.size() - client.size(), client.size(), client) == 0) {
        return true;
      }
    }
    return false;
  };
  int accepted = 0;
  for (const auto& entry : platform::fs::directory_iterator(folder)) {
    const std::string name = entry.path().filename().string();
    if (name.rfind("session.", 0) != 0) continue;
    auto record = readSession(entry.path(), queue);
    if (!record) continue;
    ++accepted;
    EXPECT_TRUE(known(record->agent())) << name << " header agent '" << record->agent() << "'";
    EXPECT_EQ(record->version(), tavixdSessionFileVersion()) << name;
    for (const auto& f : record->feedbacks()) {
      EXPECT_TRUE(known(f.user_agent())) << name << " event agent '" << f.user_agent() << "'";
      EXPECT_EQ(f.user_agent() == tavixdUserAgent() ? record->agent() : f.user_agent(), record->agent()) << name;
      const auto& p = f.payload();
      EXPECT_TRUE(p.has_connection_invalidated() || p.has_network_search_start() || p.has_network_search_end() ||
                  p.has_error() || p.has_session_end())
          << name << " type " << p.type();
    }
  }
  return accepted;
}

TEST(FeedbackReliability, SessionFilesSurviveAKillAtAnyPoint) {
  testing::TempHome home;
  platform::DispatchPool pool{1};
  platform::SerialQueue queue(pool, "com.norvel.tavixd.persistentStorageQueue");
  const platform::fs::path folder = home.cache() / "com.norvel.tavixd";
  std::mt19937 random(testing::testSeed());
  int highest = -1;
  int totalAccepted = 0;

  for (int round = 0; round < 6; ++round) {
    const std::string logName = "round" + std::to_string(round) + ".log";
    auto daemon = std::make_unique<Daemon>(home, logName);

    // Clients come and go on two threads until the daemon dies under them.
    std::atomic<bool> stop{false};
    std::atomic<int> delivered{0};
    std::vector<std::thread> clients;
    for (int t = 0; t < 2; ++t) {
      clients.emplace_back([&, t] {
        for (int i = 0; !stop.load(); ++i) {
          if (!connectAndLeave(daemon->socket, agentName((i * 2 + t) % kAgents))) break;
          delivered.fetch_add(1);
        }
      });
    }
    // The kill lands while sessions are being written: after the first file exists and a random
    // number of clients have come and gone.
    ASSERT_TRUE(daemon->waitForLog("new file url")) << daemon->log();
    const std::size_t nth = std::uniform_int_distribution<std::size_t>(1, 150)(random);
    testing::waitFor([&] { return testing::occurrences(daemon->log(), "client configuration") >= nth; }, 10000);
    daemon->signal(SIGKILL);
    EXPECT_EQ(daemon->waitExit(5000), 128 + SIGKILL);
    stop.store(true);
    for (auto& c : clients) c.join();

    const auto reported = reportedFiles(daemon->log());
    EXPECT_FALSE(reported.empty()) << "round " << round << " delivered " << delivered.load();
    for (const auto& [number, path] : reported) {
      EXPECT_GT(number, highest) << "a new file reused the number of a recovered one";
      EXPECT_TRUE(platform::fs::exists(path)) << path;
    }
    if (!reported.empty()) highest = reported.rbegin()->first;

    totalAccepted += checkFolder(folder, queue);
  }
  EXPECT_GT(totalAccepted, 0);

  // The last restart finds every file of the earlier runs and goes on.
  Daemon last(home, "last.log");
  ASSERT_TRUE(connectAndLeave(last.socket, agentName(0)));
  ASSERT_TRUE(last.waitForLog("new file url")) << last.log();
  const auto reported = reportedFiles(last.log());
  ASSERT_FALSE(reported.empty());
  EXPECT_GT(reported.begin()->first, highest);
  EXPECT_TRUE(last.alive());
  EXPECT_EQ(last.stop(), 0);
  checkFolder(folder, queue);
}

}  // namespace
}  // namespace tavix
