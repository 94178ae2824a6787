// What an idle tavixd costs the machine, with no client connected: wake-ups over a window (the
// scheduler's per-thread switch counts, so the figure says which thread wakes and where it was
// blocked), threads, anonymous and resident memory, and how long a start takes until the socket
// accepts a connection (and until a first empty call is answered through it). With --strace, a
// second window of the same length under `strace -c -f` gives the system calls behind the
// wake-ups (ptrace stops inflate the switch counts, hence the separate window).
//
// The daemon fetches its bag and resources from a devserver in this process before the window
// opens, as a daemon on a device would have done long before it went idle.
//
//   idle_cost [--window SECONDS] [--settle SECONDS] [--starts N] [--strace]
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "devserver/devserver.h"
#include "platform/defaults.h"
#include "support/daemon_process.h"
#include "support/temp_home.h"
#include "tavix/client.h"

namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

struct Flags {
  int windowSeconds = 60;
  int settleSeconds = 5;
  int starts = 20;
  bool strace = false;
};

bool parseFlags(int argc, char** argv, Flags* flags) {
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    const bool hasValue = i + 1 < argc;
    if (arg == "--window" && hasValue) {
      flags->windowSeconds = std::atoi(argv[++i]);
    } else if (arg == "--settle" && hasValue) {
      flags->settleSeconds = std::atoi(argv[++i]);
    } else if (arg == "--starts" && hasValue) {
      flags->starts = std::atoi(argv[++i]);
    } else if (arg == "--strace") {
      flags->strace = true;
    } else {
      return false;
    }
  }
  return flags->windowSeconds > 0 && flags->settleSeconds >= 0 && flags->starts > 0;
}

std::string readFile(const fs::path& path) {
  std::ifstream in(path);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

// The number after "Key:" in a /proc status file, or -1.
long statusField(const std::string& status, const std::string& key) {
  const auto at = status.find("\n" + key + ":");
  if (at == std::string::npos) return -1;
  return std::atol(status.c_str() + at + key.size() + 2);
}

// The system calls idle threads block in, by x86-64 number (first field of /proc/.../syscall).
std::string syscallName(long number) {
  static const std::map<long, std::string> names = {
      {0, "read"},         {7, "poll"},          {23, "select"},         {35, "nanosleep"},
      {128, "rt_sigtimedwait"}, {202, "futex"},  {230, "clock_nanosleep"}, {232, "epoll_wait"},
      {270, "pselect6"},   {271, "ppoll"},       {281, "epoll_pwait"},   {441, "epoll_pwait2"}};
  const auto it = names.find(number);
  return it != names.end() ? it->second : "syscall " + std::to_string(number);
}

struct ThreadSample {
  std::string name;
  std::string blockedIn;
  long switches = 0;
};

std::map<int, ThreadSample> sampleThreads(pid_t pid) {
  std::map<int, ThreadSample> threads;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator("/proc/" + std::to_string(pid) + "/task", ec)) {
    ThreadSample t;
    t.name = readFile(entry.path() / "comm");
    if (!t.name.empty() && t.name.back() == '\n') t.name.pop_back();
    const std::string status = readFile(entry.path() / "status");
    t.switches = statusField(status, "voluntary_ctxt_switches") + statusField(status, "nonvoluntary_ctxt_switches");
    const std::string call = readFile(entry.path() / "syscall");
    t.blockedIn = call.empty() || call[0] == 'r' ? "running" : syscallName(std::atol(call.c_str()));
    threads[std::atoi(entry.path().filename().c_str())] = t;
  }
  return threads;
}

// A daemon in a temporary home whose bag comes from `bagURL`.
class Daemon {
 public:
  explicit Daemon(const std::string& bagURL) : socket_((home_.runtime() / "socket").string()) {
    tavix::platform::UserDefaults defaults(home_.config() / "com.norvel.tavixd", "com.norvel.tavixd");
    defaults.setObject("TVXBagURL", bagURL);
  }

