#include "network/request_factory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <map>

#include "bagview/tvx_bag.h"
#include "context/location.h"
#include "context/motion.h"
#include "platform/http/url.h"
#include "network/url_request_builder.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/json_value.h"
#include "platform/notification_center.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

using platform::Dictionary;
using platform::PropertyValue;

// The location service has no Linux counterpart; this one is driven by the test.
class FakeLocationManager final : public LocationManager {
 public:
  void startUpdatingLocation(std::weak_ptr<LocationManagerDelegate> d) override {
    ++starts;
    std::lock_guard<std::mutex> hold(lock);
    delegate = d;
  }
  void stopUpdatingLocation() override { ++stops; }
  int authorizationStatus() const override { return status; }
  int newsAuthorizationStatus() const override { return TVXLocationAuthorizationDenied; }
  bool locationServicesEnabled() const override { return true; }
  std::optional<std::string> mapsEnvironment() const override { return "prod"; }
  std::optional<std::string> getMapsClientMetadata() const override { return "bWV0YQ=="; }
  std::optional<std::string> getDeviceCountryCode() const override { return "FR"; }
  std::optional<TVXMapsUserSession> getMapsUserSessionEntityAndReset(bool reset) override {
    if (reset) ++sessionResets;
    return TVXMapsUserSession{"S1", 4, 2.5};
  }

  void deliver(const TVXLocation& fix) {
    std::shared_ptr<LocationManagerDelegate> d;
    {
      std::lock_guard<std::mutex> hold(lock);
      d = delegate.lock();
    }
    ASSERT_TRUE(d) << "no one is listening";
    d->didUpdateLocations({fix});
  }

  std::atomic<int> starts{0};
  std::atomic<int> stops{0};
  std::atomic<int> sessionResets{0};
  std::atomic<int> status{TVXLocationAuthorizationWhenInUse};
  std::mutex lock;
  std::weak_ptr<LocationManagerDelegate> delegate;
};

class FakeRoutine final : public RoutineManager {
 public:
  bool modeForLocation(const TVXLocation&, std::optional<int>* out) override {
    *out = mode.load();
    return true;
  }
  std::atomic<int> mode{2};
};

// The request's query items, decoded; `names` receives them in order.
std::map<std::string, std::string> queryOf(const std::string& url, std::vector<std::string>* names = nullptr) {
  std::map<std::string, std::string> items;
  const auto q = url.find('?');
  for (auto& [name, value] : platform::http::decodedQueryItems(q == std::string::npos ? "" : url.substr(q + 1))) {
    if (names) names->push_back(name);
    items[name] = value.value_or("");
  }
  return items;
}

class RequestFactoryTest : public ::testing::Test, protected testing::TestAssembly {
 protected:
  RequestFactoryTest() {
    defaults->setObject("TVXLocale", "fr_FR");
    defaults->setObject("TVXPreferredLanguages", PropertyValue::Array{"fr-FR", "en-GB", "de", "it", "es"});
    defaults->setObject("TVXTimeZone", "Europe/Paris");
    providers.locationManager = location;
    providers.routineManager = routine;
  }
  ~RequestFactoryTest() override {
    factory.reset();
    pool.drain();
  }

  void make() { factory = TVXNetworkRequestFactory::create(requestFactoryEnvironment(), providers); }

  static TVXBag bag(const char* json, std::string agent = "Seekara/1 (test)") {
    return TVXBag(*platform::parseJson(json)->dictionary(), std::move(agent));
  }
  // Announces a new bag and waits until the factory has taken it.
  void postBag(const char* json) {
    center->post("TVXBagChangeNotification", nullptr, {}, bagChangeUserInfo(bag(json)));
    factory->flushContextAccessQueue();
  }
  // A fix from the location service, taken by the factory.
  void deliver(const TVXLocation& fix) {
    location->deliver(fix);
    factory->flushContextAccessQueue();
  }
  // The query items of a search built from `request` against a bag with only a search URL.
  std::map<std::string, std::string> searchQuery(const TVXSearchRequest& request = {}) {
    return queryOf(factory->searchRequest(request, searchOnly, "G")->url);
  }

