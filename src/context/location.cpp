#include "context/location.h"

#include "platform/defaults.h"

namespace tavix {

DefaultsLocationManager::DefaultsLocationManager(const platform::UserDefaults& defaults, platform::Clock& clock,
                                                 platform::DispatchPool& pool)
    : defaults_(defaults), clock_(clock), pool_(pool) {}

std::optional<TVXLocation> DefaultsLocationManager::fixedLocation() const {
  auto value = defaults_.objectForKey("TVXFixedLocation");
  if (!value || !value->dictionary()) return std::nullopt;
  const auto& d = *value->dictionary();
  auto number = [&](const char* key) -> std::optional<double> {
    auto it = d.find(key);
    return it == d.end() ? std::nullopt : it->second.asReal();
  };
  auto latitude = number("latitude");
  auto longitude = number("longitude");
  if (!latitude || !longitude) return std::nullopt;
  if (*latitude < -90 || *latitude > 90 || *longitude < -180 || *longitude > 180) return std::nullopt;
  TVXLocation fix;
  fix.latitude = *latitude;
  fix.longitude = *longitude;
  fix.horizontalAccuracy = number("accuracy").value_or(1000);
  fix.type = static_cast<int>(number("type").value_or(TVXLocationSourceTypeWiFi));
  fix.timestamp = clock_.now();
  return fix;
}

void DefaultsLocationManager::startUpdatingLocation(std::weak_ptr<LocationManagerDelegate> delegate) {
  // Delivered from the pool, as a real service would call back later, never inside the caller.
  pool_.post([fix = fixedLocation(), delegate = std::move(delegate)] {
    auto target = delegate.lock();
    if (!target) return;
    if (fix) {
      target->didUpdateLocations({*fix});
    } else {
      target->didFailWithError("no location configured in TVXFixedLocation");
    }
  });
}

int DefaultsLocationManager::authorizationStatus() const {
  if (auto v = defaults_.objectForKey("TVXLocationAuthorizationStatus")) {
    if (auto i = v->asInteger()) return static_cast<int>(*i);
  }
  return fixedLocation() ? TVXLocationAuthorizationWhenInUse : TVXLocationAuthorizationDenied;
}

int DefaultsLocationManager::newsAuthorizationStatus() const {
  if (auto v = defaults_.objectForKey("TVXNewsLocationAuthorizationStatus")) {
    if (auto i = v->asInteger()) return static_cast<int>(*i);
  }
  return authorizationStatus();
}

bool DefaultsLocationManager::locationServicesEnabled() const {
  auto v = defaults_.objectForKey("TVXLocationServicesEnabled");
  return !v || v->asBool().value_or(true);
}

std::optional<std::string> DefaultsLocationManager::nonEmptyString(const char* key) const {
  auto s = defaults_.stringForKey(key);
  if (s && !s->empty()) return s;
  return std::nullopt;
}

std::optional<std::string> DefaultsLocationManager::mapsEnvironment() const { return nonEmptyString("TVXMapsEnvironment"); }
std::optional<std::string> DefaultsLocationManager::getMapsClientMetadata() const {
  return nonEmptyString("TVXMapsClientMetadata");
}
std::optional<std::string> DefaultsLocationManager::getDeviceCountryCode() const {
  return nonEmptyString("TVXDeviceCountryCode");
}

bool DefaultsRoutineManager::modeForLocation(const TVXLocation&, std::optional<int>* mode) {
  mode->reset();
  auto v = defaults_.objectForKey("TVXRoutineMode");
  if (!v) return true;
  auto i = v->asInteger();
  if (!i) return false;
  *mode = static_cast<int>(*i);
  return true;
}

}  // namespace tavix
