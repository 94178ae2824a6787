// The request context: the snapshot of locale, location, motion, defaults, dictionaries and the
// bag's proxy settings that every request carries, kept current on the context queue.
#include <cmath>

#include <fmt/core.h>

#include "bagview/tvx_bag.h"
#include "bagview/user_agent.h"
#include "platform/defaults.h"
#include "core/names.h"
#include "network/request_factory.h"
#include "network/request_factory_internal.h"
#include "platform/clock.h"
#include "platform/files.h"
#include "platform/json_value.h"

namespace tavix {

using platform::Dictionary;
using platform::PropertyValue;
using namespace request_factory_internal;

namespace {

constexpr const char* kNoLocationInit = "error.init";
constexpr const char* kNoLocationSlow = "slow";
constexpr const char* kNoLocationFail = "error.fail";
constexpr const char* kNoLocationBag = "bagno";
constexpr double kLocationMaxAge = 300;

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

void TVXNetworkRequestFactory::Delegate::didUpdateLocations(const std::vector<TVXLocation>& locations) {
  if (locations.empty()) return;
  TVXLocation last = locations.back();
  auto owner = owner_.lock();
  if (!owner) return;
  std::weak_ptr<TVXNetworkRequestFactory> weak = owner_;
  owner->context_->queue.async([weak, last] {
    auto self = weak.lock();
    if (!self) return;
    self->setLocationIfAllowedByBag(last);
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
    if (auto self = weak.lock()) self->setNoLocationReason(kNoLocationFail);
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
      self->startUpdatingLocation();
    } else {
      self->setNoLocationReason(kNoLocationUser);
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
    setNoLocationReason(kNoLocationUser);
    initLocationServices();
    updateLocaleContexts();
    readDefaults();
    setupDebuggingQueryItems();
  });
  // The list a past run downloaded still says what is installed.
  loadInstalledDictionaries(true);
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->defaultsSubscription = env_.defaults->addObserver([weak](const std::string& key) {
    auto self = weak.lock();
    if (!self) return;
    self->context_->queue.async([weak, key] {
      if (auto inner = weak.lock()) inner->onDefaultsChanged(key);
    });
  });
  context_->bagRegistration = env_.center->addObserver(
      kTVXBagChangeNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        auto self = weak.lock();
        if (!self) return;
        // The daemon's own view: the proxy and the location sources are not a client's to choose.
        if (auto bag = bagOfNotification(n, self->userAgent_.value_or(""))) self->didGetBag(std::move(bag));
      });
  context_->downloadRegistration = env_.center->addObserver(
      kTVXFileDownloadCompletedNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        const auto it = n.userInfo.find("identifier");
        if (it == n.userInfo.end() || it->second != PropertyValue(kTVXKnownDictionariesList)) return;
        if (auto self = weak.lock()) self->loadInstalledDictionaries(false);
      });
  // A new user identifier starts a new maps user session, so "X-Norvel-GeoSession" follows it.
  context_->guidRegistration = env_.center->addObserver(
      kTVXUserGUIDChangeNotification, nullptr, nullptr, [weak](const platform::Notification&) {
        auto self = weak.lock();
        if (!self || !self->providers_.locationManager) return;
        self->context_->queue.async([weak] {
          auto inner = weak.lock();
          if (inner && inner->providers_.locationManager) inner->providers_.locationManager->getMapsUserSessionEntityAndReset(true);
        });
      });
}

void TVXNetworkRequestFactory::setNoLocationReason(std::string reason) {
  Context& c = *context_;
  c.queue.assertCurrent("setNoLocationReason");
  c.geoLocation.reset();
  c.geoLocationLatLng.reset();
  c.lookupGeoLocationLatLng.reset();
  c.geoLocationSource = std::move(reason);
}

void TVXNetworkRequestFactory::initLocationServices() {
  auto& location = providers_.locationManager;
  bool authorized = location && isAuthorized(location->authorizationStatus());
  setNoLocationReason(authorized ? kNoLocationInit : kNoLocationUser);
}

bool TVXNetworkRequestFactory::hasRecentFix() {
  Context& c = *context_;
  if (!c.geoLocation) return false;
  double age = platform::toUnixSeconds(env_.clock->now()) - platform::toUnixSeconds(c.geoLocation->timestamp);
  return age < kLocationMaxAge;
}

