// One GET round trip through a URL session to the devserver on loopback, completion included.
#include <benchmark/benchmark.h>

#include <future>

#include "devserver/devserver.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"

namespace {

using namespace tavix::platform;
using namespace tavix::platform::http;

void roundTrip(benchmark::State& state, const std::string& path, std::size_t cacheBytes,
               const char* acceptEncoding = nullptr) {
  tavix::devserver::DevServer server;
  if (!server.start({}, nullptr)) {
    state.SkipWithError("devserver did not start");
    return;
  }
  DispatchPool pool(1);
  URLSessionConfiguration config;
  config.delegatePool = &pool;
  config.memoryCacheCapacity = cacheBytes;
  URLSession session(config);
  URLRequest request;
  request.url = server.baseURL() + path;
  if (acceptEncoding) request.headers.set("Accept-Encoding", acceptEncoding);
  for (auto _ : state) {
    std::promise<long> done;
    session.dataTask(request, [&](std::string, auto response, auto) { done.set_value(response ? response->statusCode : 0); })
        ->resume();
    if (done.get_future().get() != 200) state.SkipWithError("request failed");
  }
}

void BM_SearchRoundTrip(benchmark::State& state) { roundTrip(state, "/search?q=wea", 0); }
// The devserver compresses for clients that accept it; this one isolates the transport.
void BM_SearchRoundTripUncompressed(benchmark::State& state) { roundTrip(state, "/search?q=wea", 0, "identity"); }
void BM_CachedResourceHit(benchmark::State& state) { roundTrip(state, "/resources/hints", 4 << 20); }

BENCHMARK(BM_SearchRoundTrip)->UseRealTime();
BENCHMARK(BM_SearchRoundTripUncompressed)->UseRealTime();
BENCHMARK(BM_CachedResourceHit)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