  std::shared_ptr<FakeLocationManager> location = std::make_shared<FakeLocationManager>();
  std::shared_ptr<FakeRoutine> routine = std::make_shared<FakeRoutine>();
  TVXRequestFactoryProviders providers;
  std::shared_ptr<TVXNetworkRequestFactory> factory;
  TVXBag searchOnly = bag(R"({"search_url":"https://s.example/"})");
};

// The names of `names` that `items` holds.
std::vector<std::string> present(const std::map<std::string, std::string>& items, std::vector<std::string> names) {
  std::erase_if(names, [&](const std::string& name) { return !items.count(name); });
  return names;
}

TEST_F(RequestFactoryTest, SearchRequestCarriesTheContextInNameOrder) {
  providers.appWhitelistSignature = [] { return std::optional<std::string>("sig"); };
  make();
  TVXSearchRequest request;
  request.queryString = "a b+c";
  request.triggerEvent = 23;
  request.scale = 2;
  request.l2ModelVersion = "7";
  request.queryItems = {{"locale", "xx_YY"}};
  request.topTopics = PropertyValue(Dictionary{{"t", 1}});
  request.localSuggestions = {{"a b, c", "se", 0.5}, {"ab", "en", 1}};

  auto built = factory->searchRequest(request, bag(R"({"search_url":"https://s.example/search?fmt=1",
                                                        "request_timeout_s": 4, "send_geo_environment_header": true})"),
                                       "GUID-1");
  ASSERT_TRUE(built);
  std::vector<std::string> names;
  auto q = queryOf(built->url, &names);
  EXPECT_TRUE(std::is_sorted(names.begin(), names.end()));
  EXPECT_NE(built->url.find("q=a%20b%2Bc&"), std::string::npos) << built->url;
  // The client's "locale" wins; the bag URL's own "fmt" stays. Authorised, but the first request
  // came before any fix: "slow".
  const std::map<std::string, std::string> items = {{"locale", "xx_YY"}, {"fmt", "1"}, {"qtype", "explicit"},
      {"cc", "FR"}, {"esl", "fr-FR"}, {"l2", "7"}, {"lcs", R"(["a b, c","ab"])"}, {"lco", "se-0.50,en-1.00"},
      {"geosrc", "slow"}};
  EXPECT_THAT(q, ::testing::IsSupersetOf(items));
  EXPECT_EQ(present(q, {"suggest_queries", "latlng", "rm", "mode", "du_enabled"}), std::vector<std::string>{});

  const std::map<std::string, std::string> headers = {{"X-Norvel-Languages", R"(["fr-FR","en-GB","de"])"},
      {"X-Norvel-UserGuid", "GUID-1"}, {"X-Norvel-UI-Scale", "2.0"}, {"X-Norvel-TopTopics", R"({"t":1})"},
      {"X-Norvel-GeoSession", "S1 4 2.500000"}, {"X-Norvel-Whitelisted-App-Signature", "sig"}};
  for (const auto& [name, value] : headers) EXPECT_EQ(built->headers.get(name), value) << name;
  EXPECT_DOUBLE_EQ(built->timeoutInterval, 4);

  request.triggerEvent = 21;
  q = searchQuery(request);
  EXPECT_EQ(q["suggest_queries"], "withtop");
  EXPECT_EQ(q.count("qtype"), 0u);

  // A managed account, and a user who allows diagnostics to be sent.
  defaults->setObject("TVXManagedAccount", true);
  defaults->setObject("TVXDiagnosticsSubmissionAllowed", true);
  factory->flushContextAccessQueue();
  q = searchQuery(request);
  EXPECT_EQ(q["mode"], "managed");
  EXPECT_EQ(q["du_enabled"], "1");
}

TEST_F(RequestFactoryTest, MissingURLsLeaveLocationAloneAndANewUserIdentifierStartsANewMapsSession) {
  make();
  TVXBag empty = bag("{}");
  EXPECT_FALSE(factory->searchRequest(TVXSearchRequest{}, empty, "G"));
  EXPECT_FALSE(factory->lookupRequest(TVXLookupRequest{}, empty, "G"));
  EXPECT_EQ(location->starts.load(), 0);
  EXPECT_FALSE(factory->searchRequest(TVXSearchRequest{}, bag(R"({"search_url":"not a url"})"), "G"));

  searchQuery();
  EXPECT_EQ(location->sessionResets.load(), 0) << "building a request reads the session without a reset";
  center->post("TVXUserGUIDChangeNotification");
  factory->flushContextAccessQueue();
  EXPECT_EQ(location->sessionResets.load(), 1);
}

