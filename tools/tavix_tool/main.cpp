// tavix_tool: the command-line companion of tavixd. Counters and defaults are read from disk and
// work with the daemon stopped; everything else talks to the daemon through libtavix.
#include <cstdio>
#include <cstdlib>
#include <unistd.h>
#include <map>
#include <string>
#include <vector>

#include "platform/counters.h"
#include "platform/defaults.h"
#include "platform/files.h"
#include "platform/property_value.h"
#include "search_commands.h"
#include "tavix/client.h"
#include "flush_commands.h"
#include "resource_commands.h"

namespace {

constexpr const char* kDomain = "com.norvel.tavixd";

// On --help the text is the answer (stdout, success); after a wrong command it is the error.
int usage(std::FILE* out = stderr, int status = 2) {
  std::fputs(
      "usage: tavix_tool [--socket PATH] COMMAND\n"
      "\n"
      "commands:\n"
      "  counters                                 print the daemon's counters\n"
      "  defaults read [--domain D] [KEY]         print one default, or the whole domain\n"
      "  defaults write [--domain D] KEY [--int|--float|--bool|--string] VALUE\n"
      "  defaults delete [--domain D] KEY\n"
      "  notify NAME                              deliver the launch event NAME to the daemon\n"
      "  activity run NAME                        run the background activity NAME now\n"
      "  search [--client ID] [--agent UA] [--trigger N] TEXT|-\n"
      "                                           one JSON reply a line; - reads one input a line\n"
      "  bag [--client ID] [--agent UA]           print the client's bag\n"
      "  sessions                                 list the known client states\n"
      "  resources                                each resource file: URL, version, size, age,\n"
      "                                           and the progress of a download in flight\n"
      "  resources cat ID                         print the file of resource ID\n"
      "  type [--client ID] [--agent UA] [TEXT...]\n"
      "                                           type on a terminal and see each keystroke's\n"
      "                                           suggestions; without one, type TEXT and print\n"
      "  (no command, on a terminal)              the same as type\n",
      out);
  std::fputs(tavix::tool::flushCommandsUsage(), out);
  std::fputs(
      "\n"
      "counters and defaults work with the daemon stopped.\n",
      out);
  return status;
}

int counters(const tavix::platform::Paths& paths) {
  std::map<std::string, std::int64_t> values;
  const auto file = paths.cachesFolder(kDomain) / "counters.plist";
  if (auto ec = tavix::platform::CounterStore::read(file, &values)) {
    std::fprintf(stderr, "tavix_tool: cannot read %s: %s\n", file.c_str(), ec.message().c_str());
    return 1;
  }
  for (const auto& [key, value] : values) std::printf("%s = %lld\n", key.c_str(), static_cast<long long>(value));
  return 0;
}

std::string describe(const tavix::platform::PropertyValue& value) {
  if (auto b = value.boolean()) return *b ? "true" : "false";
  if (auto i = value.integer()) return std::to_string(*i);
  if (auto d = value.real()) return std::to_string(*d);
  if (auto s = value.string()) return *s;
  return tavix::platform::toXmlPlist(value);
}

int defaults(const tavix::platform::Paths& paths, std::vector<std::string> args) {
  if (args.empty()) return usage();
  const std::string verb = args.front();
  args.erase(args.begin());
  std::string domain = kDomain;
  if (args.size() >= 2 && args[0] == "--domain") {
    domain = args[1];
    args.erase(args.begin(), args.begin() + 2);
  }
  tavix::platform::UserDefaults store(paths.configFolder(kDomain), domain);
  if (verb == "read") {
    if (args.empty()) {
      for (const auto& [key, value] : store.persistentDomain()) std::printf("%s = %s\n", key.c_str(), describe(value).c_str());
      return 0;
    }
    auto value = store.objectForKey(args[0]);
    if (!value) {
      std::fprintf(stderr, "tavix_tool: the domain %s has no key %s\n", domain.c_str(), args[0].c_str());
      return 1;
    }
    std::printf("%s\n", describe(*value).c_str());
    return 0;
  }
  if (verb == "delete") {
    if (args.size() != 1) return usage();
    if (!store.objectForKey(args[0])) {
      std::fprintf(stderr, "tavix_tool: the domain %s has no key %s\n", domain.c_str(), args[0].c_str());
      return 1;
    }
    return store.removeObject(args[0]) ? 0 : 1;
  }
  if (verb == "write") {
    if (args.size() != 2 && args.size() != 3) return usage();
    const std::string& key = args[0];
    const std::string type = args.size() == 3 ? args[1] : "--string";
    const std::string& text = args.back();
    tavix::platform::PropertyValue value;
    char* end = nullptr;
    if (type == "--string") {
      value = tavix::platform::PropertyValue(text);
    } else if (type == "--int") {
      const long long n = std::strtoll(text.c_str(), &end, 10);
      if (text.empty() || *end) return usage();
      value = tavix::platform::PropertyValue(static_cast<std::int64_t>(n));
    } else if (type == "--float") {
      const double d = std::strtod(text.c_str(), &end);
      if (text.empty() || *end) return usage();
      value = tavix::platform::PropertyValue(d);
    } else if (type == "--bool") {
      if (text != "true" && text != "false" && text != "YES" && text != "NO" && text != "1" && text != "0") return usage();
      value = tavix::platform::PropertyValue(text == "true" || text == "YES" || text == "1");
    } else {
      return usage();
    }
    if (!store.setObject(key, value)) {
      std::fprintf(stderr, "tavix_tool: cannot write %s\n", store.filePath().c_str());
      return 1;
    }
    return 0;
  }
  return usage();
}

int report(const std::optional<tavix::client::Error>& error) {
  if (!error) return 0;
  std::fprintf(stderr, "tavix_tool: %s\n", error->describe().c_str());
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  tavix::client::Client::Options options;
  if (args.size() >= 2 && args[0] == "--socket") {
    options.socketPath = args[1];
    args.erase(args.begin(), args.begin() + 2);
  }
  if (args.empty() && isatty(STDIN_FILENO) && isatty(STDOUT_FILENO)) {
    return tavix::tool::interactiveCommand(options.socketPath, {});
  }
  if (!args.empty() && (args[0] == "--help" || args[0] == "-h")) return usage(stdout, 0);
  if (args.empty()) return usage();
  const auto paths = tavix::platform::Paths::fromEnvironment();
  const std::string command = args[0];
  args.erase(args.begin());

  if (command == "counters") return args.empty() ? counters(paths) : usage();
  if (command == "defaults") return defaults(paths, args);
  if (command == "search") return tavix::tool::searchCommand(options.socketPath, args);
  if (command == "bag") return tavix::tool::bagCommand(options.socketPath, args);
  if (command == "sessions") return args.empty() ? tavix::tool::sessionsCommand(options.socketPath) : usage();
  if (command == "type") return tavix::tool::interactiveCommand(options.socketPath, args);

  options.configuration.set_identifier("tavix_tool");
  options.configuration.set_user_agent("tavix_tool/1");
  options.reconnect = false;
  tavix::client::Client client(options);
  if (command == "notify" && args.size() == 1) return report(client.notifySync(args[0]));
  if (command == "activity" && args.size() == 2 && args[0] == "run") return report(client.runActivitySync(args[1]));
  if (command == "resources") {
    const int status = tavix::tool::resourcesCommand(client, args);
    return status == 2 ? usage() : status;
  }
  if (tavix::tool::isFlushCommand(command)) {
    const int status = tavix::tool::runFlushCommand(client, command, args);
    return status == 2 ? usage() : status;
  }
  return usage();
}
