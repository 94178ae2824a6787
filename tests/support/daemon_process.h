// A daemon binary run as a child process in a temporary home, for end-to-end tests.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

#include "support/temp_home.h"

namespace tavix::testing {

// A daemon under test fetches its bag from this machine only: unless the test wrote defaults of
// its own, this points the bag URL at a loopback port where nothing listens, so each fetch fails
// at once (and holds the daemon for its retries, about 8 s). DaemonProcess does it by itself.
void keepBagFetchesLocal(const TempHome& home);

// In a forked child: runs `binary` with `args`, or exits with 127.
[[noreturn]] void execChild(const std::string& binary, std::vector<std::string> args);

// The bytes of each feedback session file, waiting or claimed, in the daemon's caches folder.
std::vector<std::string> sessionFileContents(const TempHome& home);

class DaemonProcess {
 public:
  // Starts `binary` with `args`, the XDG homes pointed into `home`, stderr into home/`logName`.
  // `inChild` runs in the child just before exec, to hand over descriptors or set variables.
  DaemonProcess(const std::string& binary, const TempHome& home, std::vector<std::string> args,
                const std::string& logName = "tavixd.log", const std::function<void()>& inChild = {});
  // Kills a child still running.
  ~DaemonProcess();
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  pid_t pid() const { return pid_; }
  void signal(int signo) const;
  // SIGSTOP, then waits until the kernel has actually stopped the child (kill(2) only queues it).
  bool freeze();
  // True while the child runs; reaps it once it has exited.
  bool alive();
  // Waits up to `ms` for the child to exit: its exit status (128 + signal when killed), or -1.
  int waitExit(int ms);
  // SIGTERM, then waits: the exit status.
  int stop();

  std::string log() const;
  bool waitForLog(const std::string& text, int ms = 5000) const;

 private:
  bool reap(int options);

  pid_t pid_ = -1;
  int status_ = -1;
  std::filesystem::path logFile_;
};

}  // namespace tavix::testing
