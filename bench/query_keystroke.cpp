// Keystroke round trips through the real daemon (libtavix -> tavixd -> devserver -> back), each
// against its floor measured in the same run:
//   - a network search, against the same search sent straight to the devserver over HTTP;
//   - a query-cache hit, against an empty call through the daemon's socket;
//   - 50 clients typing at once: throughput, p99 and lost replies.
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <future>
#include <thread>
#include <vector>

#include "devserver/devserver.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "tavix/client.h"

namespace {

using Clock = std::chrono::steady_clock;
namespace client = tavix::client;

void reportLatencies(benchmark::State& state, std::vector<double>& micros) {
  if (micros.empty()) return;
  std::sort(micros.begin(), micros.end());
  state.counters["median_us"] = micros[micros.size() / 2];
  state.counters["p99_us"] = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
}

// A devserver and a daemon that asks it for its bag, started once for every benchmark.
struct Environment {
  tavix::devserver::DevServer server;
  std::string root;
  std::string socket;
  pid_t daemon = -1;
  std::string error;

  Environment() {
    char dir[] = "/tmp/tavix-bench-XXXXXX";
    if (!mkdtemp(dir)) {
      error = "mkdtemp";
      return;
    }
    root = dir;
    socket = root + "/socket";
    if (!server.start({}, &error)) return;
    {
      tavix::platform::UserDefaults defaults(root + "/config/com.norvel.tavixd", "com.norvel.tavixd");
      defaults.setObject("TVXBagURL", server.baseURL() + "/bag");
    }
    daemon = fork();
    if (daemon == 0) {
      setenv("XDG_CACHE_HOME", (root + "/cache").c_str(), 1);
      setenv("XDG_CONFIG_HOME", (root + "/config").c_str(), 1);
      setenv("XDG_RUNTIME_DIR", root.c_str(), 1);
      execl(TAVIXD_BINARY, TAVIXD_BINARY, "--socket", socket.c_str(), "--log-level", "error",
            static_cast<char*>(nullptr));
      _exit(127);
    }
    const auto deadline = Clock::now() + std::chrono::seconds(5);
    while (!std::filesystem::exists(socket) && Clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
  }
  ~Environment() {
    if (daemon > 0) {
      kill(daemon, SIGTERM);
      waitpid(daemon, nullptr, 0);
    }
    server.stop();
    if (!root.empty()) std::filesystem::remove_all(root);
  }

  client::Client::Options options() const {
    client::Client::Options o;
    o.socketPath = socket;
    o.configuration.set_identifier("com.norvel.seekara");
    o.configuration.set_user_agent("seekara/1.0");
    return o;
  }
};

Environment& environment() {
  static Environment env;
  return env;
}

tavix::proto::TVXRequest searchRequest(std::uint64_t id, const std::string& input) {
  tavix::proto::TVXRequest r;
  r.set_query_id(id);
  r.set_query_string(input);
  r.set_trigger_event(21);
  r.mutable_search();
  return r;
}

// One search; answers whether a reply with data came back.
bool search(client::Client& c, std::uint64_t id, const std::string& input) {
  std::promise<bool> done;
  c.request(searchRequest(id, input), [&](std::uint64_t, std::optional<tavix::proto::TVXReply> reply,
                                          std::optional<client::Error> error) {
    done.set_value(!error && reply && !reply->data().empty());
  });
  auto f = done.get_future();
  return f.wait_for(std::chrono::seconds(10)) == std::future_status::ready && f.get();
}

// Inputs no earlier reply can answer: never a prefix of another, never in the corpus.
std::string uniqueInput(std::uint64_t n) {
  char text[32];
  std::snprintf(text, sizeof text, "zq%010llu", static_cast<unsigned long long>(n));
  return text;
}

std::atomic<std::uint64_t> nextInput{1};

client::Client* connectedClient(benchmark::State& state, std::unique_ptr<client::Client>& holder) {
  auto& env = environment();
  if (!env.error.empty()) {
    state.SkipWithError(env.error.c_str());
    return nullptr;
  }
  holder = std::make_unique<client::Client>(env.options());
  if (auto error = holder->connect()) {
    state.SkipWithError(error->describe().c_str());
    return nullptr;
  }
  // The first search waits for the bag; keep it out of the figures.
  search(*holder, 0, "warm up");
  return holder.get();
}

void BM_KeystrokeThroughDaemon(benchmark::State& state) {
  std::unique_ptr<client::Client> holder;
  auto* c = connectedClient(state, holder);
  if (!c) return;
  std::vector<double> micros;
  for (auto _ : state) {
    const auto n = nextInput++;
    const auto start = Clock::now();
    if (!search(*c, n, uniqueInput(n))) {
      state.SkipWithError("a search failed");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  reportLatencies(state, micros);
}
BENCHMARK(BM_KeystrokeThroughDaemon)->UseRealTime()->Iterations(3000);

// The floor of the line above: the same search straight to the devserver through the same HTTP
// stack the daemon uses.
void BM_KeystrokeDirectHTTP(benchmark::State& state) {
  auto& env = environment();
  tavix::platform::DispatchPool pool(1);
  tavix::platform::http::URLSessionConfiguration config;
  config.delegatePool = &pool;
  config.memoryCacheCapacity = 0;
  tavix::platform::http::URLSession session(config);
  std::vector<double> micros;
  for (auto _ : state) {
    tavix::platform::http::URLRequest request;
    request.url = env.server.baseURL() + "/search?q=" + uniqueInput(nextInput++);
    const auto start = Clock::now();
    std::promise<long> done;
    session.dataTask(request, [&](std::string, auto response, auto) { done.set_value(response ? response->statusCode : 0); })
        ->resume();
    if (done.get_future().get() != 200) {
      state.SkipWithError("request failed");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  reportLatencies(state, micros);
}
BENCHMARK(BM_KeystrokeDirectHTTP)->UseRealTime()->Iterations(3000);

void BM_QueryCacheHitThroughDaemon(benchmark::State& state) {
  std::unique_ptr<client::Client> holder;
  auto* c = connectedClient(state, holder);
  if (!c) return;
  search(*c, 1, "weather");  // fills the cache; every later "weath" is answered from it
  std::vector<double> micros;
  for (auto _ : state) {
    const auto start = Clock::now();
    if (!search(*c, 2, "weath")) {
      state.SkipWithError("a search failed");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  reportLatencies(state, micros);
}
BENCHMARK(BM_QueryCacheHitThroughDaemon)->UseRealTime()->Iterations(5000);

// The floor of the line above: an empty call through the same socket.
void BM_EmptyCallThroughDaemon(benchmark::State& state) {
  std::unique_ptr<client::Client> holder;
  auto* c = connectedClient(state, holder);
  if (!c) return;
  tavix::proto::Envelope call;
  call.mutable_list_sessions();
  tavix::proto::Envelope reply;
  std::vector<double> micros;
  for (auto _ : state) {
    const auto start = Clock::now();
    if (auto error = c->callSync(call, &reply)) {
      state.SkipWithError(error->describe().c_str());
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  reportLatencies(state, micros);
}
BENCHMARK(BM_EmptyCallThroughDaemon)->UseRealTime()->Iterations(5000);

// 50 clients, each on its own connection, typing 40 keystrokes as fast as replies come back.
void BM_FiftyClientsTyping(benchmark::State& state) {
  constexpr int kClients = 50;
  constexpr int kKeystrokes = 40;
  std::vector<std::unique_ptr<client::Client>> clients(kClients);
  for (auto& holder : clients) {
    if (!connectedClient(state, holder)) return;
  }
  std::vector<double> micros;
  std::mutex lock;
  std::atomic<int> lost{0};
  double seconds = 0;
  for (auto _ : state) {
    const auto start = Clock::now();
    std::vector<std::thread> typists;
    for (int i = 0; i < kClients; ++i) {
      typists.emplace_back([&, i] {
        std::vector<double> mine;
        for (int k = 0; k < kKeystrokes; ++k) {
          const auto n = nextInput++;
          const auto t = Clock::now();
          if (!search(*clients[i], n, uniqueInput(n))) ++lost;
          mine.push_back(std::chrono::duration<double, std::micro>(Clock::now() - t).count());
        }
        std::lock_guard guard(lock);
        micros.insert(micros.end(), mine.begin(), mine.end());
      });
    }
    for (auto& t : typists) t.join();
    seconds += std::chrono::duration<double>(Clock::now() - start).count();
  }
  reportLatencies(state, micros);
  state.counters["keystrokes_per_s"] = static_cast<double>(micros.size()) / seconds;
  state.counters["lost_replies"] = lost.load();
}
BENCHMARK(BM_FiftyClientsTyping)->UseRealTime()->Iterations(3);

}  // namespace

BENCHMARK_MAIN();
