// The tavixd and tavix_tool binaries of the build, for tests that drive them as a user would.
// Header-only: each test target names the binaries it depends on (TAVIXD_BINARY,
// TAVIX_TOOL_BINARY).
#pragma once

#include <sys/wait.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <string>
#include <vector>

#include "platform/defaults.h"
#include "support/daemon_process.h"
#include "tavix/client.h"

namespace tavix::testing {

// Sets `values` in the daemon's defaults in `home`, for the next daemon started there.
inline void setDaemonDefaults(const TempHome& home, const platform::Dictionary& values) {
  platform::UserDefaults defaults(home.config() / "com.norvel.tavixd", "com.norvel.tavixd");
  for (const auto& [key, value] : values) defaults.setObject(key, value);
  EXPECT_TRUE(defaults.synchronize());
}

#ifdef TAVIXD_BINARY
// tavixd with debug logging, once start-up is complete: signal handling included, not merely
// the socket bound.
struct Tavixd : DaemonProcess {
  std::string socket;

  explicit Tavixd(const TempHome& home, const std::string& logName = "tavixd.log", std::vector<std::string> extra = {})
      : DaemonProcess(TAVIXD_BINARY, home, withDebugLog(std::move(extra)), logName),
        socket((home.runtime() / "com.norvel.tavixd" / "socket").string()) {
    waitForLog("tavixd started");
  }

  // A client of this daemon; its calls fail with kTimedOut after `timeoutMs` without an answer.
  client::Client::Options clientOptions(const std::string& identifier, const std::string& userAgent,
                                        int timeoutMs = 10000) const {
    client::Client::Options options;
    options.socketPath = socket;
    options.configuration.set_identifier(identifier);
    options.configuration.set_user_agent(userAgent);
    options.timeoutMs = timeoutMs;
    return options;
  }

  static std::vector<std::string> withDebugLog(std::vector<std::string> extra) {
    extra.insert(extra.begin(), {"--log-level", "debug"});
    return extra;
  }
};
#endif

#ifdef TAVIX_TOOL_BINARY
// Runs tavix_tool in the test's environment: its exit status, `out` filled with stdout and
// stderr together.
inline int runTool(const std::string& args, std::string* out) {
  const std::string command = std::string(TAVIX_TOOL_BINARY) + " " + args + " 2>&1";
  FILE* p = popen(command.c_str(), "r");
  out->clear();
  char buf[512];
  while (std::fgets(buf, sizeof buf, p)) *out += buf;
  const int status = pclose(p);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}
#endif

}  // namespace tavix::testing
