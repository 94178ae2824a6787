// Unix-domain stream sockets with credentials and descriptor passing: the system calls under the
// IPC server and the client library. No event loop here; callers choose blocking or not.
//
// Errors are std::error_code values in the generic category; nothing throws. Every descriptor
// this file makes is close-on-exec.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>
#include <system_error>
#include <vector>

namespace tavix::platform::ipc {

// An owned file descriptor; closes on destruction.
class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& o) noexcept : fd_(o.release()) {}
  UniqueFd& operator=(UniqueFd&& o) noexcept;
  ~UniqueFd() { reset(); }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  int release() {
    int fd = fd_;
    fd_ = -1;
    return fd;
  }
  void reset(int fd = -1);

 private:
  int fd_ = -1;
};

struct PeerCredentials {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
};

// The credentials of the process at the other end of a connected socket (SO_PEERCRED).
std::error_code peerCredentials(int fd, PeerCredentials* out);

// The executable of a running process (/proc/<pid>/exe).
std::error_code executablePath(pid_t pid, std::string* out);

// The last component of `path` ("/usr/bin/tavix_tool" -> "tavix_tool").
std::string lastPathComponent(std::string_view path);

// A listening socket at `path`. The parent directory is created 0700 and the socket made 0600. A
// stale socket file (nobody listening) is replaced; a live one is EADDRINUSE.
std::error_code listenAt(const std::string& path, UniqueFd* out);

// A blocking connection to the socket at `path`.
std::error_code connectTo(const std::string& path, UniqueFd* out);

// Sends as much of `bytes` as the socket takes without blocking (MSG_DONTWAIT) or, with
// `blocking`, all of it. `fds` ride with the first byte sent. Returns the bytes sent through
// `sent`; EAGAIN is not an error (sent may be short), anything else is.
std::error_code sendWithFds(int fd, std::string_view bytes, const std::vector<int>& fds, bool blocking,
                            std::size_t* sent);

// Reads up to `size` bytes; received descriptors are appended to `fds`. A return of 0 bytes with
// no error is the end of the stream. EAGAIN comes back as an error for non-blocking sockets.
std::error_code receiveWithFds(int fd, char* buffer, std::size_t size, bool blocking, std::vector<int>* fds,
                               std::size_t* received);

}  // namespace tavix::platform::ipc
