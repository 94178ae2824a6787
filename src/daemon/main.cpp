#include <cstdio>
#include <string>
#include <vector>

#include "daemon/options.h"
#include "daemon/startup.h"

int main(int argc, char** argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  std::string error;
  auto options = tavix::parseDaemonOptions(args, &error);
  if (!options) {
    std::fprintf(stderr, "tavixd: %s\n\n%s", error.c_str(), tavix::daemonUsage().c_str());
    return 2;
  }
  if (options->help) {
    std::fputs(tavix::daemonUsage().c_str(), stdout);
    return 0;
  }
  return tavix::runDaemon(*options, tavix::platform::Paths::fromEnvironment());
}