TEST_F(RequestFactoryTest, LocationFollowsTheBagTheAgeLimitAndSearches) {
  defaults->setObject("TVXMotionActivity", "walking");
  providers.motionManager = std::make_shared<DefaultsMotionManager>(*defaults, pool);
  PropertyValue::Array proxies;
  providers.proxySetCurrentConfiguration = [&](const Dictionary& configuration, const std::string& name) {
    EXPECT_EQ(name, "tavixd");
    proxies.emplace_back(configuration);
  };
  make();
  postBag(R"({"supported_geo_location_sources":["gps"]})");
  ASSERT_GE(location->starts.load(), 1);

  deliver({48.85, 2.35, 65, 4, clock.now()});  // wifi
  EXPECT_EQ(factory->geoLocationSource(), "bagno.wifi");
  EXPECT_FALSE(factory->geoLocationLatLng());

  TVXLocation gps{-33.9, 151.2, 10, 1, clock.now()};
  deliver(gps);
  EXPECT_EQ(factory->geoLocationLatLng(), "-33.900000,151.200000");
  EXPECT_EQ(factory->geoLocationSource(), "gps,10.000000");
  EXPECT_EQ(factory->lookupGeoLocationLatLng(), "-33.000000,151.000000");  // toward zero, not -34

  TVXBag searchBag = bag(R"({"search_url":"https://s.example/","supported_geo_location_sources":["gps"]})");
  TVXSearchRequest request;
  routine->mode = 0;
  location->deliver(gps);  // the routine mode is read with each fix
  pool.drain();  // and the motion activity came with the bag
  factory->flushContextAccessQueue();
  int starts = location->starts.load();
  clock.advance(platform::seconds(299));
  auto q = queryOf(factory->searchRequest(request, searchBag, "G")->url);
  EXPECT_EQ(location->starts.load(), starts);  // a fix 299 s old is still good
  const std::map<std::string, std::string> located = {
      {"latlng", "-33.900000,151.200000"}, {"geosrc", "gps,10.000000"}, {"rm", "2"}, {"tm", "3"}};  // tm 3: walking
  EXPECT_THAT(q, ::testing::IsSupersetOf(located));
  q = queryOf(factory->searchRequest(request, searchBag, "G", TVXFieldMaskNoLocation)->url);
  EXPECT_EQ(present(q, {"latlng", "geosrc", "rm", "tm"}), std::vector<std::string>{});

  clock.advance(platform::seconds(2));
  factory->searchRequest(request, searchBag, "G");
  EXPECT_EQ(location->starts.load(), starts + 1);  // 301 s: sample again

  TVXLookupRequest lookup;
  lookup.queryString = "東京";
  lookup.lookupContext = "Tokyo tower";
  lookup.lookupSelectionType = TVXLookupSelectionTypeHint;
  lookup.bundleIdentifier = "org.example.reader";
  auto built = factory->lookupRequest(lookup, searchBag, "G");
  EXPECT_EQ(built->headers.get("X-Norvel-FuzzedLatLong"), "-33.000000,151.000000");
  q = queryOf(built->url);
  EXPECT_EQ(q.count("latlng"), 0u);
  // The context is a phrase: the identifier judges it whole.
  const std::map<std::string, std::string> lookedUp = {
      {"ltype", "hint"}, {"qlang", "zh"}, {"lctxlang", "en"}, {"context", "org.example.reader"}};
  EXPECT_THAT(q, ::testing::IsSupersetOf(lookedUp));

  factory->setPerformedSearch();
  EXPECT_EQ(factory->lookupGeoLocationLatLng(), "-33.900000,151.200000");
  auto download = factory->fileDownloadRequest("https://r.example/f", "etag1", true);
  EXPECT_EQ(download->headers.get("X-Norvel-FuzzedLatLong"), "-33.900000,151.200000");

  postBag(R"({"marvola_configuration":{"enabled":true}})");
  EXPECT_EQ(factory->geoLocationSource(), "bagno.all");
  // The first bag had no proxy configuration: off.
  EXPECT_EQ(platform::toJson(proxies), R"([{"appRule":{"enable":{"Enabled":false}}},{"enabled":true}])");
  EXPECT_FALSE(factory->lookupGeoLocationLatLng());
  EXPECT_GE(location->stops.load(), 1);
}

TEST_F(RequestFactoryTest, NewsWithoutAuthorisationAndDeniedUsersSendUserno) {
  make();
  postBag(R"({"supported_geo_location_sources":"all"})");
  deliver({1.5, 2.5, 100, 6, clock.now()});
  EXPECT_EQ(factory->geoLocationSource(), "cell,100.000000");

  auto q = queryOf(factory->searchRequest(TVXSearchRequest{}, bag(R"({"search_url":"https://s.example/"})", "News/5"), "G")->url);
  EXPECT_EQ(q["geosrc"], "userno");
  EXPECT_EQ(present(q, {"latlng", "rm"}), std::vector<std::string>{});  // routine mode 2 is not a mode the server knows

  location->status = TVXLocationAuthorizationDenied;
  clock.advance(platform::seconds(400));
  q = searchQuery();
  EXPECT_EQ(q["geosrc"], "userno");
  EXPECT_EQ(q.count("latlng"), 0u);
}

TEST_F(RequestFactoryTest, FailuresAndAuthorisationChangesSetTheReason) {
  location->status = TVXLocationAuthorizationNotDetermined;
  make();
  EXPECT_EQ(factory->geoLocationSource(), "userno");
  searchQuery();
  EXPECT_EQ(location->starts.load(), 1);  // not determined is not a refusal: ask

  std::shared_ptr<LocationManagerDelegate> delegate = location->delegate.lock();
  ASSERT_TRUE(delegate);
  delegate->didFailWithError("no fix");
  factory->flushContextAccessQueue();
  EXPECT_EQ(searchQuery()["geosrc"], "error.fail");

  location->status = TVXLocationAuthorizationWhenInUse;
  int starts = location->starts.load();
  delegate->didChangeAuthorization(TVXLocationAuthorizationWhenInUse);
  factory->flushContextAccessQueue();
  EXPECT_EQ(location->starts.load(), starts + 1);
}

TEST_F(RequestFactoryTest, OtherKindsAndBagRequests) {
  providers.isDictionaryInstalled = [](const std::string& id) { return id != "de-duden"; };
  make();
  struct Source : TVXBagURLSource {
    std::string country;
    std::string bagFetchURLWithCountry(std::string_view cc) override {
      country = std::string(cc);
      return "https://bag.example/bag";
    }
  } source;
  auto fetch = factory->bagFetchRequest(source, "ua/1", "12");
  ASSERT_TRUE(fetch);
  EXPECT_EQ(source.country, "FR");
  EXPECT_EQ(fetch->headers.get("User-Agent"), "ua/1");
  EXPECT_TRUE(fetch->reloadIgnoringLocalCacheData);

  TVXBag kinds = bag(R"({"search_url":"https://s.example/s","more_results_url":"https://m.example/m?latlng=1,2",
                         "flight_url":"https://f.example/f","card_url":"https://c.example/c"})");
  TVXMoreResultsRequest more;
  more.queryString = "ignored";
  more.queryItems = {{"page", "2"}};
  auto q = queryOf(factory->moreResultsRequest(more, kinds, "G")->url);
  EXPECT_EQ(q["latlng"] + " " + q["page"], "1,2 2");
  EXPECT_EQ(present(q, {"q", "geosrc"}), std::vector<std::string>{});
  TVXFlightSearchRequest flight;
  flight.flightQuery = "AF 22";
  auto built = factory->flightSearchRequest(flight, kinds, "G");
  EXPECT_EQ(built->headers.get("Accept"), "application/x-protobuf");
  q = queryOf(built->url);
  EXPECT_EQ(q["q"], "AF 22");
  EXPECT_EQ(std::stod(q["timestamp"]), platform::toUnixSeconds(clock.now()));

  // The known dictionaries arrive as a resource; "dicts" names those installed, in its order.
  const auto list = home.cache() / "com.norvel.tavixd" / kTVXKnownDictionariesList;
  auto downloaded = [&](const std::string& contents) {
    ASSERT_FALSE(platform::createDirectory(list.parent_path(), true));
    ASSERT_FALSE(platform::writeFileAtomically(list, contents));
    center->post("TVXFileDownloadCompletedNotification", nullptr, {},
                 {{"identifier", PropertyValue(kTVXKnownDictionariesList)}});
    factory->flushContextAccessQueue();
  };
  EXPECT_EQ(queryOf(factory->lookupRequest(TVXLookupRequest{}, kinds, "G")->url).count("dicts"), 0u);
  downloaded(R"(["en-oxford", "de-duden", "fr-larousse"])");
  EXPECT_EQ(queryOf(factory->lookupRequest(TVXLookupRequest{}, kinds, "G")->url)["dicts"], "en-oxford,fr-larousse");
  downloaded(R"({"en-oxford": true})");
  EXPECT_EQ(queryOf(factory->lookupRequest(TVXLookupRequest{}, kinds, "G")->url)["dicts"], "en-oxford,fr-larousse");
  defaults->setObject("TVXLookupDisabled", true);
  EXPECT_EQ(queryOf(factory->lookupRequest(TVXLookupRequest{}, kinds, "G")->url)["dicts"], "off");

  auto download = factory->fileDownloadRequest("https://r.example/f", "", false);
  EXPECT_FALSE(download->headers.contains("If-None-Match"));
  EXPECT_NE(download->headers.get("User-Agent")->find(") Seekara/1"), std::string::npos);
}

TEST_F(RequestFactoryTest, BagSwitchesForNewsAndMessagesReachManagedConfiguration) {
  make();
  platform::UserDefaults managed(home.config(), kTVXManagedConfigurationDomain);
  // (news allowed, blacklisted apps) once the bag is taken.
  auto announce = [&](const char* json) {
    postBag(json);
    pool.drain();
    managed.synchronize();
    auto news = managed.objectForKey(kTVXFeatureSeekaraNewsAllowed);
    auto blacklisted = managed.objectForKey(kTVXBlacklistedAppBundleIDsKey);
    return (news ? platform::toJson(*news) : "absent") + " " + (blacklisted ? platform::toJson(*blacklisted) : "absent");
  };
  EXPECT_EQ(announce(R"({"clients":{"news":{"enabled":false}}})"), "false []");
  EXPECT_EQ(announce(R"({"enabled":false,"clients":{"news":{"enabled":true}}})"),
            std::string("true [\"") + kTVXSTSAppBundleIdentifier + "\"]");
}

TEST_F(RequestFactoryTest, TheBagsProxyConfigurationDecidesEveryTasksProxy) {
  defaults->setObject("TVXUseMarvola", true);
  make();
  auto configure = [&](const char* json) {
    postBag(json);
    return std::pair{factory->proxyGetStatus(), factory->proxyURL()};
  };
  EXPECT_EQ(configure(R"({"marvola_configuration":{"enabled":true}})"), std::pair(0, std::optional<std::string>()));
  EXPECT_EQ(configure(R"({"marvola_configuration":{"enabled":true,"proxy":"http://proxy.example:8080"}})"),
            std::pair(1, std::optional<std::string>("http://proxy.example:8080")));
  // On, but not a URL a task can use: the status stays, the task goes without.
  EXPECT_EQ(configure(R"({"marvola_configuration":{"enabled":true,"proxy":"proxy.example"}})"),
            std::pair(1, std::optional<std::string>()));
  configure(R"({"marvola_configuration":{"enabled":true,"proxy":"http://proxy.example:8080"}})");
  defaults->setObject("TVXUseMarvola", false);
  EXPECT_EQ(factory->proxyGetStatus(), 0);
  EXPECT_FALSE(factory->proxyURL());
}

TEST_F(RequestFactoryTest, SilhouetteTopicsWeighTheEngagedSuggestion) {
  make();
  factory->setSilhouetteTopics("plain-topics");
  TVXSearchRequest request;
  EXPECT_EQ(searchQuery(request)["sil"], "plain-topics");

  factory->setSilhouetteTopics(R"({"sil":"s1","pv":3,"all":{"sport":0.5,"news":2}})");
  request.engagedSuggestion = TVXEngagedSuggestion{"x", platform::base64Encode(R"({"si":{"sport":4,"art":3}})")};
  EXPECT_EQ(searchQuery(request)["sil"], R"({"art":0.0,"sport":2.0})");
  request.engagedSuggestion->fbr = "not base64!";
  EXPECT_EQ(searchQuery(request)["sil"], "s1");
}

}  // namespace
}  // namespace tavix
