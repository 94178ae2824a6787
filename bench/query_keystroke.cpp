// Keystroke round trips through the real daemon (libtavix -> tavixd -> devserver -> back), each
// against its floor measured in the same run:
//   - a network search, against the same search sent straight to the devserver over HTTP;
//   - a query-cache hit, against an empty call through the daemon's socket;
//   - 50 clients typing at once: throughput, p99 and lost replies, against the same 50 clients'
//     searches sent straight to the devserver through the same HTTP stack. Both report what the
//     load costs the devserver (it runs in a process of its own so that its share can be read
//     from /proc): its CPU, its threads, its accept queue and the connections opened.
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <benchmark/benchmark.h>
#include <nlohmann/json.hpp>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <mutex>
#include <sstream>
#include <thread>
#include <vector>

#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url.h"
#include "platform/http/url_session.h"
#include "support/daemon_process.h"
#include "support/devserver_control.h"
#include "support/devserver_process.h"
#include "support/temp_home.h"
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
  tavix::testing::DevServerProcess server{TAVIX_DEVSERVER_BINARY, {"--max-lifetime", "3600"}};
  tavix::testing::TempHome home;
  std::string socket = (home.runtime() / "socket").string();
  std::unique_ptr<tavix::testing::DaemonProcess> daemon;
  std::string error;

  Environment() {
    if (server.base.empty()) {
      error = "devserver: " + server.firstLine;
      return;
    }
    {
      tavix::platform::UserDefaults defaults(home.config() / "com.norvel.tavixd", "com.norvel.tavixd");
      defaults.setObject("TVXBagURL", server.base + "/bag");
    }
    // Its log (50 connections from one process are worth a line each) goes to a file in the home.
    daemon = std::make_unique<tavix::testing::DaemonProcess>(
        TAVIXD_BINARY, home, std::vector<std::string>{"--socket", socket, "--log-level", "error"});
    const auto deadline = Clock::now() + std::chrono::seconds(5);
    while (!std::filesystem::exists(socket) && Clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
  }
  ~Environment() {
    if (daemon) daemon->stop();
    if (server.pid > 0) kill(server.pid, SIGTERM);
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

// A search as the daemon sends it, taken from the devserver's record of one: the direct baselines
// send the same query items and headers with their own input, so that the devserver does the
// same work per search on both sides of a ratio.
class DirectSearch {
 public:
  static const DirectSearch& get();
  tavix::platform::http::URLRequest request(const std::string& input) const {
    tavix::platform::http::URLRequest r;
    r.url = environment().server.base + "/search?q=" + tavix::platform::http::percentEncode(input) + items_;
    for (const auto& [name, value] : headers_) r.headers.set(name, value);
    return r;
  }
  bool valid() const { return valid_; }

 private:
  std::string items_;  // "&name=value…", every item but q
  std::vector<std::pair<std::string, std::string>> headers_;
  bool valid_ = false;
};

// The body of the devserver's answer to one of its control routes.
std::string devserverControl(const std::string& path, const std::string& method = "GET") {
  static tavix::platform::DispatchPool pool(1);
  static tavix::platform::http::URLSession session([] {
    tavix::platform::http::URLSessionConfiguration c;
    c.delegatePool = &pool;
    return c;
  }());
  return tavix::testing::devserverCall(session, environment().server.base, path, method);
}

// The devserver keeps a record of every request; cleared between iterations so that what it
// costs stays the same from the first iteration to the last.
void clearDevserverRecord() { devserverControl("/_reset", "POST"); }

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

const DirectSearch& DirectSearch::get() {
  static const DirectSearch direct = [] {
    DirectSearch d;
    auto& env = environment();
    if (!env.error.empty()) return d;
    clearDevserverRecord();
    client::Client c(env.options());
    if (c.connect() || !search(c, 0, uniqueInput(nextInput++))) return d;
    const auto recorded = nlohmann::json::parse(devserverControl("/_recorded"), nullptr, false);
    if (!recorded.is_array()) return d;
    for (const auto& entry : recorded) {
      if (entry.value("path", "") != "/search") continue;
      for (const auto& [name, value] : entry["query"].items()) {
        if (name != "q") d.items_ += "&" + tavix::platform::http::percentEncode(name) + "=" +
                                     tavix::platform::http::percentEncode(value.get<std::string>());
      }
      for (const auto& [name, value] : entry["headers"].items()) {
        // What the HTTP stack writes itself.
        if (name == "host" || name == "accept-encoding" || name == "connection" || name == "content-length") continue;
        d.headers_.emplace_back(name, value.get<std::string>());
      }
      d.valid_ = true;
      break;  // the record was cleared just before: this is the search made above
    }
    return d;
  }();
  return direct;
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

// The floor of the line above: the same search, query items and headers as the daemon sends them,
// straight to the devserver through the same HTTP stack.
void BM_KeystrokeDirectHTTP(benchmark::State& state) {
  tavix::platform::DispatchPool pool(1);
  tavix::platform::http::URLSessionConfiguration config;
  config.delegatePool = &pool;
  config.memoryCacheCapacity = 0;
  tavix::platform::http::URLSession session(config);
  const auto& direct = DirectSearch::get();
  if (!direct.valid()) {
    state.SkipWithError("no search of the daemon's to copy");
    return;
  }
  std::vector<double> micros;
  for (auto _ : state) {
    const auto request = direct.request(uniqueInput(nextInput++));
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

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

// utime + stime of a process, in seconds.
double cpuSeconds(pid_t pid) {
  const std::string stat = readFile("/proc/" + std::to_string(pid) + "/stat");
  const auto close = stat.rfind(')');
  if (close == std::string::npos) return 0;
  std::istringstream fields(stat.substr(close + 2));
  std::string field;
  double ticks = 0;
  // Fields 14 and 15 of stat(5); the stream starts at field 3.
  for (int i = 3; i <= 15 && fields >> field; ++i) {
    if (i >= 14) ticks += std::stod(field);
  }
  return ticks / static_cast<double>(sysconf(_SC_CLK_TCK));
}

// Busy and total jiffies of the whole machine, from the first line of /proc/stat.
std::pair<double, double> machineJiffies() {
  std::istringstream line(readFile("/proc/stat"));
  std::string cpu;
  line >> cpu;
  double total = 0, idle = 0, value;
  for (int i = 0; i < 8 && line >> value; ++i) {
    total += value;
    if (i == 3 || i == 4) idle += value;  // idle, iowait
  }
  return {total - idle, total};
}

// A counter of the network namespace from /proc/net/snmp or /proc/net/netstat ("Tcp", "ActiveOpens").
long netCounter(const std::string& file, const std::string& group, const std::string& name) {
  std::istringstream in(readFile(file));
  std::string header, values;
  while (std::getline(in, header) && std::getline(in, values)) {
    if (header.rfind(group + ":", 0) != 0) continue;
    std::istringstream names(header), numbers(values);
    std::string n, v;
    while (names >> n && numbers >> v) {
      if (n == name) return std::stol(v);
    }
  }
  return 0;
}

// Entries waiting in the accept queue of the listener on 127.0.0.1:`port` (rx_queue of a
// listening socket in /proc/net/tcp), or -1 when it is not found.
long acceptQueue(int port) {
  char local[32];
  std::snprintf(local, sizeof local, "0100007F:%04X", port);
  std::istringstream in(readFile("/proc/net/tcp"));
  std::string line;
  std::getline(in, line);
  while (std::getline(in, line)) {
    std::istringstream f(line);
    std::string slot, localAddress, remote, state, queues;
    f >> slot >> localAddress >> remote >> state >> queues;
    if (localAddress == local && state == "0A") return std::stol(queues.substr(queues.find(':') + 1), nullptr, 16);
  }
  return -1;
}

struct ThreadStates {
  int threads = 0;
  int running = 0;    // state R: on a core or waiting for one
  int onSockets = 0;  // blocked in select or poll: cpp-httplib's listener and its threads that hold a connection
};

ThreadStates threadStates(pid_t pid) {
  ThreadStates states;
  std::error_code ec;
  for (const auto& entry : std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task", ec)) {
    const std::string stat = readFile(entry.path() / "stat");
    const auto close = stat.rfind(')');
    ++states.threads;
    if (close != std::string::npos && close + 2 < stat.size() && stat[close + 2] == 'R') ++states.running;
    // select, poll, pselect6, ppoll on x86-64; an idle pool thread waits on its condition variable (futex).
    const long call = std::atol(readFile(entry.path() / "syscall").c_str());
    if (call == 23 || call == 7 || call == 270 || call == 271) ++states.onSockets;
  }
  return states;
}

// What a load costs the devserver (and the daemon, when one is in the path), read from /proc
// before, during (every 50 ms, on a thread of its own) and after the load. The counters of the
// network namespace count every process in it: run nothing else meanwhile.
class LoadProbe {
 public:
  LoadProbe(pid_t server, int serverPort, pid_t daemon)
      : server_(server), port_(serverPort), daemon_(daemon), started_(Clock::now()),
        serverCpu_(cpuSeconds(server)), daemonCpu_(daemon > 0 ? cpuSeconds(daemon) : 0), machine_(machineJiffies()),
        opens_(netCounter("/proc/net/snmp", "Tcp", "ActiveOpens")),
        overflows_(netCounter("/proc/net/netstat", "TcpExt", "ListenOverflows")),
        sampler_([this] { sample(); }) {}

  void report(benchmark::State& state, std::size_t requests) {
    stop_ = true;
    sampler_.join();
    const double wall = std::chrono::duration<double>(Clock::now() - started_).count();
    const auto machine = machineJiffies();
    const double serverCpu = cpuSeconds(server_) - serverCpu_;
    state.counters["server_cpu_cores"] = serverCpu / wall;
    state.counters["server_cpu_us_per_search"] = serverCpu * 1e6 / static_cast<double>(requests);
    if (daemon_ > 0) {
      const double daemonCpu = cpuSeconds(daemon_) - daemonCpu_;
      state.counters["daemon_cpu_cores"] = daemonCpu / wall;
      state.counters["daemon_cpu_us_per_search"] = daemonCpu * 1e6 / static_cast<double>(requests);
    }
    state.counters["machine_busy_cores"] =
        (machine.first - machine_.first) / (machine.second - machine_.second) * std::thread::hardware_concurrency();
    state.counters["server_threads"] = maxThreads_;
    state.counters["server_running_mean"] = samples_ ? runningSum_ / samples_ : 0;
    state.counters["server_running_max"] = maxRunning_;
    state.counters["server_on_sockets_max"] = maxOnSockets_;
    state.counters["accept_queue_max"] = maxAcceptQueue_;
    state.counters["listen_overflows"] = netCounter("/proc/net/netstat", "TcpExt", "ListenOverflows") - overflows_;
    state.counters["tcp_connects"] = netCounter("/proc/net/snmp", "Tcp", "ActiveOpens") - opens_;
  }

 private:
  void sample() {
    while (!stop_) {
      const auto states = threadStates(server_);
      maxThreads_ = std::max(maxThreads_, states.threads);
      maxRunning_ = std::max(maxRunning_, states.running);
      maxOnSockets_ = std::max(maxOnSockets_, states.onSockets);
      runningSum_ += states.running;
      ++samples_;
      maxAcceptQueue_ = std::max(maxAcceptQueue_, acceptQueue(port_));
      // The sampling period: often enough to see the load, rarely enough not to add to it.
      std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
  }

  pid_t server_;
  int port_;
  pid_t daemon_;
  Clock::time_point started_;
  double serverCpu_, daemonCpu_;
  std::pair<double, double> machine_;
  long opens_, overflows_;
  std::atomic<bool> stop_{false};
  int maxThreads_ = 0, maxRunning_ = 0, maxOnSockets_ = 0, samples_ = 0;
  double runningSum_ = 0;
  long maxAcceptQueue_ = 0;
  std::thread sampler_;  // last: starts once every field above is set
};

int portOf(const std::string& base) { return std::atoi(base.c_str() + base.rfind(':') + 1); }

constexpr int kClients = 50;
constexpr int kKeystrokes = 40;

// 50 typists, each typing 40 keystrokes as fast as replies come back through `search`, once per
// iteration; reports p99, throughput, lost replies and what the load cost the devserver.
void typeConcurrently(benchmark::State& state, pid_t daemon,
                      const std::function<bool(int client, std::uint64_t n)>& search) {
  auto& env = environment();
  std::vector<double> micros;
  std::mutex lock;
  std::atomic<int> lost{0};
  double seconds = 0;
  LoadProbe probe(env.server.pid, portOf(env.server.base), daemon);
  for (auto _ : state) {
    state.PauseTiming();
    clearDevserverRecord();
    state.ResumeTiming();
    const auto start = Clock::now();
    std::vector<std::thread> typists;
    for (int i = 0; i < kClients; ++i) {
      typists.emplace_back([&, i] {
        std::vector<double> mine;
        for (int k = 0; k < kKeystrokes; ++k) {
          const auto n = nextInput++;
          const auto t = Clock::now();
          if (!search(i, n)) ++lost;
          mine.push_back(std::chrono::duration<double, std::micro>(Clock::now() - t).count());
        }
        std::lock_guard guard(lock);
        micros.insert(micros.end(), mine.begin(), mine.end());
      });
    }
    for (auto& t : typists) t.join();
    seconds += std::chrono::duration<double>(Clock::now() - start).count();
  }
  probe.report(state, micros.size());
  reportLatencies(state, micros);
  state.counters["keystrokes_per_s"] = static_cast<double>(micros.size()) / seconds;
  state.counters["lost_replies"] = lost.load();
}

// 50 clients, each on its own connection to the daemon.
void BM_FiftyClientsTyping(benchmark::State& state) {
  std::vector<std::unique_ptr<client::Client>> clients(kClients);
  for (auto& holder : clients) {
    if (!connectedClient(state, holder)) return;
  }
  typeConcurrently(state, environment().daemon->pid(),
                   [&](int i, std::uint64_t n) { return search(*clients[i], n, uniqueInput(n)); });
}
BENCHMARK(BM_FiftyClientsTyping)->UseRealTime()->Iterations(10);

// The floor of the line above: the same 50 typists' searches, as the daemon sends them, straight to
// the devserver through one session configured as the daemon's own (one transfer thread, connections kept 10 s,
// multiplexing where the server offers it), as the daemon sends every client's searches.
void BM_FiftyClientsDirectHTTP(benchmark::State& state) {
  auto& env = environment();
  if (!env.error.empty()) {
    state.SkipWithError(env.error.c_str());
    return;
  }
  tavix::platform::DispatchPool pool(1);
  tavix::platform::http::URLSessionConfiguration config;
  config.delegatePool = &pool;
  config.connectionIdleTimeout = std::chrono::seconds(10);
  config.multiplexing = true;
  config.requestTimeoutIsDeadline = true;
  tavix::platform::http::URLSession session(config);
  const auto& direct = DirectSearch::get();
  if (!direct.valid()) {
    state.SkipWithError("no search of the daemon's to copy");
    return;
  }
  typeConcurrently(state, -1, [&](int, std::uint64_t n) {
    const auto request = direct.request(uniqueInput(n));
    std::promise<long> done;
    session.dataTask(request, [&](std::string, auto response, auto) { done.set_value(response ? response->statusCode : 0); })
        ->resume();
    auto f = done.get_future();
    return f.wait_for(std::chrono::seconds(10)) == std::future_status::ready && f.get() == 200;
  });
}
BENCHMARK(BM_FiftyClientsDirectHTTP)->UseRealTime()->Iterations(10);

}  // namespace

BENCHMARK_MAIN();
