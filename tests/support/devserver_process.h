// The development server run as a child process on a free port, for end-to-end tests.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace tavix::testing {

struct DevServerProcess {
  // Starts `binary --port 0 --max-lifetime 60 <args>` and reads its first line (5 s at most).
  DevServerProcess(const std::string& binary, std::vector<std::string> args = {});
  // Kills the server if it is still running.
  ~DevServerProcess();
  DevServerProcess(const DevServerProcess&) = delete;
  DevServerProcess& operator=(const DevServerProcess&) = delete;

  pid_t pid = -1;
  std::string firstLine;
  std::string base;  // "http://127.0.0.1:PORT" from "listening on ...", empty if it never said so
};

}  // namespace tavix::testing
