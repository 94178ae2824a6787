#include "search_commands.h"

#include <termios.h>
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <future>
#include <iostream>
#include <optional>

#include <nlohmann/json.hpp>

#include "platform/json_value.h"
#include "tavix/client.h"

namespace tavix::tool {

namespace {

using nlohmann::json;

struct Identity {
  std::string client = "com.norvel.seekara";
  std::string agent = "seekara/1.0";
  int trigger = 21;  // "suggest_queries": what a search field sends per keystroke
};

// Takes the identity flags out of `args`; false on a malformed flag.
bool takeIdentity(std::vector<std::string>& args, Identity& identity) {
  std::vector<std::string> rest;
  for (std::size_t i = 0; i < args.size(); ++i) {
    const std::string& a = args[i];
    if ((a == "--client" || a == "--agent" || a == "--trigger") && i + 1 < args.size()) {
      const std::string& value = args[++i];
      if (a == "--client") identity.client = value;
      if (a == "--agent") identity.agent = value;
      if (a == "--trigger") {
        char* end = nullptr;
        identity.trigger = static_cast<int>(std::strtol(value.c_str(), &end, 10));
        if (value.empty() || *end) return false;
      }
    } else if (a == "--client" || a == "--agent" || a == "--trigger") {
      return false;
    } else {
      rest.push_back(a);
    }
  }
  args = std::move(rest);
  return true;
}

// How long the tool waits for any one answer.
constexpr int kCallTimeoutMs = 30000;

client::Client::Options optionsFor(const std::string& socketPath, const Identity& identity) {
  client::Client::Options options;
  options.socketPath = socketPath;
  options.configuration.set_identifier(identity.client);
  options.configuration.set_user_agent(identity.agent);
  options.reconnect = false;
  options.timeoutMs = kCallTimeoutMs;
  return options;
}

// What one keystroke brought back, as a person would want to see it.
struct Outcome {
  std::uint64_t queryId = 0;
  std::string input;
  double ms = 0;
  std::string source;  // "network", "query cache", "local completions", "none" or "error"
  std::string completion;
  std::vector<std::string> suggestions;
  std::vector<std::string> localSuggestions;
  std::optional<client::Error> error;
};

void readSuggestions(const std::string& data, Outcome& out) {
  // The server's answer, as the daemon passed it on: read with the same bounds as the daemon's.
  const auto parsed = platform::parseJson(data);
  const auto* list = parsed ? parsed->array() : nullptr;
  const auto* first = list && !list->empty() ? list->front().dictionary() : nullptr;
  if (!first) return;
  if (auto it = first->find("query"); it != first->end() && it->second.string()) out.completion = *it->second.string();
  const auto results = first->find("results");
  if (results == first->end() || !results->second.array()) return;
  for (const auto& result : *results->second.array()) {
    const auto* fields = result.dictionary();
    if (!fields) continue;
    if (auto title = fields->find("title"); title != fields->end() && title->second.string()) {
      out.suggestions.push_back(*title->second.string());
    }
  }
}

Outcome query(client::Client& client, std::uint64_t queryId, const std::string& input, int trigger) {
  proto::TVXRequest request;
  request.set_query_id(queryId);
  request.set_query_string(input);
  request.set_trigger_event(trigger);
  // Verbose replies carry the HTTP exchange, which tells a network answer from a cached one.
  request.set_verbose_reply(true);
  request.mutable_search();
  // The callback owns what it fills in: it runs on the client's thread, and libtavix calls it
  // exactly once, by the call's deadline at the latest.
  auto done = std::make_shared<std::promise<Outcome>>();
  auto future = done->get_future();
  const auto start = std::chrono::steady_clock::now();
  client.request(request, [done, start, input](std::uint64_t id, std::optional<proto::TVXReply> reply,
                                               std::optional<client::Error> error) {
    Outcome out;
    out.input = input;
    out.ms = std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
    out.queryId = id;
    out.error = std::move(error);
    if (reply) {
      readSuggestions(reply->data(), out);
      for (const auto& s : reply->local_suggestions()) out.localSuggestions.push_back(s);
      if (reply->has_http_response() && reply->http_response().status_code() != 0) {
        out.source = "network";
      } else if (!reply->data().empty()) {
        out.source = "query cache";
      } else if (!out.localSuggestions.empty()) {
        out.source = "local completions";
      }
    }
    if (out.source.empty()) out.source = out.error ? "error" : "none";
    done->set_value(std::move(out));
  });
  return future.get();
}

std::string jsonLine(const Outcome& o) {
  json line = {{"query_id", o.queryId},         {"input", o.input},
               {"source", o.source},            {"ms", std::round(o.ms * 1000) / 1000},
               {"completion", o.completion},    {"suggestions", o.suggestions},
               {"local_suggestions", o.localSuggestions}};
  if (o.error) line["error"] = {{"domain", o.error->domain}, {"code", o.error->code}, {"reason", o.error->reason}};
  return line.dump();
}

int usageError(const char* what) {
  std::fprintf(stderr, "tavix_tool: %s\n", what);
  return 2;
}

// One keystroke's view: the input line, where the answer came from and how long it took, then
// the suggestions.
void render(const Outcome& o, std::FILE* out) {
  std::fprintf(out, "> %s\n", o.input.c_str());
  std::fprintf(out, "  [%s, %.1f ms]", o.source.c_str(), o.ms);
  if (o.error) std::fprintf(out, " error %lld: %s", static_cast<long long>(o.error->code), o.error->reason.c_str());
  std::fputc('\n', out);
  for (const auto& s : o.localSuggestions) std::fprintf(out, "    * %s  (on this device)\n", s.c_str());
  for (const auto& s : o.suggestions) std::fprintf(out, "    - %s\n", s.c_str());
}

// The byte length of the UTF-8 character that begins with `lead`.
int utf8Length(unsigned char lead) {
  if (lead >= 0xF0) return 4;
  if (lead >= 0xE0) return 3;
  if (lead >= 0xC0) return 2;
  return 1;
}

class RawTerminal {
 public:
  RawTerminal() {
    if (tcgetattr(STDIN_FILENO, &saved_) != 0) return;
    termios raw = saved_;
    raw.c_lflag &= ~static_cast<tcflag_t>(ICANON | ECHO);
    raw.c_cc[VMIN] = 1;
    raw.c_cc[VTIME] = 0;
    active_ = tcsetattr(STDIN_FILENO, TCSANOW, &raw) == 0;
  }
  ~RawTerminal() {
    if (active_) tcsetattr(STDIN_FILENO, TCSANOW, &saved_);
  }
  bool active() const { return active_; }

