#include "platform/ipc/unix_socket.h"

#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

namespace tavix::platform::ipc {

namespace {

std::error_code lastError() { return {errno, std::generic_category()}; }

// The most descriptors one message may carry; more are refused by the kernel's SCM_MAX_FD anyway.
constexpr std::size_t kMaxFdsPerMessage = 16;

bool makeAddress(const std::string& path, sockaddr_un* addr) {
  std::memset(addr, 0, sizeof(*addr));
  addr->sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(addr->sun_path)) return false;
  std::memcpy(addr->sun_path, path.data(), path.size());
  return true;
}

}  // namespace

UniqueFd& UniqueFd::operator=(UniqueFd&& o) noexcept {
  if (this != &o) reset(o.release());
  return *this;
}

void UniqueFd::reset(int fd) {
  if (fd_ >= 0) ::close(fd_);
  fd_ = fd;
}

std::error_code peerCredentials(int fd, PeerCredentials* out) {
  ucred cred{};
  socklen_t len = sizeof(cred);
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) return lastError();
  out->pid = cred.pid;
  out->uid = cred.uid;
  out->gid = cred.gid;
  return {};
}

std::error_code executablePath(pid_t pid, std::string* out) {
  char buffer[4096];
  const std::string link = "/proc/" + std::to_string(pid) + "/exe";
  const ssize_t n = ::readlink(link.c_str(), buffer, sizeof(buffer) - 1);
  if (n < 1) return n < 0 ? lastError() : std::make_error_code(std::errc::no_such_file_or_directory);
  out->assign(buffer, static_cast<std::size_t>(n));
  return {};
}

std::string lastPathComponent(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  const auto slash = path.rfind('/');
  return std::string(slash == std::string_view::npos ? path : path.substr(slash + 1));
}

std::error_code listenAt(const std::string& path, UniqueFd* out) {
  sockaddr_un addr;
  if (!makeAddress(path, &addr)) return std::make_error_code(std::errc::filename_too_long);

  const auto dir = std::filesystem::path(path).parent_path();
  if (!dir.empty()) {
    std::error_code ec;
    const bool made = std::filesystem::create_directories(dir, ec);
    if (ec) return ec;
    if (made && ::chmod(dir.c_str(), 0700) != 0) return lastError();
  }

  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd.valid()) return lastError();

  if (::bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    if (errno != EADDRINUSE) return lastError();
    // Someone answering there is another daemon; a dead socket file is left over from a crash.
    UniqueFd probe;
    if (!connectTo(path, &probe)) return std::make_error_code(std::errc::address_in_use);
    if (::unlink(path.c_str()) != 0) return lastError();
    if (::bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) return lastError();
  }
  if (::chmod(path.c_str(), 0600) != 0) return lastError();
  if (::listen(fd.get(), SOMAXCONN) != 0) return lastError();
  *out = std::move(fd);
  return {};
}

std::error_code connectTo(const std::string& path, UniqueFd* out) {
  sockaddr_un addr;
  if (!makeAddress(path, &addr)) return std::make_error_code(std::errc::filename_too_long);
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd.valid()) return lastError();
  int rc;
  do {
    rc = ::connect(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr));
  } while (rc != 0 && errno == EINTR);
  if (rc != 0) return lastError();
  *out = std::move(fd);
  return {};
}

std::error_code sendWithFds(int fd, std::string_view bytes, const std::vector<int>& fds, bool blocking,
                            std::size_t* sent) {
  *sent = 0;
  if (fds.size() > kMaxFdsPerMessage) return std::make_error_code(std::errc::argument_list_too_long);
  bool fdsPending = !fds.empty();
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * kMaxFdsPerMessage)];
  while (*sent < bytes.size() || fdsPending) {
    iovec iov{const_cast<char*>(bytes.data() + *sent), bytes.size() - *sent};
    msghdr msg{};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    if (fdsPending) {
      msg.msg_control = control;
      msg.msg_controllen = CMSG_SPACE(sizeof(int) * fds.size());
      cmsghdr* c = CMSG_FIRSTHDR(&msg);
      c->cmsg_level = SOL_SOCKET;
      c->cmsg_type = SCM_RIGHTS;
      c->cmsg_len = CMSG_LEN(sizeof(int) * fds.size());
      std::memcpy(CMSG_DATA(c), fds.data(), sizeof(int) * fds.size());
    }
    const ssize_t n = ::sendmsg(fd, &msg, MSG_NOSIGNAL | (blocking ? 0 : MSG_DONTWAIT));
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) {
        if (!blocking) return {};
        continue;  // a blocking socket with a send timeout; try again
      }
      return lastError();
    }
    fdsPending = false;
    *sent += static_cast<std::size_t>(n);
  }
  return {};
}

std::error_code receiveWithFds(int fd, char* buffer, std::size_t size, bool blocking, std::vector<int>* fds,
                               std::size_t* received) {
  *received = 0;
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * kMaxFdsPerMessage)];
  iovec iov{buffer, size};
  msghdr msg{};
  msg.msg_iov = &iov;
  msg.msg_iovlen = 1;
  msg.msg_control = control;
  msg.msg_controllen = sizeof(control);
  ssize_t n;
  do {
    n = ::recvmsg(fd, &msg, MSG_CMSG_CLOEXEC | (blocking ? 0 : MSG_DONTWAIT));
  } while (n < 0 && errno == EINTR);
  if (n < 0) return lastError();
  for (cmsghdr* c = CMSG_FIRSTHDR(&msg); c; c = CMSG_NXTHDR(&msg, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
    const std::size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (std::size_t i = 0; i < count; ++i) {
      int received_fd;
      std::memcpy(&received_fd, CMSG_DATA(c) + i * sizeof(int), sizeof(int));
      fds->push_back(received_fd);
    }
  }
  *received = static_cast<std::size_t>(n);
  // Descriptors cut off by a short control buffer are lost; the caller sees a short count.
  return {};
}

}  // namespace tavix::platform::ipc
