#include "platform/service_manager.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <string>

#include <systemd/sd-daemon.h>

namespace tavix::platform {

std::vector<ActivatedSocket> activatedSockets() {
  char** names = nullptr;
  const int count = sd_listen_fds_with_names(1, &names);
  std::vector<ActivatedSocket> sockets;
  for (int i = 0; i < count; ++i) {
    sockets.push_back({SD_LISTEN_FDS_START + i, names && names[i] ? names[i] : "unknown"});
  }
  if (names) {
    for (char** n = names; *n; ++n) std::free(*n);
    std::free(names);
  }
  return sockets;
}

bool isListeningUnixStreamSocket(int fd) { return sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) > 0; }

bool notifyServiceManager(std::string_view state) {
  return sd_notify(0, std::string(state).c_str()) > 0;
}

Duration watchdogInterval() {
  std::uint64_t usec = 0;
  if (sd_watchdog_enabled(0, &usec) <= 0) return Duration::zero();
  return std::chrono::duration_cast<Duration>(std::chrono::microseconds(usec));
}

bool stderrIsJournal() {
  const char* stream = std::getenv("JOURNAL_STREAM");
  if (!stream) return false;
  std::uintmax_t device = 0;
  std::uintmax_t inode = 0;
  if (std::sscanf(stream, "%" SCNuMAX ":%" SCNuMAX, &device, &inode) != 2) return false;
  struct stat st {};
  if (::fstat(STDERR_FILENO, &st) != 0) return false;
  return static_cast<std::uintmax_t>(st.st_dev) == device && static_cast<std::uintmax_t>(st.st_ino) == inode;
}

}  // namespace tavix::platform