void TVXNetworkRequestFactory::startUpdatingLocation() {
  Context& c = *context_;
  c.queue.assertCurrent("startUpdatingLocation");
  auto& location = providers_.locationManager;
  if (hasRecentFix()) return;
  if (!c.geoLocation && c.geoLocationSource == kNoLocationInit) setNoLocationReason(kNoLocationSlow);
  if (!location) {
    setNoLocationReason(kNoLocationUser);
    return;
  }
  int status = location->authorizationStatus();
  if (status == TVXLocationAuthorizationRestricted || status == TVXLocationAuthorizationDenied) {
    setNoLocationReason(kNoLocationUser);
  } else {
    location->startUpdatingLocation(c.delegate);
  }
}

void TVXNetworkRequestFactory::startUpdatingMotionActivity() {
  if (hasRecentFix() || !providers_.motionManager) return;
  providers_.motionManager->startUpdatingMotionActivity(context_->delegate);
}

void TVXNetworkRequestFactory::setLocation(const TVXLocation& fix) {
  Context& c = *context_;
  c.geoLocation = fix;
  c.geoLocationLatLng = fmt::format("{:f},{:f}", fix.latitude, fix.longitude);
  c.geoLocationSource = fmt::format("{},{:f}", sourceName(fix.type), fix.horizontalAccuracy);
  if (!c.lookupGeoLocationLatLng) {
    // Whole degrees, truncated toward zero, until a search shows the user wants local answers.
    c.lookupGeoLocationLatLng = fmt::format("{:f},{:f}", std::trunc(fix.latitude), std::trunc(fix.longitude));
  }
}

void TVXNetworkRequestFactory::setLocationIfAllowedByBag(const TVXLocation& fix) {
  Context& c = *context_;
  c.queue.assertCurrent("setLocationIfAllowedByBag");
  std::string source = sourceName(fix.type);
  for (const auto& allowed : c.supportedGeoLocationSources) {
    if (allowed == source) {
      setLocation(fix);
      return;
    }
  }
  setNoLocationReason(fmt::format("{}.{}", kNoLocationBag, source));
}

void TVXNetworkRequestFactory::setupDebuggingQueryItems() {
  Context& c = *context_;
  std::string text = env_.defaults->stringForKey("TVXDebugParameters").value_or("");
  requestLog().debug("processing debug parameters: ({})", text);
  if (text.empty()) return;  // an emptied default keeps the items already in force
  bool ok = false;
  c.debuggingQueryItems = parseDebugParameters(text, &ok);
}

void TVXNetworkRequestFactory::readDefaults() {
  Context& c = *context_;
  const auto& defaults = *env_.defaults;
  c.alwaysSendTophit = defaults.boolForKey("TVXAlwaysOnTophit");
  c.isManagedAccount = defaults.boolForKey("TVXManagedAccount");
  bool restricted = defaults.boolForKey("TVXDeviceRestricted");
  if (restricted != c.deviceRestricted) {
    c.deviceRestricted = restricted;
    requestLog().notice("device restriction have changed, currently restriction status is {}", restricted ? 1 : 0);
  }
  if (auto& location = providers_.locationManager) c.geoClientMetadata = location->getMapsClientMetadata();
}

// True when something the bag's identity rests on changed.
bool TVXNetworkRequestFactory::updateLocaleContexts() {
  Context& c = *context_;
  TVXLocaleSettings settings = TVXCurrentLocaleSettings(env_.defaults.get());
  bool changed = false;
  if (!(settings == c.localeSettings) || c.locale.localeIdentifier.empty()) {
    TVXLocaleContext locale = TVXComputeLocaleContext(settings);
    changed = !(locale == c.locale);
    c.localeSettings = std::move(settings);
    c.locale = std::move(locale);
  }
  std::optional<std::string> country;
  if (auto& location = providers_.locationManager) country = location->getDeviceCountryCode();
  if (!nonEmpty(country)) country = c.locale.regionCode;
  if (country != c.geoDeviceCountryCode) {
    c.geoDeviceCountryCode = country;
    changed = true;
  }
  return changed;
}

