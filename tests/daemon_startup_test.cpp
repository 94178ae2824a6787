// Starts the real tavixd binary in a temporary home and checks what a person would see.
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>

#include "support/daemon_process.h"

namespace {

struct Daemon : tavix::testing::DaemonProcess {
  Daemon(const tavix::testing::TempHome& home, std::vector<std::string> args, const std::string& logName)
      : DaemonProcess(TAVIXD_BINARY, home, std::move(args), logName) {}
};

TEST(DaemonStartup, CreatesItsFoldersLogsItsStartAndExitsCleanlyOnSigterm) {
  tavix::testing::TempHome home;
  {
    Daemon d(home, {"--log-level", "debug"}, "first.log");
    ASSERT_TRUE(d.waitForLog("tavixd started")) << d.log();
    for (const char* name : {"BrovaneAutoFill", "SeekaraResultFeatures", "BrovaneAutoPlay", "Quillet",
                             "EngagedCompletion", "ProactiveEventTracker"}) {
      EXPECT_TRUE(std::filesystem::is_directory(home.cache() / "com.norvel.tavixd" / "CustomFeedback" / name)) << name;
    }
    EXPECT_NE(d.log().find("TVXTraceEnabled flag set to 0"), std::string::npos);
    const auto start = std::chrono::steady_clock::now();
    d.signal(SIGTERM);
    EXPECT_EQ(d.waitExit(1000), 0) << d.log();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(1));
    EXPECT_NE(d.log().find("SIGTERM"), std::string::npos);
  }
  {
    Daemon d(home, {}, "second.log");
    ASSERT_TRUE(d.waitForLog("tavixd started")) << d.log();
    d.signal(SIGINT);
    EXPECT_EQ(d.waitExit(1000), 0);
    EXPECT_EQ(d.log().find("failed"), std::string::npos) << d.log();
  }
  // Each start counted, and the counters kept across runs.
  std::ifstream counters(home.cache() / "com.norvel.tavixd" / "counters.plist");
  std::stringstream text;
  text << counters.rdbuf();
  EXPECT_NE(text.str().find("<key>com.norvel.tavixd.launch</key>\n\t<integer>2</integer>"), std::string::npos)
      << text.str();
}

TEST(DaemonStartup, ExitsByItselfWhenIdleAndRejectsBadFlags) {
  tavix::testing::TempHome home;
  Daemon idle(home, {"--exit-when-idle", "0.3"}, "idle.log");
  // The start-up bag fetch fails and is retried for about 8 s; its transaction holds the daemon.
  EXPECT_EQ(idle.waitExit(12000), 0) << idle.log();
  EXPECT_NE(idle.log().find("exiting"), std::string::npos);

  // A socket it cannot make ends the daemon the orderly way: services stopped, counters saved.
  std::ofstream(home.root() / "plain-file") << "not a folder";
  Daemon deaf(home, {"--socket", (home.root() / "plain-file" / "socket").string()}, "deaf.log");
  EXPECT_EQ(deaf.waitExit(12000), 1) << deaf.log();
  EXPECT_NE(deaf.log().find("cannot listen on"), std::string::npos) << deaf.log();
  EXPECT_NE(deaf.log().find("tavixd stopped"), std::string::npos) << deaf.log();

  Daemon bad(home, {"--log-level", "loud"}, "bad.log");
  EXPECT_EQ(bad.waitExit(3000), 2);
  EXPECT_NE(bad.log().find("unknown log level 'loud'"), std::string::npos);
}

}  // namespace
