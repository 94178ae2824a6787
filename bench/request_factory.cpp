// Building one full search request: the context queue hop, every item and header, the sort and
// the percent-encoding. This runs on every keystroke of search-as-you-type.
#include <benchmark/benchmark.h>

#include "bagview/tvx_bag.h"
#include "context/location.h"
#include "network/request_factory.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/json_value.h"
#include "platform/notification_center.h"
#include "support/test_assembly.h"

namespace {

using namespace tavix;

void BM_SearchRequest(benchmark::State& state) {
  testing::TestAssembly f;
  auto& defaults = f.defaults;
  defaults->setObject("TVXLocale", "en_US");
  defaults->setObject("TVXPreferredLanguages", platform::PropertyValue::Array{"en-US", "fr-FR", "de-DE", "ja-JP"});
  defaults->setObject("TVXTimeZone", "America/Los_Angeles");
  defaults->setObject("TVXDebugParameters", "dbg=1&trace=on");
  defaults->setObject("TVXFixedLocation", platform::Dictionary{{"latitude", 37.33}, {"longitude", -122.03}, {"type", 1}});
  TVXRequestFactoryProviders providers;
  providers.locationManager = std::make_shared<DefaultsLocationManager>(*defaults, f.clock, f.pool);
  providers.appWhitelistSignature = [] { return std::optional<std::string>("c2lnbmF0dXJl"); };
  auto factory = TVXNetworkRequestFactory::create(f.requestFactoryEnvironment(), providers);

  auto raw = platform::parseJson(R"({"search_url":"https://search.example/search?v=2","request_timeout_s":3,
      "supported_geo_location_sources":"all","send_geo_environment_header":true})");
  auto bag = std::make_shared<const TVXBag>(*raw->dictionary(), "Seekara/1 (bench)");
  f.center->post("TVXBagChangeNotification", nullptr, {}, bagChangeUserInfo(*bag));
  factory->setSilhouetteTopics(R"({"sil":"s","pv":1,"all":{"a":0.5,"b":0.25}})");
  factory->setStoreFrontIdentifier("143441-1,29");

  TVXSearchRequest request;
  request.queryString = "weather in san francisco";
  request.triggerEvent = 21;
  request.scale = 2;
  request.keyboardInputMode = "en_US";
  request.l2ModelVersion = "12";
  request.l3ModelVersion = "4";
  request.queryItems = {{"client_item", "value with blanks"}};
  request.localSuggestions = {{"weather", "se", 0.9}, {"weather radar", "co", 0.4}};
  // A fix arrives from the first build; later builds reuse it, as during typing.
  factory->searchRequest(request, *bag, "8E1D3A43-5C2B-4A5F-9C0E-2B7F6A1D0C11");
  f.pool.drain();
  factory->flushContextAccessQueue();

  std::size_t bytes = 0;
  for (auto _ : state) {
    auto built = factory->searchRequest(request, *bag, "8E1D3A43-5C2B-4A5F-9C0E-2B7F6A1D0C11");
    bytes += built->url.size();
    benchmark::DoNotOptimize(built);
  }
  state.counters["url_bytes"] = benchmark::Counter(static_cast<double>(bytes) / static_cast<double>(state.iterations()));
  factory.reset();
  f.pool.drain();
}
BENCHMARK(BM_SearchRequest)->Repetitions(5)->ReportAggregatesOnly(true);

}  // namespace

BENCHMARK_MAIN();
