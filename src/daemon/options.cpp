#include "daemon/options.h"

#include <cstdlib>

namespace tavix {

std::string daemonUsage() {
  return "usage: tavixd [options]\n"
         "\n"
         "The device-side search and suggestion daemon. Runs until SIGINT or SIGTERM.\n"
         "\n"
         "options:\n"
         "  --socket PATH            listen on PATH (default: $XDG_RUNTIME_DIR/com.norvel.tavixd/socket)\n"
         "  --exit-when-idle SECONDS exit cleanly after SECONDS with no client and no pending work\n"
         "  --log-level LEVEL        debug, info, default, error or fault (default: info)\n"
         "  --help                   show this text\n"
         "\n"
         "State lives in $XDG_CACHE_HOME/com.norvel.tavixd and $XDG_CONFIG_HOME/com.norvel.tavixd.\n";
}

std::optional<DaemonOptions> parseDaemonOptions(const std::vector<std::string>& args, std::string* error) {
  DaemonOptions options;
  for (std::size_t i = 0; i < args.size(); ++i) {
    const std::string& arg = args[i];
    auto value = [&](const char* name) -> std::optional<std::string> {
      if (i + 1 >= args.size()) {
        *error = std::string(name) + " needs a value";
        return std::nullopt;
      }
      return args[++i];
    };
    if (arg == "--help" || arg == "-h") {
      options.help = true;
    } else if (arg == "--socket") {
      auto v = value("--socket");
      if (!v) return std::nullopt;
      if (v->empty()) {
        *error = "--socket needs a path";
        return std::nullopt;
      }
      options.socketPath = *v;
    } else if (arg == "--exit-when-idle") {
      auto v = value("--exit-when-idle");
      if (!v) return std::nullopt;
      char* end = nullptr;
      double seconds = std::strtod(v->c_str(), &end);
      if (v->empty() || *end != '\0' || !(seconds > 0)) {
        *error = "--exit-when-idle needs a positive number of seconds, not '" + *v + "'";
        return std::nullopt;
      }
      options.exitWhenIdle = seconds;
    } else if (arg == "--log-level") {
      auto v = value("--log-level");
      if (!v) return std::nullopt;
      if (!platform::parseLogLevel(*v, &options.logLevel)) {
        *error = "unknown log level '" + *v + "' (debug, info, default, error, fault)";
        return std::nullopt;
      }
    } else {
      *error = "unknown argument '" + arg + "'";
      return std::nullopt;
    }
  }
  return options;
}

}  // namespace tavix
