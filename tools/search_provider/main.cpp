// tavix-search-provider: tavixd's suggestions in the desktop's search overlay. Started by the
// session bus when the shell first asks for the provider's name.
#include <signal.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include "search_provider/search_provider.h"

namespace {

using tavix::search_provider::Options;

void usage(std::FILE* out) {
  std::fprintf(out,
               "usage: tavix-search-provider [options]\n"
               "\n"
               "Offers tavixd's results to the desktop's search overlay as %s on the session bus.\n"
               "\n"
               "options:\n"
               "  --socket PATH            the daemon's socket (default: $XDG_RUNTIME_DIR/com.norvel.tavixd/socket)\n"
               "  --opener PROGRAM         opens an activated result's URL (default: xdg-open)\n"
               "  --exit-when-idle SECONDS leave the bus after SECONDS without a call (default: never)\n"
               "  --help                   show this text\n",
               tavix::search_provider::kBusName);
}

bool parse(int argc, char** argv, Options* options, bool* help) {
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (arg == "--help" || arg == "-h") {
      *help = true;
      continue;
    }
    if (i + 1 >= argc) {
      std::fprintf(stderr, "tavix-search-provider: %s needs a value\n", arg.c_str());
      return false;
    }
    const std::string value = argv[++i];
    if (arg == "--socket") {
      options->socketPath = value;
    } else if (arg == "--opener") {
      options->opener = value;
    } else if (arg == "--exit-when-idle") {
      char* end = nullptr;
      options->exitWhenIdle = std::strtod(value.c_str(), &end);
      if (value.empty() || *end != '\0' || !(options->exitWhenIdle > 0)) {
        std::fprintf(stderr, "tavix-search-provider: --exit-when-idle needs a positive number of seconds\n");
        return false;
      }
    } else {
      std::fprintf(stderr, "tavix-search-provider: unknown argument '%s'\n", arg.c_str());
      return false;
    }
    if (value.empty()) {
      std::fprintf(stderr, "tavix-search-provider: %s needs a value\n", arg.c_str());
      return false;
    }
  }
  return true;
}

int fail(const char* what, int r) {
  std::fprintf(stderr, "tavix-search-provider: %s: %s\n", what, std::strerror(-r));
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  bool help = false;
  if (!parse(argc, argv, &options, &help)) {
    usage(stderr);
    return 2;
  }
  if (help) {
    usage(stdout);
    return 0;
  }

  // The loop takes SIGINT and SIGTERM as its own events; openers are never waited for.
  sigset_t mask;
  sigemptyset(&mask);
  sigaddset(&mask, SIGINT);
  sigaddset(&mask, SIGTERM);
  sigprocmask(SIG_BLOCK, &mask, nullptr);
  signal(SIGCHLD, SIG_IGN);
  signal(SIGPIPE, SIG_IGN);

  sd_event* event = nullptr;
  sd_bus* bus = nullptr;
  if (int r = sd_event_default(&event); r < 0) return fail("cannot make the event loop", r);
  if (int r = sd_bus_open_user(&bus); r < 0) return fail("cannot connect to the session bus", r);
  int status = 0;
  {
    tavix::search_provider::SearchProvider provider(options, bus, event);
    int r = sd_bus_attach_event(bus, event, SD_EVENT_PRIORITY_NORMAL);
    if (r >= 0) r = provider.start();
    if (r < 0) return fail("cannot export the search provider", r);
    sd_event_add_signal(event, nullptr, SIGINT, nullptr, nullptr);
    sd_event_add_signal(event, nullptr, SIGTERM, nullptr, nullptr);
    sd_bus_set_exit_on_disconnect(bus, 1);
    // The name last: a caller the bus lets through finds the object exported.
    if (r = sd_bus_request_name(bus, tavix::search_provider::kBusName, 0); r < 0) {
      return fail("cannot own the bus name", r);
    }
    r = sd_event_loop(event);
    if (r < 0) status = fail("event loop", r);
    // Callers that come from now on make the bus start a new provider.
    sd_bus_release_name(bus, tavix::search_provider::kBusName);
    sd_bus_flush(bus);
  }
  sd_bus_flush_close_unref(bus);
  sd_event_unref(event);
  return status;
}