 private:
  termios saved_{};
  bool active_ = false;
};

int typeOnTerminal(client::Client& client, const Identity& identity) {
  RawTerminal terminal;
  if (!terminal.active()) return usageError("cannot put the terminal in raw mode");
  std::string input;
  int pending = 0;  // bytes still to come of the character being typed
  std::uint64_t queryId = 0;
  std::printf("\033[H\033[2J> (type; Esc or Ctrl-D ends)\n");
  std::fflush(stdout);
  for (;;) {
    char c = 0;
    if (::read(STDIN_FILENO, &c, 1) != 1) break;
    if (c == 27 || c == 4 || c == 3) break;
    if (c == 127 || c == 8) {
      if (input.empty()) continue;
      // One UTF-8 character back.
      do input.pop_back();
      while (!input.empty() && (static_cast<unsigned char>(input.back()) & 0xC0) == 0x80);
    } else if (c == '\n' || c == '\r') {
      continue;
    } else {
      input.push_back(c);
      // The rest of a multi-byte character comes before we ask.
      if (pending > 0) --pending;
      else pending = utf8Length(static_cast<unsigned char>(c)) - 1;
      if (pending > 0) continue;
    }
    auto outcome = query(client, ++queryId, input, identity.trigger);
    std::printf("\033[H\033[2J");
    render(outcome, stdout);
    std::fflush(stdout);
  }
  std::printf("\n");
  return 0;
}

}  // namespace

int searchCommand(const std::string& socketPath, std::vector<std::string> args) {
  Identity identity;
  if (!takeIdentity(args, identity) || args.size() != 1) {
    return usageError("usage: search [--client ID] [--agent UA] [--trigger N] TEXT|-");
  }
  client::Client client(optionsFor(socketPath, identity));
  if (auto error = client.connect()) {
    std::fprintf(stderr, "tavix_tool: %s\n", error->describe().c_str());
    return 1;
  }
  int failures = 0;
  std::uint64_t queryId = 0;
  auto one = [&](const std::string& input) {
    auto outcome = query(client, ++queryId, input, identity.trigger);
    if (outcome.error) ++failures;
    std::printf("%s\n", jsonLine(outcome).c_str());
    std::fflush(stdout);
  };
  if (args[0] != "-") {
    one(args[0]);
  } else {
    std::string line;
    while (std::getline(std::cin, line)) one(line);
  }
  return failures == 0 ? 0 : 1;
}

int bagCommand(const std::string& socketPath, std::vector<std::string> args) {
  Identity identity;
  if (!takeIdentity(args, identity) || !args.empty()) return usageError("usage: bag [--client ID] [--agent UA]");
  client::Client client(optionsFor(socketPath, identity));
  auto done = std::make_shared<std::promise<int>>();
  auto result = done->get_future();
  client.bag([done](std::optional<proto::TVXBagData> bag, std::optional<client::Error> error) {
    if (error) std::fprintf(stderr, "tavix_tool: %s\n", error->describe().c_str());
    if (bag) {
      // Within the bounds, the document is shallow enough for the pretty printer's recursion.
      const std::string& text = bag->json();
      std::printf("%s\n", platform::isJsonWithinLimits(text) ? json::parse(text).dump(2).c_str() : text.c_str());
    }
    done->set_value(bag ? 0 : 1);
  });
  return result.get();
}

int sessionsCommand(const std::string& socketPath) {
  Identity identity;
  identity.client = "tavix_tool";
  identity.agent = "tavix_tool/1";
  client::Client client(optionsFor(socketPath, identity));
  proto::Envelope call;
  call.mutable_list_sessions();
  proto::Envelope reply;
  if (auto error = client.callSync(call, &reply)) {
    std::fprintf(stderr, "tavix_tool: %s\n", error->describe().c_str());
    return 1;
  }
  for (const auto& session : reply.list_sessions_reply().sessions()) std::printf("%s\n", session.c_str());
  return 0;
}

int interactiveCommand(const std::string& socketPath, std::vector<std::string> args) {
  Identity identity;
  if (!takeIdentity(args, identity)) return usageError("usage: type [--client ID] [--agent UA] [TEXT...]");
  client::Client client(optionsFor(socketPath, identity));
  if (auto error = client.connect()) {
    std::fprintf(stderr, "tavix_tool: %s\n", error->describe().c_str());
    return 1;
  }
  if (args.empty() && isatty(STDIN_FILENO) && isatty(STDOUT_FILENO)) return typeOnTerminal(client, identity);

  // No terminal: type each given text a character at a time and show every step.
  if (args.empty()) args = {"weather", "news"};
  std::uint64_t queryId = 0;
  int failures = 0;
  for (const auto& text : args) {
    std::printf("typing \"%s\"\n", text.c_str());
    std::string input;
    for (std::size_t i = 0; i < text.size(); ++i) {
      input.push_back(text[i]);
      // Whole characters only: wait for the continuation bytes.
      if (i + 1 < text.size() && (static_cast<unsigned char>(text[i + 1]) & 0xC0) == 0x80) continue;
      auto outcome = query(client, ++queryId, input, identity.trigger);
      if (outcome.error) ++failures;
      render(outcome, stdout);
    }
    std::printf("\n");
  }
  std::fflush(stdout);
  return failures == 0 ? 0 : 1;
}

}  // namespace tavix::tool
