#include "support/raw_frames.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cstdio>

#include "tavix_proto/ipc.pb.h"

namespace tavix::testing {

int rawConnect(const std::string& path, int timeoutSeconds) {
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
  if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    ::close(fd);
    return -1;
  }
  timeval tv{timeoutSeconds, 0};
  ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  return fd;
}

std::string rawFrame(const std::string& payload) {
  const auto n = static_cast<std::uint32_t>(payload.size());
  std::string frame{static_cast<char>(n >> 24), static_cast<char>(n >> 16), static_cast<char>(n >> 8),
                    static_cast<char>(n)};
  return frame + payload;
}

void rawSend(int fd, const std::string& payload) {
  const std::string frame = rawFrame(payload);
  ASSERT_EQ(::send(fd, frame.data(), frame.size(), MSG_NOSIGNAL), static_cast<ssize_t>(frame.size()));
}

// Reads `n` bytes into `out`: "" once read, else "<eof>" or "<timeout>".
static const char* readExactly(int fd, std::size_t n, std::string* out) {
  out->resize(n);
  for (std::size_t got = 0; got < n;) {
    const ssize_t r = ::recv(fd, out->data() + got, n - got, 0);
    if (r == 0) return "<eof>";
    if (r < 0) return "<timeout>";
    got += static_cast<std::size_t>(r);
  }
  return "";
}

// Reads one frame and no more: a frame right behind it stays in the socket for the next call.
std::string rawReceive(int fd) {
  std::string header, payload;
  if (const char* end = readExactly(fd, 4, &header); *end) return end;
  const auto* p = reinterpret_cast<const unsigned char*>(header.data());
  const std::size_t n = (std::size_t{p[0]} << 24) | (p[1] << 16) | (p[2] << 8) | p[3];
  if (const char* end = readExactly(fd, n, &payload); *end) return end;
  return payload;
}

std::string configureFrame(const std::string& identifier, const std::string& userAgent, std::uint64_t callId) {
  proto::Envelope e;
  e.set_call_id(callId);
  e.mutable_configure()->mutable_configuration()->set_identifier(identifier);
  e.mutable_configure()->mutable_configuration()->set_user_agent(userAgent);
  return e.SerializeAsString();
}

}  // namespace tavix::testing
