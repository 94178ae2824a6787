// The daemon's wire format by hand: 4-byte big-endian length, then an Envelope. For tests that
// must send what libtavix never would (garbage, unknown calls) or hang up mid-conversation.
#pragma once

#include <cstdint>
#include <string>

namespace tavix::testing {

// A connected Unix socket whose reads give up after `timeoutSeconds`; -1 when nobody listens.
int rawConnect(const std::string& path, int timeoutSeconds = 5);

// The bytes of one frame carrying `payload`.
std::string rawFrame(const std::string& payload);

// Sends one frame carrying `payload`; a short send fails the test.
void rawSend(int fd, const std::string& payload);

// The next frame's payload; "<eof>" when the daemon closed the connection, "<timeout>" when
// nothing came within the socket's read timeout.
std::string rawReceive(int fd);

// A serialized configure call.
std::string configureFrame(const std::string& identifier, const std::string& userAgent, std::uint64_t callId);

}  // namespace tavix::testing
