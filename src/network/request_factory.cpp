#include "network/request_factory.h"

#include <cmath>
#include <cstdlib>

#include <fmt/core.h>

#include "bagview/tvx_bag.h"
#include "context/location.h"
#include "context/motion.h"
#include "core/assembly.h"
#include "core/logging.h"
#include "core/names.h"
#include "network/language_identifier.h"
#include "network/locale_context.h"
#include "network/url_request_builder.h"
#include "bagview/user_agent.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/json_value.h"
#include "platform/notification_center.h"
#include "platform/strings.h"

namespace tavix {

using platform::Dictionary;
using platform::PropertyValue;

namespace {

constexpr const char* kAccessKey = "tapirowl3860";
constexpr const char* kNoLocationUser = "userno";
constexpr const char* kNoLocationInit = "error.init";
constexpr const char* kNoLocationSlow = "slow";
constexpr const char* kNoLocationFail = "error.fail";
constexpr const char* kNoLocationBag = "bagno";
constexpr double kLocationMaxAge = 300;

platform::Logger& requestLog() { return TavixLogForCategory(TavixLoggingCategoryRequest); }

bool nonEmpty(const std::optional<std::string>& s) { return s && !s->empty(); }

bool isAuthorized(int status) {
  return status == TVXLocationAuthorizationAlways || status == TVXLocationAuthorizationWhenInUse;
}

std::string sourceName(int type) {
  switch (type) {
    case TVXLocationSourceTypeSatellite:
    case TVXLocationSourceTypeSatelliteAssisted:
    case TVXLocationSourceTypeSatelliteDifferential:
    case TVXLocationSourceTypeSatelliteFused: return "gps";
    case TVXLocationSourceTypeCell:
    case TVXLocationSourceTypeCellTriangulated:
    case TVXLocationSourceTypeCellTower: return "cell";
    case TVXLocationSourceTypeWiFi:
    case TVXLocationSourceTypeWiFiScan: return "wifi";
    default: return "unknown";
  }
}

// "a=1&b=2" → items; empty with `ok` false when a part is not exactly one name and one value.
std::vector<TVXQueryItem> parseDebugParameters(const std::string& text, bool* ok) {
  std::vector<TVXQueryItem> items;
  *ok = true;
  std::size_t pos = 0;
  while (true) {
    std::size_t amp = text.find('&', pos);
    std::string part = text.substr(pos, amp == std::string::npos ? std::string::npos : amp - pos);
    std::size_t eq = part.find('=');
    if (eq == std::string::npos || part.find('=', eq + 1) != std::string::npos) {
      requestLog().notice("invalid query components: {}", part);
      *ok = false;
      return {};
    }
    items.push_back({part.substr(0, eq), part.substr(eq + 1)});
    if (amp == std::string::npos) break;
    pos = amp + 1;
  }
  return items;
}

}  // namespace

// The snapshot. Every field below `queue` is touched only on it.
struct TVXNetworkRequestFactory::Context {
  explicit Context(platform::DispatchPool& pool) : queue(pool, "com.norvel.tavixd.contextaccess") {}

  platform::SerialQueue queue;

  TVXLocaleSettings localeSettings;
  TVXLocaleContext locale;
  std::optional<std::string> geoDeviceCountryCode;
  std::optional<std::string> storeFrontIdentifier;
  std::optional<std::string> subscriptionInfo;
  std::optional<std::string> geoClientMetadata;
  std::optional<std::string> installedDictionaries;
  bool alwaysSendTophit = false;
  std::optional<int> routineMode;
  std::optional<int> transportationMode;
  bool isManagedAccount = false;
  bool deviceRestricted = false;
  std::vector<TVXQueryItem> debuggingQueryItems;
  std::optional<std::string> silhouetteTopicsStr;
  std::optional<std::string> portraitVersion;
  Dictionary allSilhouetteTopics;

  std::optional<TVXLocation> geoLocation;
  std::optional<std::string> geoLocationLatLng;
  std::optional<std::string> geoLocationSource;
  std::optional<std::string> lookupGeoLocationLatLng;
  std::vector<std::string> supportedGeoLocationSources;
  // The bag's "marvola_configuration" as the network-service proxy holds it.
  Dictionary proxyConfiguration;

  std::shared_ptr<Delegate> delegate;
  platform::UserDefaults::Subscription defaultsSubscription;
  platform::NotificationCenter::Registration bagRegistration;
  platform::NotificationCenter::Registration guidRegistration;
  platform::NotificationCenter::Registration downloadRegistration;
};

// Hears the location and motion services and hops onto the context queue.
class TVXNetworkRequestFactory::Delegate final : public LocationManagerDelegate, public MotionManagerDelegate {
 public:
  explicit Delegate(std::weak_ptr<TVXNetworkRequestFactory> owner) : owner_(std::move(owner)) {}

  void didUpdateLocations(const std::vector<TVXLocation>& locations) override;
  void didFailWithError(const std::string& error) override;
  void didChangeAuthorization(int status) override;
  void didUpdateMotionActivity(const TVXMotionActivity& activity) override;

 private:
  std::weak_ptr<TVXNetworkRequestFactory> owner_;
};

// The private operations, all on the context queue.
class TVXNetworkRequestFactory::Builder {
 public:
  using Self = TVXNetworkRequestFactory;

  static void setNoLocationReason(Self& f, std::string reason) {
    Context& c = *f.context_;
    c.queue.assertCurrent("setNoLocationReason");
    c.geoLocation.reset();
    c.geoLocationLatLng.reset();
    c.lookupGeoLocationLatLng.reset();
    c.geoLocationSource = std::move(reason);
  }

  static void initLocationServices(Self& f) {
    auto& location = f.providers_.locationManager;
    bool authorized = location && isAuthorized(location->authorizationStatus());
    setNoLocationReason(f, authorized ? kNoLocationInit : kNoLocationUser);
  }

