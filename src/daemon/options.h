// tavixd's command line.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/log.h"

namespace tavix {

struct DaemonOptions {
  std::string socketPath;       // empty: $XDG_RUNTIME_DIR/com.norvel.tavixd/socket
  double exitWhenIdle = 0;      // seconds; 0: never
  platform::LogLevel logLevel = platform::LogLevel::Info;
  bool help = false;
};

// Parses argv (without the program name). On a bad argument, returns empty and sets `error`.
std::optional<DaemonOptions> parseDaemonOptions(const std::vector<std::string>& args, std::string* error);

std::string daemonUsage();

}  // namespace tavix