void TVXNetworkRequestFactory::notifyBagRefreshRequired() {
  // Never from inside the context queue: observers may come back into the factory.
  auto center = env_.center;
  const void* sender = this;
  env_.pool->post([center, sender] { center->post(kTVXBagRefreshRequiredNotification, sender); });
}

void TVXNetworkRequestFactory::didGetBag(std::shared_ptr<const TVXBag> bag) {
  std::vector<std::string> sources = bag->supportedGeoLocationSources();
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->queue.async([weak, sources, bag] {
    auto self = weak.lock();
    if (!self) return;
    Context& c = *self->context_;
    c.supportedGeoLocationSources = sources;
    if (!sources.empty()) {
      self->startUpdatingLocation();
      if (self->providers_.motionManager) self->providers_.motionManager->startUpdatingMotionActivity(c.delegate);
    } else {
      if (self->providers_.locationManager) self->providers_.locationManager->stopUpdatingLocation();
      self->setNoLocationReason(fmt::format("{}.{}", kNoLocationBag, "all"));
    }
  });
  env_.pool->post([weak, bag] {
    if (auto self = weak.lock()) self->updateVisibility(*bag);
  });
  auto configuration = bag->marvolaConfiguration();
  if (!configuration) {
    configuration = Dictionary{{"appRule", Dictionary{{"enable", Dictionary{{"Enabled", false}}}}}};
  }
  context_->queue.async([weak, configuration = *configuration] {
    if (auto self = weak.lock()) self->context_->proxyConfiguration = configuration;
  });
  if (providers_.proxySetCurrentConfiguration) providers_.proxySetCurrentConfiguration(*configuration, "tavixd");
}

// The installed subset of the known dictionaries, as "dicts" sends it: their identifiers, in the
// list's order, joined by commas. `quietWhenMissing` at start, when no list has come yet.
void TVXNetworkRequestFactory::loadInstalledDictionaries(bool quietWhenMissing) {
  const auto path = env_.cachesFolder / kTVXKnownDictionariesList;
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
    if (identifier->empty() || !providers_.isDictionaryInstalled(*identifier)) continue;
    if (!installed.empty()) installed += ',';
    installed += *identifier;
  }
  setInstalledDictionaries(installed.empty() ? std::nullopt : std::optional<std::string>(installed));
}

// The news reader and the messages app's hashtag images follow the bag's switch for their
// clients. Managed configuration has no Linux counterpart; its settings live in a defaults suite
// that those programs read.
void TVXNetworkRequestFactory::updateVisibility(const TVXBag& bag) {
  auto managed = env_.defaults->suite(kTVXManagedConfigurationDomain);
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

void TVXNetworkRequestFactory::onDefaultsChanged(const std::string& key) {
  if (key == "TVXDebugParameters") {
    setupDebuggingQueryItems();
  } else if (key == "TVXLocale" || key == "TVXPreferredLanguages" || key == "TVXTimeZone" ||
             key == "TVXDeviceCountryCode") {
    if (updateLocaleContexts()) notifyBagRefreshRequired();
  } else {
    readDefaults();
  }
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

void TVXNetworkRequestFactory::didUpdateSubscriptionDictionaries(const SubscriptionRecords& records) {
  // No records, no header: a bag that withdraws its whitelists withdraws what was sent.
  setSubscriptionInfo(subscriptionHeaderValue(records));
}

void TVXNetworkRequestFactory::didUpdateStorefrontIdentifier(const std::optional<std::string>& identifier) {
  setStoreFrontIdentifier(identifier);
}

void TVXNetworkRequestFactory::setInstalledDictionaries(std::optional<std::string> dictionaries) {
  std::weak_ptr<TVXNetworkRequestFactory> weak = weak_from_this();
  context_->queue.async([weak, dictionaries = std::move(dictionaries)] {
    if (auto self = weak.lock()) self->context_->installedDictionaries = dictionaries;
  });
}

void TVXNetworkRequestFactory::flushContextAccessQueue() { context_->queue.sync([] {}); }

int TVXNetworkRequestFactory::proxyGetStatus() {
  if (!useMarvola()) return 0;
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