  static bool hasRecentFix(Self& f) {
    Context& c = *f.context_;
    if (!c.geoLocation) return false;
    double age = platform::toUnixSeconds(f.assembly_.clock->now()) - platform::toUnixSeconds(c.geoLocation->timestamp);
    return age < kLocationMaxAge;
  }

  static void startUpdatingLocation(Self& f) {
    Context& c = *f.context_;
    c.queue.assertCurrent("startUpdatingLocation");
    auto& location = f.providers_.locationManager;
    if (hasRecentFix(f)) return;
    if (!c.geoLocation && c.geoLocationSource == kNoLocationInit) setNoLocationReason(f, kNoLocationSlow);
    if (!location) {
      setNoLocationReason(f, kNoLocationUser);
      return;
    }
    int status = location->authorizationStatus();
    if (status == TVXLocationAuthorizationRestricted || status == TVXLocationAuthorizationDenied) {
      setNoLocationReason(f, kNoLocationUser);
    } else {
      location->startUpdatingLocation(c.delegate);
    }
  }

  static void startUpdatingMotionActivity(Self& f) {
    if (hasRecentFix(f) || !f.providers_.motionManager) return;
    f.providers_.motionManager->startUpdatingMotionActivity(f.context_->delegate);
  }

  static void setLocation(Self& f, const TVXLocation& fix) {
    Context& c = *f.context_;
    c.geoLocation = fix;
    c.geoLocationLatLng = fmt::format("{:f},{:f}", fix.latitude, fix.longitude);
    c.geoLocationSource = fmt::format("{},{:f}", sourceName(fix.type), fix.horizontalAccuracy);
    if (!c.lookupGeoLocationLatLng) {
      // Whole degrees, truncated toward zero, until a search shows the user wants local answers.
      c.lookupGeoLocationLatLng = fmt::format("{:f},{:f}", std::trunc(fix.latitude), std::trunc(fix.longitude));
    }
  }

  static void setLocationIfAllowedByBag(Self& f, const TVXLocation& fix) {
    Context& c = *f.context_;
    c.queue.assertCurrent("setLocationIfAllowedByBag");
    std::string source = sourceName(fix.type);
    for (const auto& allowed : c.supportedGeoLocationSources) {
      if (allowed == source) {
        setLocation(f, fix);
        return;
      }
    }
    setNoLocationReason(f, fmt::format("{}.{}", kNoLocationBag, source));
  }

  static void setupDebuggingQueryItems(Self& f) {
    Context& c = *f.context_;
    std::string text = f.assembly_.userDefaults->stringForKey("TVXDebugParameters").value_or("");
    requestLog().debug("processing debug parameters: ({})", text);
    if (text.empty()) return;  // an emptied default keeps the items already in force
    bool ok = false;
    c.debuggingQueryItems = parseDebugParameters(text, &ok);
  }

  static void readDefaults(Self& f) {
    Context& c = *f.context_;
    const auto& defaults = *f.assembly_.userDefaults;
    c.alwaysSendTophit = defaults.boolForKey("TVXAlwaysOnTophit");
    c.isManagedAccount = defaults.boolForKey("TVXManagedAccount");
    bool restricted = defaults.boolForKey("TVXDeviceRestricted");
    if (restricted != c.deviceRestricted) {
      c.deviceRestricted = restricted;
      requestLog().notice("device restriction have changed, currently restriction status is {}", restricted ? 1 : 0);
    }
    if (auto& location = f.providers_.locationManager) c.geoClientMetadata = location->getMapsClientMetadata();
  }

  // True when something the bag's identity rests on changed.
  static bool updateLocaleContexts(Self& f) {
    Context& c = *f.context_;
    TVXLocaleSettings settings = TVXCurrentLocaleSettings(f.assembly_.userDefaults.get());
    bool changed = false;
    if (!(settings == c.localeSettings) || c.locale.localeIdentifier.empty()) {
      TVXLocaleContext locale = TVXComputeLocaleContext(settings);
      changed = !(locale == c.locale);
      c.localeSettings = std::move(settings);
      c.locale = std::move(locale);
    }
    std::optional<std::string> country;
    if (auto& location = f.providers_.locationManager) country = location->getDeviceCountryCode();
    if (!nonEmpty(country)) country = c.locale.regionCode;
    if (country != c.geoDeviceCountryCode) {
      c.geoDeviceCountryCode = country;
      changed = true;
    }
    return changed;
  }

  static void notifyBagRefreshRequired(Self& f) {
    // Never from inside the context queue: observers may come back into the factory.
    auto center = f.assembly_.notificationCenter;
    const void* sender = &f;
    f.assembly_.dispatchPool->post([center, sender] { center->post(kTVXBagRefreshRequiredNotification, sender); });
  }

  static std::optional<TavixURLRequestBuilder> builderFor(const std::optional<std::string>& url) {
    if (!url) return std::nullopt;
    return TavixURLRequestBuilder::requestBuilderWithURL(*url);
  }

