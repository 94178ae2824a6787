// Round trip of an empty call through tavixd's socket (libtavix -> daemon -> libtavix), against
// the floor: a plain Unix-socket echo of the same number of bytes each way.
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <thread>
#include <vector>

#include "tavix/client.h"

namespace {

using Clock = std::chrono::steady_clock;

void reportLatencies(benchmark::State& state, std::vector<double>& micros) {
  if (micros.empty()) return;
  std::sort(micros.begin(), micros.end());
  state.counters["median_us"] = micros[micros.size() / 2];
  state.counters["p99_us"] = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
}

std::size_t frameSize(const tavix::proto::Envelope& e) { return 4 + e.ByteSizeLong(); }

tavix::proto::Envelope emptyCall() {
  tavix::proto::Envelope e;
  e.set_call_id(1);
  e.mutable_list_sessions();
  return e;
}

void BM_DaemonRoundTrip(benchmark::State& state) {
  char dir[] = "/tmp/tavix-bench-XXXXXX";
  if (!mkdtemp(dir)) {
    state.SkipWithError("mkdtemp");
    return;
  }
  const std::string root = dir;
  const std::string socket = root + "/socket";
  const pid_t pid = fork();
  if (pid == 0) {
    setenv("XDG_CACHE_HOME", (root + "/cache").c_str(), 1);
    setenv("XDG_CONFIG_HOME", (root + "/config").c_str(), 1);
    setenv("XDG_RUNTIME_DIR", root.c_str(), 1);
    execl(TAVIXD_BINARY, TAVIXD_BINARY, "--socket", socket.c_str(), "--log-level", "error",
          static_cast<char*>(nullptr));
    _exit(127);
  }
  const auto deadline = Clock::now() + std::chrono::seconds(5);
  while (!std::filesystem::exists(socket) && Clock::now() < deadline) std::this_thread::sleep_for(std::chrono::milliseconds(5));

  tavix::client::Client::Options options;
  options.socketPath = socket;
  options.configuration.set_identifier("bench");
  options.configuration.set_user_agent("bench/1");
  tavix::client::Client client(options);
  if (auto error = client.connect()) {
    state.SkipWithError(error->describe().c_str());
  } else {
    std::vector<double> micros;
    tavix::proto::Envelope reply;
    for (auto _ : state) {
      const auto start = Clock::now();
      auto error = client.callSync(emptyCall(), &reply);
      micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
      if (error && error->domain == tavix::client::kClientErrorDomain) {
        state.SkipWithError(error->describe().c_str());
        break;
      }
    }
    reportLatencies(state, micros);
    state.counters["request_bytes"] = static_cast<double>(frameSize(emptyCall()));
    state.counters["reply_bytes"] = static_cast<double>(frameSize(reply));
  }
  kill(pid, SIGTERM);
  waitpid(pid, nullptr, 0);
  std::filesystem::remove_all(root);
}
BENCHMARK(BM_DaemonRoundTrip)->UseRealTime()->Iterations(20000);

// The floor: the same bytes across a socket pair to a thread that sends them straight back.
void BM_PlainSocketEcho(benchmark::State& state) {
  int fds[2];
  socketpair(AF_UNIX, SOCK_STREAM, 0, fds);
  const std::size_t size = frameSize(emptyCall());
  std::thread echo([fd = fds[1], size] {
    std::vector<char> buf(size);
    for (;;) {
      std::size_t got = 0;
      while (got < size) {
        const ssize_t n = read(fd, buf.data() + got, size - got);
        if (n <= 0) return;
        got += static_cast<std::size_t>(n);
      }
      if (write(fd, buf.data(), size) != static_cast<ssize_t>(size)) return;
    }
  });
  std::vector<char> buf(size, 'x');
  std::vector<double> micros;
  for (auto _ : state) {
    const auto start = Clock::now();
    if (write(fds[0], buf.data(), size) != static_cast<ssize_t>(size)) break;
    std::size_t got = 0;
    while (got < size) {
      const ssize_t n = read(fds[0], buf.data() + got, size - got);
      if (n <= 0) break;
      got += static_cast<std::size_t>(n);
    }
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  reportLatencies(state, micros);
  close(fds[0]);
  echo.join();
  close(fds[1]);
}
BENCHMARK(BM_PlainSocketEcho)->UseRealTime()->Iterations(20000);

}  // namespace

BENCHMARK_MAIN();
