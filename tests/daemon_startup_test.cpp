// Starts the real tavixd binary in a temporary home and checks what a person would see.
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <fstream>
#include <map>
#include <optional>
#include <sstream>
#include <string>

#include "platform/ipc/unix_socket.h"
#include "support/daemon_process.h"
#include "tavix/client.h"

namespace {

using tavix::testing::DaemonProcess;

// (Every daemon test ends with a clean exit on SIGTERM.)
TEST(DaemonStartup, CreatesItsFoldersExitsCleanlyOnSigintAndCountsItsStarts) {
  tavix::testing::TempHome home;
  for (const char* logName : {"first.log", "second.log"}) {
    DaemonProcess d(TAVIXD_BINARY, home, {}, logName);
    ASSERT_TRUE(d.waitForLog("tavixd started")) << d.log();
    d.signal(SIGINT);
    EXPECT_EQ(d.waitExit(10000), 0);
    EXPECT_EQ(d.log().find("failed"), std::string::npos) << d.log();
  }
  for (const char* name : {"BrovaneAutoFill", "SeekaraResultFeatures", "BrovaneAutoPlay", "Quillet",
                           "EngagedCompletion", "ProactiveEventTracker"}) {
    EXPECT_TRUE(std::filesystem::is_directory(home.cache() / "com.norvel.tavixd" / "CustomFeedback" / name)) << name;
  }
  // The counters are kept across runs.
  const auto counters = tavix::testing::readFile(home.cache() / "com.norvel.tavixd" / "counters.plist");
  EXPECT_NE(counters.find("<key>com.norvel.tavixd.launch</key>\n\t<integer>2</integer>"), std::string::npos)
      << counters;
}

TEST(DaemonStartup, ExitsByItselfWhenIdleAndRejectsBadFlags) {
  tavix::testing::TempHome home;
  DaemonProcess idle(TAVIXD_BINARY, home, {"--exit-when-idle", "0.3"}, "idle.log");
  // The start-up bag fetch fails and is retried for about 8 s; its transaction holds the daemon.
  EXPECT_EQ(idle.waitExit(12000), 0) << idle.log();
  EXPECT_NE(idle.log().find("exiting"), std::string::npos);

  // A socket it cannot make ends the daemon the orderly way: services stopped, counters saved.
  std::ofstream(home.root() / "plain-file") << "not a folder";
  DaemonProcess deaf(TAVIXD_BINARY, home, {"--socket", (home.root() / "plain-file" / "socket").string()}, "deaf.log");
  EXPECT_EQ(deaf.waitExit(12000), 1) << deaf.log();
  EXPECT_NE(deaf.log().find("cannot listen on"), std::string::npos) << deaf.log();
  EXPECT_NE(deaf.log().find("tavixd stopped"), std::string::npos) << deaf.log();

  DaemonProcess bad(TAVIXD_BINARY, home, {"--log-level", "loud"}, "bad.log");
  EXPECT_EQ(bad.waitExit(3000), 2);
  EXPECT_NE(bad.log().find("unknown log level 'loud'"), std::string::npos);
}

// A datagram socket bound in the test's home, as systemd's notification and journal sockets are.
class DatagramSocket {
 public:
  explicit DatagramSocket(std::filesystem::path path) : path_(std::move(path)) {
    fd_ = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path_.c_str());
    EXPECT_EQ(::bind(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0) << path_;
  }
  ~DatagramSocket() { ::close(fd_); }
  const std::filesystem::path& path() const { return path_; }

  // The next datagram, or nothing once `ms` pass without one.
  std::optional<std::string> receive(int ms = 10000) {
    pollfd p{fd_, POLLIN, 0};
    if (::poll(&p, 1, ms) != 1) return std::nullopt;
    std::string buffer(65536, '\0');
    const ssize_t n = ::recv(fd_, buffer.data(), buffer.size(), 0);
    if (n < 0) return std::nullopt;
    buffer.resize(static_cast<std::size_t>(n));
    return buffer;
  }
  // The first datagram that contains `text`, among those `seen` so far or those that come next;
  // nothing when none comes.
  std::optional<std::string> receiveUntil(const std::string& text) {
    for (const auto& d : seen) {
      if (d.find(text) != std::string::npos) return d;
    }
    while (auto d = receive()) {
      seen.push_back(*d);
      if (d->find(text) != std::string::npos) return d;
    }
    return std::nullopt;
  }
  std::vector<std::string> seen;