  // The items and headers that every request of the search family carries, after its own.
  static void addLocaleItems(Self& f, TavixURLRequestBuilder& b, const TVXRequest& request) {
    Context& c = *f.context_;
    if (nonEmpty(c.geoDeviceCountryCode)) b.defaultQueryItemWithName("cc", c.geoDeviceCountryCode);
    b.defaultQueryItemWithName("locale", c.locale.localeIdentifier);
    if (nonEmpty(c.locale.effectiveSystemLanguage)) b.defaultQueryItemWithName("esl", c.locale.effectiveSystemLanguage);
    if (nonEmpty(c.locale.preferredLanguages)) {
      b.defaultHttpHeaderWithName(TavixHTTPHeaderNameLanguages, *c.locale.preferredLanguages);
    }
    if (request.keyboardInputMode) b.defaultQueryItemWithName("kb_ime", request.keyboardInputMode);
    if (nonEmpty(c.locale.localeCalendarIdentifier)) b.defaultQueryItemWithName("calendar", c.locale.localeCalendarIdentifier);
    if (nonEmpty(c.locale.localTimeZoneName)) b.defaultQueryItemWithName("time_zone", c.locale.localTimeZoneName);
    if (nonEmpty(c.locale.localeMeasurementSystem)) b.defaultQueryItemWithName("units", c.locale.localeMeasurementSystem);
    if (c.locale.tempUnits) b.defaultQueryItemWithName("temp", c.locale.tempUnits);
    if (nonEmpty(c.locale.is24hDateFormat)) b.defaultQueryItemWithName("24h", c.locale.is24hDateFormat);
    if (nonEmpty(request.l2ModelVersion)) b.defaultQueryItemWithName("l2", request.l2ModelVersion);
    if (nonEmpty(request.l3ModelVersion)) b.defaultQueryItemWithName("l3", request.l3ModelVersion);
  }

  static void addDictionaries(Self& f, TavixURLRequestBuilder& b) {
    if (f.assembly_.userDefaults->boolForKey("TVXLookupDisabled")) {
      b.defaultQueryItemWithName("dicts", "off");
    } else if (nonEmpty(f.context_->installedDictionaries)) {
      b.defaultQueryItemWithName("dicts", f.context_->installedDictionaries);
    }
  }

  static void addSilhouette(Self& f, TavixURLRequestBuilder& b, const std::optional<TVXEngagedSuggestion>& engaged) {
    Context& c = *f.context_;
    if (engaged && nonEmpty(engaged->fbr) && !c.allSilhouetteTopics.empty()) {
      auto decoded = platform::base64Decode(*engaged->fbr);
      auto fbr = decoded ? platform::parseJson(*decoded) : std::nullopt;
      const PropertyValue* si = nullptr;
      if (fbr && fbr->dictionary()) {
        auto it = fbr->dictionary()->find("si");
        if (it != fbr->dictionary()->end() && it->second.dictionary()) si = &it->second;
      }
      if (si) {
        Dictionary weighted;
        for (const auto& [topic, weight] : *si->dictionary()) {
          double engagedWeight = weight.asReal().value_or(0);
          auto stored = c.allSilhouetteTopics.find(topic);
          double storedWeight = stored == c.allSilhouetteTopics.end() ? 0 : stored->second.asReal().value_or(0);
          weighted[topic] = storedWeight * engagedWeight;
        }
        b.defaultQueryItemWithName("sil", platform::toJson(weighted));
        return;
      }
    }
    if (nonEmpty(c.silhouetteTopicsStr)) b.defaultQueryItemWithName("sil", c.silhouetteTopicsStr);
  }

  static void addLocationItems(Self& f, TavixURLRequestBuilder& b, const TVXBag& bag, std::uint64_t fieldMask) {
    Context& c = *f.context_;
    bool noLocation = (fieldMask & TVXFieldMaskNoLocation) != 0;
    if (platform::asciiLowercased(bag.userAgent()).find("news") != std::string::npos) {
      auto& location = f.providers_.locationManager;
      if (noLocation || !location || !isAuthorized(location->newsAuthorizationStatus())) {
        b.defaultQueryItemWithName("geosrc", kNoLocationUser);
        return;
      }
    } else if (noLocation) {
      return;
    }
    bool withLocation = nonEmpty(c.geoLocationLatLng) && !c.supportedGeoLocationSources.empty();
    if (withLocation) b.defaultQueryItemWithName("latlng", c.geoLocationLatLng);
    if (nonEmpty(c.geoLocationSource)) b.defaultQueryItemWithName("geosrc", c.geoLocationSource);
    if (f.providers_.appWhitelistSignature) {
      auto signature = f.providers_.appWhitelistSignature();
      if (nonEmpty(signature)) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameAppWhitelistSignature, *signature);
    }
    if (c.routineMode && *c.routineMode >= -1 && *c.routineMode <= 1) {
      // Shifted by two on purpose: the server reads 0 as "not sent".
      b.defaultQueryItemWithName("rm", std::to_string(*c.routineMode + 2));
    }
    if (withLocation && c.transportationMode) b.defaultQueryItemWithName("tm", std::to_string(*c.transportationMode));
  }

