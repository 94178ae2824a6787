// What the request factory's two halves share: the context snapshot and the helpers both use.
// Private to network/: request_context.cpp keeps the snapshot current, request_factory.cpp reads it
// to build requests.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "context/location.h"
#include "context/motion.h"
#include "core/logging.h"
#include "network/locale_context.h"
#include "network/request_factory.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/notification_center.h"
#include "platform/property_value.h"

namespace tavix {

namespace request_factory_internal {

inline platform::Logger& requestLog() { return TavixLogForCategory(TavixLoggingCategoryRequest); }

inline bool nonEmpty(const std::optional<std::string>& s) { return s && !s->empty(); }

inline bool isAuthorized(int status) {
  return status == TVXLocationAuthorizationAlways || status == TVXLocationAuthorizationWhenInUse;
}

// The location source of a request that may not carry a location: the user said no.
inline constexpr const char* kNoLocationUser = "userno";

}  // namespace request_factory_internal

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
  platform::Dictionary allSilhouetteTopics;

  std::optional<TVXLocation> geoLocation;
  std::optional<std::string> geoLocationLatLng;
  std::optional<std::string> geoLocationSource;
  std::optional<std::string> lookupGeoLocationLatLng;
  std::vector<std::string> supportedGeoLocationSources;
  // The bag's "marvola_configuration" as the network-service proxy holds it.
  platform::Dictionary proxyConfiguration;

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

}  // namespace tavix
