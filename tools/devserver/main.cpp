// tavix-devserver [--port N] [--data-dir DIR] [--corpus FILE] [--max-lifetime SECONDS]
// Prints "listening on http://127.0.0.1:PORT" first, then serves until SIGINT or SIGTERM, or
// until the lifetime (if given) has passed.
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>

#include "devserver/devserver.h"

int main(int argc, char** argv) {
  tavix::devserver::Options options;
  long maxLifetime = 0;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    const bool hasValue = i + 1 < argc;
    if (arg == "--port" && hasValue) {
      options.port = std::atoi(argv[++i]);
    } else if (arg == "--data-dir" && hasValue) {
      options.dataDir = argv[++i];
    } else if (arg == "--corpus" && hasValue) {
      options.corpusFile = argv[++i];
    } else if (arg == "--max-lifetime" && hasValue) {
      maxLifetime = std::atol(argv[++i]);
    } else {
      std::fprintf(stderr, "usage: %s [--port N] [--data-dir DIR] [--corpus FILE] [--max-lifetime SECONDS]\n",
                   argv[0]);
      return 2;
    }
  }

  // Block the stop signals before the server's threads start, so only sigtimedwait sees them.
  sigset_t stopSignals;
  sigemptyset(&stopSignals);
  sigaddset(&stopSignals, SIGINT);
  sigaddset(&stopSignals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);

  tavix::devserver::DevServer server;
  std::string error;
  if (!server.start(options, &error)) {
    std::fprintf(stderr, "tavix-devserver: %s\n", error.c_str());
    return 1;
  }
  std::printf("listening on %s\n", server.baseURL().c_str());
  std::fflush(stdout);

  const std::time_t deadline = maxLifetime > 0 ? std::time(nullptr) + maxLifetime : 0;
  for (;;) {
    timespec tick{1, 0};
    if (sigtimedwait(&stopSignals, nullptr, &tick) > 0) break;
    if (deadline != 0 && std::time(nullptr) >= deadline) break;
  }
  server.stop();
  return 0;
}