  static void addTrailingItems(Self& f, TavixURLRequestBuilder& b, const TVXRequest& request, const TVXBag& bag,
                               const std::string& userGuid) {
    Context& c = *f.context_;
    if (c.isManagedAccount || c.deviceRestricted) b.defaultQueryItemWithName("mode", "managed");
    if (nonEmpty(c.storeFrontIdentifier)) b.defaultQueryItemWithName("storefront", c.storeFrontIdentifier);
    if (c.subscriptionInfo) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameSubscriptions, *c.subscriptionInfo);
    if (f.assembly_.userDefaults->boolForKey("TVXDiagnosticsSubmissionAllowed")) b.defaultQueryItemWithName("du_enabled", "1");
    b.defaultHttpHeaderWithName(TavixHTTPHeaderNameUserGUID, userGuid);
    if (!bag.userAgent().empty()) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameUserAgent, bag.userAgent());
    if (request.scale > 0) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameUIScale, fmt::format("{:.1f}", request.scale));
    auto& location = f.providers_.locationManager;
    if (location && bag.sendGeoEnvironmentHeader()) {
      if (auto environment = location->mapsEnvironment()) {
        b.defaultHttpHeaderWithName(TavixHTTPHeaderNameGeoEnvironment, *environment);
      }
    }
    if (location) {
      auto session = location->getMapsUserSessionEntityAndReset(false);
      if (session && !session->sessionId.empty()) {
        b.defaultHttpHeaderWithName(TavixHTTPHeaderNameGeoSession,
                                    fmt::format("{} {} {:f}", session->sessionId, session->sequenceNumber,
                                                session->relativeTimestamp));
      }
    }
  }

  static platform::http::URLRequest finish(const TavixURLRequestBuilder& b, const TVXBag& bag) {
    auto request = b.createMutableUrlRequest();
    request.timeoutInterval = bag.timeoutIntervalForRequest();
    return request;
  }

  // The part every search-family builder shares up to the kind's own items: location sampling
  // and the builder itself. Empty when the bag lacks the URL.
  static std::optional<TavixURLRequestBuilder> begin(Self& f, const std::optional<std::string>& url) {
    if (!url) return std::nullopt;
    startUpdatingLocation(f);
    startUpdatingMotionActivity(f);
    auto b = TavixURLRequestBuilder::requestBuilderWithURL(*url);
    if (!b) requestLog().error("bag URL does not parse: {}", *url);
    return b;
  }

  static void addRequestAndDebugItems(Self& f, TavixURLRequestBuilder& b, const TVXRequest& request) {
    b.forceQueryItemsFromArray(request.queryItems);
    b.forceQueryItemsFromArray(f.context_->debuggingQueryItems);
  }

  static void addTopTopics(TavixURLRequestBuilder& b, const TVXRequest& request) {
    if (request.topTopics) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameTopTopics, platform::toJson(*request.topTopics));
  }

  static void addGeoMetadata(Self& f, TavixURLRequestBuilder& b) {
    if (f.context_->geoClientMetadata) b.defaultHttpHeaderWithName(TavixHTTPHeaderNameGeoMetadata, *f.context_->geoClientMetadata);
  }

  static void addLocalSuggestions(TavixURLRequestBuilder& b, const TVXSearchRequest& request) {
    if (request.localSuggestions.empty()) return;
    // "lcs" is a JSON array so that completions may hold any character; "lco" pairs each with
    // its origin and score, in the same order.
    PropertyValue::Array strings;
    std::string origins;
    for (const auto& s : request.localSuggestions) {
      strings.emplace_back(s.completion);
      if (!origins.empty()) origins += ',';
      origins += fmt::format("{}-{}", s.origin, fmt::format("{:0.2f}", s.score));
    }
    b.defaultQueryItemWithName("lcs", platform::toJson(strings));
    b.defaultQueryItemWithName("lco", origins);
  }

  static Request bagRequest(Self& f, TVXBagURLSource& source, const std::optional<std::string>& userAgent,
                            const std::optional<std::string>& version, bool forCache) {
    Context& c = *f.context_;
    std::string url = source.bagFetchURLWithCountry(c.geoDeviceCountryCode.value_or(""));
    auto b = TavixURLRequestBuilder::requestBuilderWithURL(url);
    if (!b) return std::nullopt;
    if (nonEmpty(version)) b->defaultQueryItemWithName("version", version);
    if (!forCache) b->defaultQueryItemWithName("key", kAccessKey);
    b->forceQueryItemsFromArray(c.debuggingQueryItems);
    b->defaultQueryItemWithName("locale", c.locale.localeIdentifier);
    if (nonEmpty(c.locale.effectiveSystemLanguage)) b->defaultQueryItemWithName("esl", c.locale.effectiveSystemLanguage);
    if (nonEmpty(c.geoDeviceCountryCode)) b->defaultQueryItemWithName("cc", c.geoDeviceCountryCode);
    b->defaultQueryItemWithName("marvola", f.assembly_.useMarvola() ? "1" : "0");
    if (forCache) {
      if (nonEmpty(userAgent)) b->defaultQueryItemWithName("agent", userAgent);
    } else {
      if (nonEmpty(c.locale.preferredLanguages)) {
        b->defaultHttpHeaderWithName(TavixHTTPHeaderNameLanguages, *c.locale.preferredLanguages);
      }
      if (nonEmpty(userAgent)) b->defaultHttpHeaderWithName(TavixHTTPHeaderNameUserAgent, *userAgent);
    }
    auto request = b->createMutableUrlRequest();
    request.reloadIgnoringLocalCacheData = true;
    return request;
  }

  static void didGetBag(Self& f, std::shared_ptr<const TVXBag> bag) {
    std::vector<std::string> sources = bag->supportedGeoLocationSources();
    std::weak_ptr<Self> weak = f.weak_from_this();
    f.context_->queue.async([weak, sources, bag] {
      auto self = weak.lock();
      if (!self) return;
      Context& c = *self->context_;
      c.supportedGeoLocationSources = sources;
      if (!sources.empty()) {
        startUpdatingLocation(*self);
        if (self->providers_.motionManager) self->providers_.motionManager->startUpdatingMotionActivity(c.delegate);
      } else {
        if (self->providers_.locationManager) self->providers_.locationManager->stopUpdatingLocation();
        setNoLocationReason(*self, fmt::format("{}.{}", kNoLocationBag, "all"));
      }
    });
    f.assembly_.dispatchPool->post([weak, bag] {
      if (auto self = weak.lock()) updateVisibility(*self, *bag);
    });
    auto configuration = bag->marvolaConfiguration();
    if (!configuration) {
      configuration = Dictionary{{"appRule", Dictionary{{"enable", Dictionary{{"Enabled", false}}}}}};
    }
    f.context_->queue.async([weak, configuration = *configuration] {
      if (auto self = weak.lock()) self->context_->proxyConfiguration = configuration;
    });
    if (f.providers_.proxySetCurrentConfiguration) f.providers_.proxySetCurrentConfiguration(*configuration, "tavixd");
  }

  // The installed subset of the known dictionaries, as "dicts" sends it: their identifiers, in the
  // list's order, joined by commas. `quietWhenMissing` at start, when no list has come yet.
  static void loadInstalledDictionaries(Self& f, bool quietWhenMissing) {
    const auto path = f.assembly_.cachesFolder() / kTVXKnownDictionariesList;
    std::string text;
    if (auto ec = platform::readFile(path, &text)) {
      if (!(quietWhenMissing && ec == std::errc::no_such_file_or_directory)) {
        requestLog().error("Error getting file handle for dictionary_resources_url: {}", ec.message());
      }
      return;
    }
    const auto parsed = platform::parseJson(text);
    const auto* known = parsed ? parsed->array() : nullptr;
    if (!known) {
      requestLog().error("contents of dictionary_resource_url is invalid");
      return;
    }
    std::string installed;
    for (const auto& entry : *known) {
      const std::string* identifier = entry.string();
      if (!identifier) {
        requestLog().error("contents of dictionary_resource_url is invalid");
        return;
      }
      if (identifier->empty() || !f.providers_.isDictionaryInstalled(*identifier)) continue;
      if (!installed.empty()) installed += ',';
      installed += *identifier;
    }
    f.setInstalledDictionaries(installed.empty() ? std::nullopt : std::optional<std::string>(installed));
  }

  // The news reader and the messages app's hashtag images follow the bag's switch for their
  // clients. Managed configuration has no Linux counterpart; its settings live in a defaults suite
  // that those programs read.
  static void updateVisibility(Self& f, const TVXBag& bag) {
    auto managed = f.assembly_.userDefaults->suite(kTVXManagedConfigurationDomain);
    const bool newsAllowed = TVXBag(bag.sharedRawBag(), "news").isEnabled();
    managed->setObject(kTVXFeatureSeekaraNewsAllowed, platform::PropertyValue(newsAllowed));
    requestLog().notice("set effective visibility setting for {} to {}", kTVXFeatureSeekaraNewsAllowed,
                        newsAllowed ? 1 : 0);

    platform::PropertyValue::Array blacklisted;
    if (!TVXBag(bag.sharedRawBag(), "messages").isEnabled()) blacklisted.emplace_back(kTVXSTSAppBundleIdentifier);
    const platform::PropertyValue restriction(std::move(blacklisted));
    if (!managed->setObject(kTVXBlacklistedAppBundleIDsKey, restriction)) {
      requestLog().error("error setting device restrictions: {}", managed->filePath().string());
      return;
    }
    requestLog().notice("set effective visibility restriction for {} to {}", kTVXSTSAppBundleIdentifier,
                        platform::toJson(restriction));
  }

  static void onDefaultsChanged(Self& f, const std::string& key) {
    if (key == "TVXDebugParameters") {
      setupDebuggingQueryItems(f);
    } else if (key == "TVXLocale" || key == "TVXPreferredLanguages" || key == "TVXTimeZone" ||
               key == "TVXDeviceCountryCode") {
      if (updateLocaleContexts(f)) notifyBagRefreshRequired(f);
    } else {
      readDefaults(f);
    }
  }
};


