#include "daemon/options.h"

#include <getopt.h>

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
  enum Option : int { kSocket = 1, kExitWhenIdle, kLogLevel };
  static const option kOptions[] = {
      {"help", no_argument, nullptr, 'h'},
      {"socket", required_argument, nullptr, kSocket},
      {"exit-when-idle", required_argument, nullptr, kExitWhenIdle},
      {"log-level", required_argument, nullptr, kLogLevel},
      {nullptr, 0, nullptr, 0},
  };
  // getopt_long permutes argv: it gets copies, with the program name it expects first.
  std::vector<std::string> storage;
  storage.reserve(args.size() + 1);
  storage.emplace_back("tavixd");
  storage.insert(storage.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (auto& arg : storage) argv.push_back(arg.data());
  argv.push_back(nullptr);

  DaemonOptions options;
  optind = 0;  // start afresh: the parser keeps its place in globals
  opterr = 0;  // errors are reported through `error`, not printed
  const int argc = static_cast<int>(storage.size());
  for (int c; (c = getopt_long(argc, argv.data(), ":h", kOptions, nullptr)) != -1;) {
    const std::string value = optarg ? optarg : "";
    switch (c) {
      case 'h': options.help = true; break;
      case kSocket:
        if (value.empty()) {
          *error = "--socket needs a path";
          return std::nullopt;
        }
        options.socketPath = value;
        break;
      case kExitWhenIdle: {
        char* end = nullptr;
        const double seconds = std::strtod(value.c_str(), &end);
        if (value.empty() || *end != '\0' || !(seconds > 0)) {
          *error = "--exit-when-idle needs a positive number of seconds, not '" + value + "'";
          return std::nullopt;
        }
        options.exitWhenIdle = seconds;
        break;
      }
      case kLogLevel:
        if (!platform::parseLogLevel(value, &options.logLevel)) {
          *error = "unknown log level '" + value + "' (debug, info, default, error, fault)";
          return std::nullopt;
        }
        break;
      case ':': *error = std::string(argv[optind - 1]) + " needs a value"; return std::nullopt;
      default: *error = "unknown argument '" + std::string(argv[optind - 1]) + "'"; return std::nullopt;
    }
  }
  if (optind < argc) {
    *error = "unknown argument '" + std::string(argv[optind]) + "'";
    return std::nullopt;
  }
  return options;
}

}  // namespace tavix
