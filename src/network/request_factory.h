// TVXNetworkRequestFactory: builds every HTTP request the daemon sends (bag fetch and bag cache
// identity, search, zero-keyword, more results, lookup, flight, card, warm-up, resource download,
// feedback upload) from a snapshot of the device and user context: locale, languages, units, time
// zone, country, store front, subscriptions, location, motion, routine, restrictions,
// dictionaries, topics and debugging parameters.
//
// Threading: the snapshot lives on the serial queue "com.norvel.tavixd.contextaccess". Builders and
// reads enter it synchronously (never call them from that queue); observers and setters update it
// asynchronously; flushContextAccessQueue() waits for the updates queued so far.
//
// Observed: "TVXBagChangeNotification" on its notification centre (its user info's
// "bag"), "TVXFileDownloadCompletedNotification" for the known-dictionaries list, and the
// defaults keys it reads. Posted: "TVXBagRefreshRequired" (sender: the factory, from a pool
// thread) when the locale context or the device country code changes.
//
// The factory also stands in for the platform's network-service proxy: it keeps the bag's proxy
// configuration and answers the proxy status and URL that every request's task is given.
//
// Defaults read here: "TVXDebugParameters", "TVXAlwaysOnTophit", "TVXLookupDisabled",
// "TVXManagedAccount" and "TVXDeviceRestricted" (booleans standing in for the account and
// managed-configuration services), "TVXDiagnosticsSubmissionAllowed" (boolean: "du_enabled"),
// and the locale keys of locale_context.h. The device country code is the location manager's,
// else the locale's region.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "context/subscription_manager.h"
#include "core/requests.h"
#include "platform/files.h"
#include "platform/http/url_request.h"
#include "platform/property_value.h"