void TVXNetworkRequestFactory::Delegate::didUpdateLocations(const std::vector<TVXLocation>& locations) {
  if (locations.empty()) return;
  TVXLocation last = locations.back();
  auto owner = owner_.lock();
  if (!owner) return;
  std::weak_ptr<TVXNetworkRequestFactory> weak = owner_;
  owner->context_->queue.async([weak, last] {
    auto self = weak.lock();
    if (!self) return;
    Builder::setLocationIfAllowedByBag(*self, last);
    if (self->providers_.locationManager) self->providers_.locationManager->stopUpdatingLocation();
    if (auto& routine = self->providers_.routineManager) {
      std::optional<int> mode;
      if (routine->modeForLocation(last, &mode)) {
        self->context_->routineMode = mode;
      } else {
        requestLog().error("Error getting mode from the routine service");
      }
    }
  });
}

void TVXNetworkRequestFactory::Delegate::didFailWithError(const std::string& error) {
  requestLog().error("Location determination failed with error {}", error);
  auto owner = owner_.lock();
  if (!owner) return;
  std::weak_ptr<TVXNetworkRequestFactory> weak = owner_;
  owner->context_->queue.async([weak] {
    if (auto self = weak.lock()) Builder::setNoLocationReason(*self, kNoLocationFail);
  });
}

void TVXNetworkRequestFactory::Delegate::didChangeAuthorization(int) {
  auto owner = owner_.lock();
  if (!owner) return;
  std::weak_ptr<TVXNetworkRequestFactory> weak = owner_;
  owner->context_->queue.async([weak] {
    auto self = weak.lock();
    if (!self) return;
    auto& location = self->providers_.locationManager;
    if (location && location->locationServicesEnabled()) {
      Builder::startUpdatingLocation(*self);
    } else {
      Builder::setNoLocationReason(*self, kNoLocationUser);
    }
  });
}

void TVXNetworkRequestFactory::Delegate::didUpdateMotionActivity(const TVXMotionActivity& activity) {
  int mode = transportationModeForActivity(activity);
  auto owner = owner_.lock();
  if (!owner) return;
  if (owner->providers_.motionManager) owner->providers_.motionManager->stopUpdatingMotionActivity();
  std::weak_ptr<TVXNetworkRequestFactory> weak = owner_;
  owner->context_->queue.async([weak, mode] {
    if (auto self = weak.lock()) self->context_->transportationMode = mode;
  });
}

std::shared_ptr<TVXNetworkRequestFactory> TVXNetworkRequestFactory::create(Assembly& assembly,
                                                                           TVXRequestFactoryProviders providers) {
  std::shared_ptr<TVXNetworkRequestFactory> factory(new TVXNetworkRequestFactory(assembly, std::move(providers)));
  factory->start();
  return factory;
}