 private:
  std::filesystem::path path_;
  int fd_ = -1;
};

TEST(DaemonStartup, ServesTheActivatedSocketAndTellsTheServiceManagerItsState) {
  tavix::testing::TempHome home;
  // What systemd does for tavixd.socket: a listening socket at descriptor 3, named.
  const auto socketPath = home.runtime() / "activated.socket";
  tavix::platform::ipc::UniqueFd listening;
  ASSERT_FALSE(tavix::platform::ipc::listenAt(socketPath.string(), &listening));
  DatagramSocket notify(home.root() / "notify");
  DaemonProcess d(TAVIXD_BINARY, home, {"--log-level", "debug"}, "activated.log", [&] {
    ::dup2(listening.get(), 3);  // dup2 leaves close-on-exec off
    ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
    ::setenv("LISTEN_FDS", "1", 1);
    ::setenv("LISTEN_FDNAMES", "com.norvel.tavixd", 1);
    ::setenv("NOTIFY_SOCKET", notify.path().c_str(), 1);
    ::setenv("WATCHDOG_PID", std::to_string(::getpid()).c_str(), 1);
    ::setenv("WATCHDOG_USEC", "300000", 1);
  });
  listening.reset();

  ASSERT_TRUE(notify.receiveUntil("READY=1")) << d.log();
  tavix::client::Client::Options options;
  options.socketPath = socketPath.string();
  options.configuration.set_identifier("activation-test");
  options.configuration.set_user_agent("activation-test/1");
  tavix::client::Client client(options);
  EXPECT_FALSE(client.connect()) << d.log();
  EXPECT_FALSE(std::filesystem::exists(home.runtime() / "com.norvel.tavixd" / "socket"))
      << "listened on a socket of its own";
  EXPECT_TRUE(notify.receiveUntil("WATCHDOG=1")) << d.log();

  d.signal(SIGTERM);
  EXPECT_TRUE(notify.receiveUntil("STOPPING=1")) << d.log();
  EXPECT_EQ(d.waitExit(5000), 0) << d.log();
}

// Gives the child a private /run whose journal socket is `journal`, so that the real libsystemd
// in the daemon writes to the test. Exits with 77 where no private mount namespace can be had.
void redirectJournalTo(const std::filesystem::path& journal) {
  const uid_t uid = ::geteuid();
  const gid_t gid = ::getegid();
  if (uid != 0) {
    if (::unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) ::_exit(77);
    std::ofstream("/proc/self/setgroups") << "deny";
    std::ofstream("/proc/self/uid_map") << uid << " " << uid << " 1";
    std::ofstream("/proc/self/gid_map") << gid << " " << gid << " 1";
  } else if (::unshare(CLONE_NEWNS) != 0) {
    ::_exit(77);
  }
  if (::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) ::_exit(77);
  if (::mount("tmpfs", "/run", "tmpfs", 0, "mode=0755") != 0) ::_exit(77);
  std::filesystem::create_directories("/run/systemd/journal");
  std::ofstream("/run/systemd/journal/socket").close();
  if (::mount(journal.c_str(), "/run/systemd/journal/socket", nullptr, MS_BIND, nullptr) != 0) ::_exit(77);
  // Our stderr is the journal's stream, as systemd says through JOURNAL_STREAM.
  struct stat st {};
  ::fstat(STDERR_FILENO, &st);
  ::setenv("JOURNAL_STREAM", (std::to_string(st.st_dev) + ":" + std::to_string(st.st_ino)).c_str(), 1);
}

std::map<std::string, std::string> journalFields(const std::string& entry) {
  std::map<std::string, std::string> fields;
  std::istringstream in(entry);
  for (std::string line; std::getline(in, line);) {
    const auto eq = line.find('=');
    if (eq != std::string::npos) fields[line.substr(0, eq)] = line.substr(eq + 1);
  }
  return fields;
}

TEST(DaemonStartup, LogsToTheJournalWithPrioritiesAndTheCategoryInAFieldOfItsOwn) {
  tavix::testing::TempHome home;
  DatagramSocket journal(home.root() / "journal");
  DaemonProcess d(TAVIXD_BINARY, home, {"--log-level", "debug"}, "journal.log", [&] { redirectJournalTo(journal.path()); });
  const auto started = journal.receiveUntil("MESSAGE=tavixd started");
  if (!started && d.waitExit(0) == 77) GTEST_SKIP() << "no private mount namespace for a journal of our own";
  ASSERT_TRUE(started) << d.log();
  auto fields = journalFields(*started);
  EXPECT_EQ(fields["PRIORITY"], "6");
  EXPECT_EQ(fields["CATEGORY"], "Tavix");
  EXPECT_EQ(fields["SUBSYSTEM"], "com.norvel.tavixd");
  EXPECT_EQ(fields["SYSLOG_IDENTIFIER"], "tavixd");

  // The bag request (logged before or after the start) is at the "default" level, the journal's notice.
  const auto bagFetch = journal.receiveUntil("MESSAGE=Initiating bag fetch attempt");
  ASSERT_TRUE(bagFetch) << journal.seen.size() << " entries";
  fields = journalFields(*bagFetch);
  EXPECT_EQ(fields["PRIORITY"], "5");
  EXPECT_EQ(fields["CATEGORY"], "Tavix_Protocol");

  d.signal(SIGTERM);
  const auto signalled = journal.receiveUntil("MESSAGE=SIGTERM");
  ASSERT_TRUE(signalled) << journal.seen.size() << " entries";
  EXPECT_EQ(journalFields(*signalled)["PRIORITY"], "7");
  EXPECT_EQ(d.waitExit(5000), 0) << d.log();
  EXPECT_EQ(d.log().find("tavixd started"), std::string::npos) << "logged twice: " << d.log();
}

}  // namespace