namespace tavix {

namespace platform {
class Clock;
class DispatchPool;
class NotificationCenter;
class UserDefaults;
}  // namespace platform

class DeviceInformation;
class LocationManager;
class MotionManager;
class RoutineManager;
class TVXBag;
class TavixURLRequestBuilder;
struct TVXLocation;

// Who knows the bag endpoint: the bag controller.
class TVXBagURLSource {
 public:
  virtual ~TVXBagURLSource() = default;
  virtual std::string bagFetchURLWithCountry(std::string_view countryCode) = 0;
};

// Bit 0 of a field mask: send no location with this request.
inline constexpr std::uint64_t TVXFieldMaskNoLocation = 1;

inline constexpr const char* TavixHTTPHeaderNameUserAgent = "User-Agent";
inline constexpr const char* TavixHTTPHeaderNameUserGUID = "X-Norvel-UserGuid";
inline constexpr const char* TavixHTTPHeaderNameLanguages = "X-Norvel-Languages";
inline constexpr const char* TavixHTTPHeaderNameUIScale = "X-Norvel-UI-Scale";
inline constexpr const char* TavixHTTPHeaderNameSubscriptions = "X-Norvel-Subscriptions";
inline constexpr const char* TavixHTTPHeaderNameGeoEnvironment = "X-Norvel-GeoEnvironment";
inline constexpr const char* TavixHTTPHeaderNameGeoMetadata = "X-Norvel-GeoMetadata";
inline constexpr const char* TavixHTTPHeaderNameGeoSession = "X-Norvel-GeoSession";
inline constexpr const char* TavixHTTPHeaderNameLatLong = "X-Norvel-FuzzedLatLong";
inline constexpr const char* TavixHTTPHeaderNameTopTopics = "X-Norvel-TopTopics";
inline constexpr const char* TavixHTTPHeaderNameAppWhitelistSignature = "X-Norvel-Whitelisted-App-Signature";
inline constexpr const char* TavixHTTPHeaderNameDigest = "X-Norvel-Digest";

// Where the bag's visibility switches for other programs are written: the stand-in for the
// platform's managed configuration, a defaults domain those programs read.
inline constexpr const char* kTVXManagedConfigurationDomain = "com.norvel.managedconfiguration";
inline constexpr const char* kTVXFeatureSeekaraNewsAllowed = "TVXFeatureSeekaraNewsAllowed";
inline constexpr const char* kTVXBlacklistedAppBundleIDsKey = "blacklistedAppBundleIDs";
inline constexpr const char* kTVXSTSAppBundleIdentifier = "com.norvel.messages.hashtagimages";

// The resource that lists the dictionaries the server knows: a JSON array of dictionary
// identifiers, kept by the download manager as a file of that name in the caches folder.
inline constexpr const char* kTVXKnownDictionariesList = "dictionary_resources_url";

// The collaborators the factory reads. Empty members are made from its defaults (device
// information, routine) or stay absent, and what they would feed is then not sent.
struct TVXRequestFactoryProviders {
  std::shared_ptr<LocationManager> locationManager;
  std::shared_ptr<MotionManager> motionManager;
  std::shared_ptr<RoutineManager> routineManager;
  std::shared_ptr<const DeviceInformation> deviceInformation;
  // The installed-app signature header value; absent or empty: no header.
  std::function<std::optional<std::string>()> appWhitelistSignature;
  // The network-service proxy: receives the bag's proxy configuration under the name "tavixd".
  std::function<void(const platform::Dictionary& configuration, const std::string& name)> proxySetCurrentConfiguration;
  // Whether a dictionary of the known-dictionaries list is installed. Empty: a dictd database of
  // that name in /usr/share/dictd or /usr/local/share/dictd.
  std::function<bool(const std::string& identifier)> isDictionaryInstalled;
};

class TVXNetworkRequestFactory : public std::enable_shared_from_this<TVXNetworkRequestFactory>,
                                 public TavixSubscriptionManagerDelegate {
 public:
  // What the factory works with besides its providers. The pool and clock must outlive it.
  struct Environment {
    platform::DispatchPool* pool = nullptr;
    platform::Clock* clock = nullptr;
    std::shared_ptr<platform::UserDefaults> defaults;
    // Bag, download and user-identifier changes arrive here; bag refreshes are asked for here.
    std::shared_ptr<platform::NotificationCenter> center;
    platform::fs::path cachesFolder;  // holds the known-dictionaries list
  };

  static std::shared_ptr<TVXNetworkRequestFactory> create(Environment env, TVXRequestFactoryProviders providers = {});
  ~TVXNetworkRequestFactory();
  TVXNetworkRequestFactory(const TVXNetworkRequestFactory&) = delete;
  TVXNetworkRequestFactory& operator=(const TVXNetworkRequestFactory&) = delete;

  // The current "TVXUseMarvola" default, read on every call so a change needs no restart.
  bool useMarvola() const;

  using Request = std::optional<platform::http::URLRequest>;

  // Bag requests, on the URL `source` gives for the device country code. Empty when that URL
  // does not parse.
  Request bagFetchRequest(TVXBagURLSource& source, std::optional<std::string> userAgent,
                          std::optional<std::string> version);
  Request bagCacheRequest(TVXBagURLSource& source, std::optional<std::string> userAgent,
                          std::optional<std::string> version);
  Request warmRequest(std::string_view url);

  // The search family: empty when the bag lacks the URL (location services are then left alone).
  Request searchRequest(const TVXSearchRequest& request, const TVXBag& bag, const std::string& userGuid,
                        std::uint64_t fieldMask = 0);
  Request zeroKeywordRequest(const TVXZeroKeywordRequest& request, const TVXBag& bag, const std::string& userGuid,
                             std::uint64_t fieldMask = 0);
  Request moreResultsRequest(const TVXMoreResultsRequest& request, const TVXBag& bag, const std::string& userGuid,
                             std::uint64_t fieldMask = 0);
  Request lookupRequest(const TVXLookupRequest& request, const TVXBag& bag, const std::string& userGuid);
  Request flightSearchRequest(const TVXFlightSearchRequest& request, const TVXBag& bag, const std::string& userGuid);
  Request cardRequest(const TVXCardRequest& request, const TVXBag& bag, const std::string& userGuid);

  Request fileDownloadRequest(std::string_view url, std::optional<std::string> version, bool includeLatLong);
  Request flusherUploadRequest(std::string_view url, double timeout, std::string digest);

  // Topic weights: JSON text, either {"sil": ..., "pv": ..., "all": {topic: weight}} or any other
  // text, sent as it is. Asynchronous.
  void setSilhouetteTopics(std::string json);
  // A client performed a search: look-ups may now carry the exact location. Asynchronous.
  void setPerformedSearch();
  // From the subscription manager. Asynchronous.
  void setStoreFrontIdentifier(std::optional<std::string> identifier);
  void setSubscriptionInfo(std::optional<std::string> info);
  // The subscription manager's news, kept as the two above. Asynchronous.
  void didUpdateSubscriptionDictionaries(const SubscriptionRecords& records) override;
  void didUpdateStorefrontIdentifier(const std::optional<std::string>& identifier) override;
  // The installed dictionaries, as sent in "dicts". Asynchronous.
  void setInstalledDictionaries(std::optional<std::string> dictionaries);

  // The network-service proxy: 1 while requests go through the bag's proxy ("TVXUseMarvola" on
  // and the bag's "marvola_configuration" enabled with a "proxy"), else 0. Synchronous.
  int proxyGetStatus();
  // The proxy every task is pointed at while the status is 1; none otherwise, or when the
  // configured proxy is not a URL. Synchronous.
  std::optional<std::string> proxyURL();

  // The device answers the factory's requests carry; one for the process, so that the operating
  // system's version is read once.
  const DeviceInformation& deviceInformation() const { return *providers_.deviceInformation; }

  // Waits until every update queued so far has run. Not from the context queue.
  void flushContextAccessQueue();

  // The factory's own user agent (the daemon's name/version token as the client part).
  const std::optional<std::string>& userAgent() const { return userAgent_; }

  // Snapshot reads, synchronous.
  std::optional<std::string> geoLocationLatLng();
  std::optional<std::string> geoLocationSource();
  std::optional<std::string> lookupGeoLocationLatLng();
  std::optional<std::string> geoDeviceCountryCode();
  std::vector<TVXQueryItem> debuggingQueryItems();

 private:
  struct Context;
  class Delegate;

  TVXNetworkRequestFactory(Environment env, TVXRequestFactoryProviders providers);
  void start();

  // ---- The request context (request_context.cpp), on the context queue.
  void setNoLocationReason(std::string reason);
  void initLocationServices();
  bool hasRecentFix();
  void startUpdatingLocation();
  void startUpdatingMotionActivity();
  void setLocation(const TVXLocation& fix);
  void setLocationIfAllowedByBag(const TVXLocation& fix);
  void setupDebuggingQueryItems();
  void readDefaults();
  bool updateLocaleContexts();
  void notifyBagRefreshRequired();
  void didGetBag(std::shared_ptr<const TVXBag> bag);
  void loadInstalledDictionaries(bool quietWhenMissing);
  void updateVisibility(const TVXBag& bag);
  void onDefaultsChanged(const std::string& key);

  // ---- The recipes' shared steps (request_factory.cpp), on the context queue.
  void addLocaleItems(TavixURLRequestBuilder& b, const TVXRequest& request);
  void addDictionaries(TavixURLRequestBuilder& b);
  void addSilhouette(TavixURLRequestBuilder& b, const std::optional<TVXEngagedSuggestion>& engaged);
  void addLocationItems(TavixURLRequestBuilder& b, const TVXBag& bag, std::uint64_t fieldMask);
  void addTrailingItems(TavixURLRequestBuilder& b, const TVXRequest& request, const TVXBag& bag, const std::string& userGuid);
  std::optional<TavixURLRequestBuilder> begin(const std::optional<std::string>& url);
  void addRequestAndDebugItems(TavixURLRequestBuilder& b, const TVXRequest& request);
  void addGeoMetadata(TavixURLRequestBuilder& b);
  Request bagRequest(TVXBagURLSource& source, const std::optional<std::string>& userAgent, const std::optional<std::string>& version, bool forCache);

  Environment env_;
  TVXRequestFactoryProviders providers_;
  std::optional<std::string> userAgent_;
  std::unique_ptr<Context> context_;  // owns the queue and the fields on it
};

}  // namespace tavix