TVXNetworkRequestFactory::TVXNetworkRequestFactory(Assembly& assembly, TVXRequestFactoryProviders providers)
    : assembly_(assembly), providers_(std::move(providers)), context_(std::make_unique<Context>(*assembly.dispatchPool)) {
  if (!providers_.locationManager) providers_.locationManager = assembly.locationManager;
  if (!providers_.motionManager) providers_.motionManager = assembly.motionManager;
  if (!providers_.routineManager && assembly.userDefaults) {
    providers_.routineManager = std::make_shared<DefaultsRoutineManager>(*assembly.userDefaults);
  }
  if (!providers_.deviceInformation) {
    providers_.deviceInformation = std::make_shared<DeviceInformation>(assembly.userDefaults.get());
  }
  if (!providers_.isDictionaryInstalled) {
    providers_.isDictionaryInstalled = [](const std::string& identifier) {
      // A name that could leave the folder is no dictionary of ours.
      if (identifier.find('/') != std::string::npos || identifier.front() == '.') return false;
      std::error_code ec;
      for (const char* folder : {"/usr/share/dictd/", "/usr/local/share/dictd/"}) {
        if (platform::fs::exists(std::string(folder) + identifier + ".index", ec)) return true;
      }
      return false;
    };
  }
  userAgent_ = createUserAgentString(std::nullopt, *providers_.deviceInformation);
}

TVXNetworkRequestFactory::~TVXNetworkRequestFactory() {
  // Stop hearing the world before the snapshot goes.
  context_->bagRegistration.reset();
  context_->guidRegistration.reset();
  context_->downloadRegistration.reset();
  context_->defaultsSubscription.reset();
}