  struct Started {
    double connectMs = -1;  // until a connect() on the socket succeeded
    double answerMs = -1;   // until a first empty call through it was answered
  };

  Started start() {
    const auto began = Clock::now();
    process_.emplace(TAVIXD_BINARY, home_, std::vector<std::string>{"--socket", socket_, "--log-level", "error"});
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::snprintf(address.sun_path, sizeof address.sun_path, "%s", socket_.c_str());
    while (Clock::now() - began < std::chrono::seconds(10)) {
      const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
      const bool connected = connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
      close(fd);
      if (connected) return answered(began);
      // Short enough not to blur the figure, long enough to leave the daemon a core.
      std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
    return {};
  }

  void stop() {
    if (process_) process_->stop();
    process_.reset();
  }

  pid_t pid() const { return process_ ? process_->pid() : -1; }
  const fs::path& root() const { return home_.root(); }

 private:
  Started answered(Clock::time_point began) const {
    Started started;
    started.connectMs = std::chrono::duration<double, std::milli>(Clock::now() - began).count();
    tavix::client::Client::Options options;
    options.socketPath = socket_;
    options.configuration.set_identifier("bench");
    options.configuration.set_user_agent("bench/1");
    tavix::client::Client client(options);
    tavix::proto::Envelope call, reply;
    call.mutable_list_sessions();
    if (!client.connect() && !client.callSync(call, &reply)) {
      started.answerMs = std::chrono::duration<double, std::milli>(Clock::now() - began).count();
    }
    return started;
  }

  tavix::testing::TempHome home_;
  std::string socket_;
  std::optional<tavix::testing::DaemonProcess> process_;
};

// Answers the median start to socket ready, or -1 when a start failed.
double reportStarts(Daemon& daemon, int starts) {
  std::vector<double> connects, answers;
  Daemon::Started first;
  for (int i = 0; i <= starts; ++i) {
    const auto started = daemon.start();
    daemon.stop();
    if (started.connectMs < 0 || started.answerMs < 0) {
      std::printf("start: the socket never %s\n", started.connectMs < 0 ? "accepted a connection" : "answered a call");
      return -1;
    }
    // The first start creates the daemon's files; the others find them, as every later boot does.
    if (i == 0) {
      first = started;
    } else {
      connects.push_back(started.connectMs);
      answers.push_back(started.answerMs);
    }
  }
  std::sort(connects.begin(), connects.end());
  std::sort(answers.begin(), answers.end());
  std::printf("start to socket ready: median %.1f ms, min %.1f, max %.1f over %d starts (first start, empty home: %.1f ms)\n",
              connects[connects.size() / 2], connects.front(), connects.back(), starts, first.connectMs);
  std::printf("start to first call answered: median %.1f ms, min %.1f, max %.1f (first start: %.1f ms)\n",
              answers[answers.size() / 2], answers.front(), answers.back(), first.answerMs);
  return connects[connects.size() / 2];
}

struct IdleFigures {
  long wakeups = 0;
  long threads = 0;
  long anonKiB = 0;
  long rssKiB = 0;
};

IdleFigures reportWindow(pid_t pid, int seconds) {
  const auto before = sampleThreads(pid);
  // The idle window is wall-clock time by definition: the daemon is watched, not driven.
  std::this_thread::sleep_for(std::chrono::seconds(seconds));
  const auto after = sampleThreads(pid);
  const std::string status = readFile("/proc/" + std::to_string(pid) + "/status");

  IdleFigures figures;
  figures.threads = statusField(status, "Threads");
  figures.anonKiB = statusField(status, "RssAnon");
  figures.rssKiB = statusField(status, "VmRSS");
  std::printf("idle window %d s: per thread (tid, name, blocked in at the end, switches in the window)\n", seconds);
  for (const auto& [tid, t] : after) {
    const auto was = before.find(tid);
    const long delta = was != before.end() ? t.switches - was->second.switches : t.switches;
    figures.wakeups += delta;
    std::printf("  %7d %-16s %-16s %6ld%s\n", tid, t.name.c_str(), t.blockedIn.c_str(), delta,
                was == before.end() ? "  (started in the window)" : "");
  }
  for (const auto& [tid, t] : before) {
    if (!after.contains(tid)) std::printf("  %7d %-16s ended in the window\n", tid, t.name.c_str());
  }
  std::printf("wake-ups in the window: %ld (%.1f a minute)\n", figures.wakeups, figures.wakeups * 60.0 / seconds);
  std::printf("threads %ld, RssAnon %.2f MiB, VmRSS %.2f MiB, RssFile %.2f MiB, VmHWM %.2f MiB\n", figures.threads,
              figures.anonKiB / 1024.0, figures.rssKiB / 1024.0, statusField(status, "RssFile") / 1024.0,
              statusField(status, "VmHWM") / 1024.0);
  return figures;
}

// `strace -c -f` attached for the window; its summary printed as it stands.
void reportSyscalls(pid_t pid, int seconds, const fs::path& root) {
  const std::string out = (root / "strace.txt").string();
  const pid_t tracer = fork();
  if (tracer == 0) {
    const std::string target = std::to_string(pid);
    execlp("strace", "strace", "-q", "-c", "-f", "-p", target.c_str(), "-o", out.c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  // The same idle window, this time under strace.
  std::this_thread::sleep_for(std::chrono::seconds(seconds));
  kill(tracer, SIGINT);
  int status = 0;
  waitpid(tracer, &status, 0);
  if (WIFEXITED(status) && WEXITSTATUS(status) == 127) {
    std::printf("strace: not installed (Debian package strace)\n");
    return;
  }
  std::printf("system calls in a second idle window of %d s (strace -c -f -p):\n%s", seconds, readFile(out).c_str());
}

const char* verdict(bool pass) { return pass ? "pass" : "FAIL"; }

}  // namespace

int main(int argc, char** argv) {
  // A window is long: each line shows as it comes, also when the output goes to a file.
  std::setvbuf(stdout, nullptr, _IOLBF, 0);
  Flags flags;
  if (!parseFlags(argc, argv, &flags)) {
    std::fprintf(stderr, "usage: %s [--window SECONDS] [--settle SECONDS] [--starts N] [--strace]\n", argv[0]);
    return 2;
  }
  tavix::devserver::DevServer server;
  std::string error;
  if (!server.start({}, &error)) {
    std::fprintf(stderr, "devserver: %s\n", error.c_str());
    return 1;
  }

  int result = 1;
  {
    Daemon daemon(server.baseURL() + "/bag");
    const double startMs = reportStarts(daemon, flags.starts);
    if (startMs >= 0 && daemon.start().connectMs >= 0) {
      // Lets the bag and resource fetches finish and their follow-up timers settle.
      std::this_thread::sleep_for(std::chrono::seconds(flags.settleSeconds));
      const IdleFigures idle = reportWindow(daemon.pid(), flags.windowSeconds);
      if (flags.strace) reportSyscalls(daemon.pid(), flags.windowSeconds, daemon.root());
      std::printf("aims: wake-ups 0 [%s: %ld], threads <= 4 [%s: %ld], RssAnon <= 1.5 MiB [%s: %.2f MiB], "
                  "start <= 30 ms [%s: %.1f ms]\n",
                  verdict(idle.wakeups == 0), idle.wakeups, verdict(idle.threads <= 4), idle.threads,
                  verdict(idle.anonKiB <= 1536), idle.anonKiB / 1024.0, verdict(startMs <= 30), startMs);
      result = 0;
    } else {
      std::printf("daemon: the socket never accepted a connection\n");
    }
  }
  server.stop();
  return result;
}