void TVXNetworkRequestFactory::start() {
  context_->delegate = std::make_shared<Delegate>(weak_from_this());
  context_->queue.sync([this] {
    Builder::setNoLocationReason(*this, kNoLocationUser);
    Builder::initLocationServices(*this);
    Builder::updateLocaleContexts(*this);
    Builder::readDefaults(*this);
    Builder::setupDebuggingQueryItems(*this);
  });
  // The list a past run downloaded still says what is installed.
  Builder::loadInstalledDictionaries(*this, true);
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->defaultsSubscription = assembly_.userDefaults->addObserver([weak](const std::string& key) {
    auto self = weak.lock();
    if (!self) return;
    self->context_->queue.async([weak, key] {
      if (auto inner = weak.lock()) Builder::onDefaultsChanged(*inner, key);
    });
  });
  context_->bagRegistration = assembly_.notificationCenter->addObserver(
      kTVXBagChangeNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        auto self = weak.lock();
        if (!self) return;
        // The daemon's own view: the proxy and the location sources are not a client's to choose.
        if (auto bag = bagOfNotification(n, self->userAgent_.value_or(""))) Builder::didGetBag(*self, std::move(bag));
      });
  context_->downloadRegistration = assembly_.notificationCenter->addObserver(
      kTVXFileDownloadCompletedNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        const auto it = n.userInfo.find("identifier");
        if (it == n.userInfo.end() || it->second != PropertyValue(kTVXKnownDictionariesList)) return;
        if (auto self = weak.lock()) Builder::loadInstalledDictionaries(*self, false);
      });
  // A new user identifier starts a new maps user session, so "X-Norvel-GeoSession" follows it.
  context_->guidRegistration = assembly_.notificationCenter->addObserver(
      kTVXUserGUIDChangeNotification, nullptr, nullptr, [weak](const platform::Notification&) {
        auto self = weak.lock();
        if (!self || !self->providers_.locationManager) return;
        self->context_->queue.async([weak] {
          auto inner = weak.lock();
          if (inner && inner->providers_.locationManager) inner->providers_.locationManager->getMapsUserSessionEntityAndReset(true);
        });
      });
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::bagFetchRequest(TVXBagURLSource& source,
                                                                            std::optional<std::string> userAgent,
                                                                            std::optional<std::string> version) {
  Request result;
  context_->queue.sync([&] { result = Builder::bagRequest(*this, source, userAgent, version, false); });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::bagCacheRequest(TVXBagURLSource& source,
                                                                            std::optional<std::string> userAgent,
                                                                            std::optional<std::string> version) {
  Request result;
  context_->queue.sync([&] { result = Builder::bagRequest(*this, source, userAgent, version, true); });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::warmRequest(std::string_view url) {
  auto b = TavixURLRequestBuilder::requestBuilderWithURL(url);
  if (!b) return std::nullopt;
  auto request = b->createMutableUrlRequest();
  request.reloadIgnoringLocalCacheData = true;
  return request;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::searchRequest(const TVXSearchRequest& request,
                                                                          const TVXBag& bag,
                                                                          const std::string& userGuid,
                                                                          std::uint64_t fieldMask) {
  Request result;
  context_->queue.sync([&] {
    auto b = Builder::begin(*this, bag.searchURL());
    if (!b) return;
    Context& c = *context_;
    b->forceQueryItemWithName("q", request.queryString);
    switch (request.triggerEvent) {
      case TVXTriggerEventSearchOnly:
      case TVXTriggerEventReturnKey: b->forceQueryItemWithName("qtype", "explicit"); break;
      case TVXTriggerEventSuggestWithResults: b->forceQueryItemWithName("qtype", "suggest_with_results"); break;
      case TVXTriggerEventSuggestion:
      case TVXTriggerEventPartialSuggestion: b->forceQueryItemWithName("qtype", "suggested"); break;
      case TVXTriggerEventSuggestQueries: b->defaultQueryItemWithName("suggest_queries", "withtop"); break;
      default: break;
    }
    Builder::addRequestAndDebugItems(*this, *b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    b->defaultQueryItemWithName("card", "1");
    Builder::addTopTopics(*b, request);
    b->defaultQueryItemWithName("alwaysSendTophit", c.alwaysSendTophit ? "on" : "off");
    Builder::addLocaleItems(*this, *b, request);
    Builder::addLocalSuggestions(*b, request);
    Builder::addDictionaries(*this, *b);
    Builder::addSilhouette(*this, *b, request.engagedSuggestion);
    Builder::addGeoMetadata(*this, *b);
    Builder::addLocationItems(*this, *b, bag, fieldMask);
    Builder::addTrailingItems(*this, *b, request, bag, userGuid);
    result = Builder::finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::zeroKeywordRequest(const TVXZeroKeywordRequest& request,
                                                                               const TVXBag& bag,
                                                                               const std::string& userGuid,
                                                                               std::uint64_t fieldMask) {
  Request result;
  context_->queue.sync([&] {
    auto b = Builder::begin(*this, bag.searchURL());
    if (!b) return;
    b->forceQueryItemWithName("qtype", "zkw");
    Builder::addRequestAndDebugItems(*this, *b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    Builder::addTopTopics(*b, request);
    Builder::addLocaleItems(*this, *b, request);
    Builder::addDictionaries(*this, *b);
    Builder::addSilhouette(*this, *b, std::nullopt);
    Builder::addGeoMetadata(*this, *b);
    Builder::addLocationItems(*this, *b, bag, fieldMask);
    Builder::addTrailingItems(*this, *b, request, bag, userGuid);
    result = Builder::finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::moreResultsRequest(const TVXMoreResultsRequest& request,
                                                                               const TVXBag& bag,
                                                                               const std::string& userGuid,
                                                                               std::uint64_t fieldMask) {
  Request result;
  context_->queue.sync([&] {
    auto b = Builder::begin(*this, bag.moreResultsURL());
    if (!b) return;
    // The server may have put the location in the URL already; never send a second one.
    bool urlHasLocation = b->containsQueryItemWithName("latlng");
    Builder::addRequestAndDebugItems(*this, *b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    Builder::addTopTopics(*b, request);
    Builder::addLocaleItems(*this, *b, request);
    Builder::addGeoMetadata(*this, *b);
    if (!urlHasLocation) Builder::addLocationItems(*this, *b, bag, fieldMask);
    Builder::addTrailingItems(*this, *b, request, bag, userGuid);
    result = Builder::finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::lookupRequest(const TVXLookupRequest& request,
                                                                          const TVXBag& bag,
                                                                          const std::string& userGuid) {
  Request result;
  context_->queue.sync([&] {
    auto b = Builder::begin(*this, bag.searchURL());
    if (!b) return;
    b->forceQueryItemWithName("q", request.queryString);
    Builder::addRequestAndDebugItems(*this, *b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    if (request.bundleIdentifier) b->defaultQueryItemWithName("context", request.bundleIdentifier);
    if (request.lookupHintDomain) b->defaultQueryItemWithName("ldomain", request.lookupHintDomain);
    const char* type = request.lookupSelectionType == TVXLookupSelectionTypeExplicit ? "explicit"
                       : request.lookupSelectionType == TVXLookupSelectionTypeHint   ? "hint"
                                                                                     : "default";
    b->defaultQueryItemWithName("ltype", type);
    if (auto language = TVXLanguageForString(request.queryString)) b->defaultQueryItemWithName("qlang", language);
    if (auto language = TVXLanguageForString(request.lookupContext)) b->defaultQueryItemWithName("lctxlang", language);
    Builder::addLocaleItems(*this, *b, request);
    Builder::addDictionaries(*this, *b);
    // Look-ups carry only the coarse location.
    if (context_->lookupGeoLocationLatLng) {
      b->defaultHttpHeaderWithName(TavixHTTPHeaderNameLatLong, *context_->lookupGeoLocationLatLng);
    }
    Builder::addTrailingItems(*this, *b, request, bag, userGuid);
    result = Builder::finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::flightSearchRequest(const TVXFlightSearchRequest& request,
                                                                                const TVXBag& bag,
                                                                                const std::string& userGuid) {
  Request result;
  context_->queue.sync([&] {
    auto b = Builder::begin(*this, bag.flightURL());
    if (!b) return;
    b->forceQueryItemWithName("q", request.flightQuery);
    Builder::addRequestAndDebugItems(*this, *b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    b->defaultQueryItemWithName("timestamp", fmt::format("{}", platform::toUnixSeconds(assembly_.clock->now())));
    b->forceHttpHeaderWithName("Accept", "application/x-protobuf");
    if (request.bundleIdentifier) b->defaultQueryItemWithName("context", request.bundleIdentifier);
    Builder::addLocaleItems(*this, *b, request);
    Builder::addLocationItems(*this, *b, bag, 0);
    Builder::addTrailingItems(*this, *b, request, bag, userGuid);
    result = Builder::finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::cardRequest(const TVXCardRequest& request, const TVXBag& bag,
                                                                        const std::string& userGuid) {
  Request result;
  context_->queue.sync([&] {
    auto b = Builder::begin(*this, bag.cardURL());
    if (!b) return;
    Builder::addRequestAndDebugItems(*this, *b, request);
    b->defaultQueryItemWithName("key", kAccessKey);
    Builder::addLocaleItems(*this, *b, request);
    Builder::addGeoMetadata(*this, *b);
    Builder::addLocationItems(*this, *b, bag, 0);
    Builder::addTrailingItems(*this, *b, request, bag, userGuid);
    result = Builder::finish(*b, bag);
  });
  return result;
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::fileDownloadRequest(std::string_view url,
                                                                                std::optional<std::string> version,
                                                                                bool includeLatLong) {
  auto b = TavixURLRequestBuilder::requestBuilderWithURL(url);
  if (!b) return std::nullopt;
  b->defaultQueryItemWithName("key", kAccessKey);
  if (auto agent = createUserAgentString("Seekara/1", *providers_.deviceInformation)) {
    b->defaultHttpHeaderWithName(TavixHTTPHeaderNameUserAgent, *agent);
  }
  if (includeLatLong) {
    std::optional<std::string> latLong;
    context_->queue.sync([&] { latLong = context_->lookupGeoLocationLatLng; });
    if (latLong) b->defaultHttpHeaderWithName(TavixHTTPHeaderNameLatLong, *latLong);
  }
  if (nonEmpty(version)) b->defaultHttpHeaderWithName("If-None-Match", *version);
  return b->createMutableUrlRequest();
}

TVXNetworkRequestFactory::Request TVXNetworkRequestFactory::flusherUploadRequest(std::string_view url, double timeout,
                                                                                 std::string digest) {
  auto b = TavixURLRequestBuilder::requestBuilderWithURL(url);
  if (!b) return std::nullopt;
  b->defaultHttpHeaderWithName(TavixHTTPHeaderNameDigest, std::move(digest));
  b->defaultHttpHeaderWithName("Content-Encoding", "deflate");
  auto request = b->createMutableUrlRequest();
  request.method = "POST";
  request.reloadIgnoringLocalCacheData = true;
  request.timeoutInterval = timeout;
  return request;
}

void TVXNetworkRequestFactory::setSilhouetteTopics(std::string json) {
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->queue.async([weak, json = std::move(json)] {
    auto self = weak.lock();
    if (!self) return;
    Context& c = *self->context_;
    auto parsed = platform::parseJson(json);
    const Dictionary* d = parsed ? parsed->dictionary() : nullptr;
    if (d && d->count("sil")) {
      const PropertyValue& sil = d->at("sil");
      c.silhouetteTopicsStr = sil.string() ? *sil.string() : platform::toJson(sil);
      c.portraitVersion.reset();
      if (auto it = d->find("pv"); it != d->end()) {
        c.portraitVersion = it->second.string() ? *it->second.string() : platform::toJson(it->second);
      }
      c.allSilhouetteTopics.clear();
      if (auto it = d->find("all"); it != d->end() && it->second.dictionary()) c.allSilhouetteTopics = *it->second.dictionary();
    } else if (!json.empty()) {
      c.silhouetteTopicsStr = json;
    }
  });
}

void TVXNetworkRequestFactory::setPerformedSearch() {
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->queue.async([weak] {
    auto self = weak.lock();
    if (!self) return;
    Context& c = *self->context_;
    if (c.geoLocation) {
      c.lookupGeoLocationLatLng = fmt::format("{:f},{:f}", c.geoLocation->latitude, c.geoLocation->longitude);
    }
  });
}

void TVXNetworkRequestFactory::setStoreFrontIdentifier(std::optional<std::string> identifier) {
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->queue.async([weak, identifier = std::move(identifier)] {
    if (auto self = weak.lock()) self->context_->storeFrontIdentifier = identifier;
  });
}

void TVXNetworkRequestFactory::setSubscriptionInfo(std::optional<std::string> info) {
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->queue.async([weak, info = std::move(info)] {
    if (auto self = weak.lock()) self->context_->subscriptionInfo = info;
  });
}

void TVXNetworkRequestFactory::setInstalledDictionaries(std::optional<std::string> dictionaries) {
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->queue.async([weak, dictionaries = std::move(dictionaries)] {
    if (auto self = weak.lock()) self->context_->installedDictionaries = dictionaries;
  });
}

void TVXNetworkRequestFactory::flushContextAccessQueue() { context_->queue.sync([] {}); }

int TVXNetworkRequestFactory::proxyGetStatus() {
  if (!assembly_.useMarvola()) return 0;
  bool on = false;
  context_->queue.sync([&] {
    const Dictionary& c = context_->proxyConfiguration;
    const auto enabled = c.find("enabled");
    const auto proxy = c.find("proxy");
    on = enabled != c.end() && enabled->second.asBool().value_or(false) && proxy != c.end() && proxy->second.string();
  });
  return on ? 1 : 0;
}

std::optional<std::string> TVXNetworkRequestFactory::proxyURL() {
  if (proxyGetStatus() != 1) return std::nullopt;
  std::optional<std::string> url;
  context_->queue.sync([&] {
    const auto proxy = context_->proxyConfiguration.find("proxy");
    if (proxy != context_->proxyConfiguration.end() && proxy->second.string()) url = *proxy->second.string();
  });
  if (!url || url->find("://") == std::string::npos) return std::nullopt;
  return url;
}

std::optional<std::string> TVXNetworkRequestFactory::geoLocationLatLng() {
  std::optional<std::string> out;
  context_->queue.sync([&] { out = context_->geoLocationLatLng; });
  return out;
}

std::optional<std::string> TVXNetworkRequestFactory::geoLocationSource() {
  std::optional<std::string> out;
  context_->queue.sync([&] { out = context_->geoLocationSource; });
  return out;
}

std::optional<std::string> TVXNetworkRequestFactory::lookupGeoLocationLatLng() {
  std::optional<std::string> out;
  context_->queue.sync([&] { out = context_->lookupGeoLocationLatLng; });
  return out;
}

std::optional<std::string> TVXNetworkRequestFactory::geoDeviceCountryCode() {
  std::optional<std::string> out;
  context_->queue.sync([&] { out = context_->geoDeviceCountryCode; });
  return out;
}

std::vector<TVXQueryItem> TVXNetworkRequestFactory::debuggingQueryItems() {
  std::vector<TVXQueryItem> out;
  context_->queue.sync([&] { out = context_->debuggingQueryItems; });
  return out;
}

}  // namespace tavix
