// LocationManager: the owner of the device's location service, and the maps-service pass-throughs
// the request factory reads. The policy (when to sample, what may be sent) lives in the request
// factory; this is only the source.
//
// Linux has no system location service, so the daemon's LocationManager is backed by defaults
// (DefaultsLocationManager, below); tests use their own subclass.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/clock.h"

namespace tavix {

namespace platform {
class Clock;
class DispatchPool;
class UserDefaults;
}  // namespace platform

// Authorisation states, as the location service reports them.
enum TVXLocationAuthorizationStatus : int {
  TVXLocationAuthorizationNotDetermined = 0,
  TVXLocationAuthorizationRestricted = 1,
  TVXLocationAuthorizationDenied = 2,
  TVXLocationAuthorizationAlways = 3,
  TVXLocationAuthorizationWhenInUse = 4,
};

// The location service's source codes of a fix; any other code is an unknown source.
enum TVXLocationSourceType : int {
  TVXLocationSourceTypeSatellite = 1,
  TVXLocationSourceTypeSatelliteAssisted = 2,
  TVXLocationSourceTypeSatelliteDifferential = 3,
  TVXLocationSourceTypeWiFi = 4,
  TVXLocationSourceTypeWiFiScan = 5,
  TVXLocationSourceTypeCell = 6,
  TVXLocationSourceTypeCellTriangulated = 7,
  TVXLocationSourceTypeCellTower = 8,
  TVXLocationSourceTypeSatelliteFused = 9,
};

// One fix; `type` is a TVXLocationSourceType code.
struct TVXLocation {
  double latitude = 0;
  double longitude = 0;
  double horizontalAccuracy = 0;  // metres
  int type = 0;
  platform::TimePoint timestamp;
};

// The maps service's user session: id, sequence number and session-relative time.
struct TVXMapsUserSession {
  std::string sessionId;
  int sequenceNumber = 0;
  double relativeTimestamp = 0;
};

// What the location service tells its delegate. Calls arrive on any thread.
class LocationManagerDelegate {
 public:
  virtual ~LocationManagerDelegate() = default;
  virtual void didUpdateLocations(const std::vector<TVXLocation>& locations) = 0;
  virtual void didFailWithError(const std::string& error) = 0;
  virtual void didChangeAuthorization(int status) = 0;
};

// Threading: every method is safe from any thread.
class LocationManager {
 public:
  virtual ~LocationManager() = default;

  // Starts updates for `delegate` (held weakly: a gone delegate hears nothing). Updates go on
  // until stopUpdatingLocation().
  virtual void startUpdatingLocation(std::weak_ptr<LocationManagerDelegate> delegate) = 0;
  virtual void stopUpdatingLocation() = 0;

  virtual int authorizationStatus() const = 0;
  // The news reader's own authorisation.
  virtual int newsAuthorizationStatus() const = 0;
  virtual bool locationServicesEnabled() const = 0;

  // Maps-service pass-throughs; empty when unknown.
  virtual std::optional<std::string> mapsEnvironment() const = 0;
  virtual std::optional<std::string> getMapsClientMetadata() const = 0;  // base64 text
  virtual std::optional<std::string> getDeviceCountryCode() const = 0;
  virtual std::optional<TVXMapsUserSession> getMapsUserSessionEntityAndReset(bool reset) = 0;
};

// The routine service: whether the user is in a familiar place. Modes -1, 0 or 1.
class RoutineManager {
 public:
  virtual ~RoutineManager() = default;
  // The mode at a location, left empty when the service has none. False when the service fails.
  virtual bool modeForLocation(const TVXLocation& location, std::optional<int>* mode) = 0;
};

// A LocationManager over defaults, read on every call:
//   "TVXFixedLocation"  dictionary {"latitude": number, "longitude": number,
//                       "accuracy": metres (default 1000), "type": source code (default 4)}.
//                       Each start of updates delivers it once, timestamped now, from the pool.
//                       Without it, a start of updates reports a failure.
//   "TVXLocationAuthorizationStatus"     integer; default 4 when a fixed location is set, else 2
//   "TVXNewsLocationAuthorizationStatus" integer; default: the status above
//   "TVXLocationServicesEnabled"         boolean; default true
//   "TVXMapsEnvironment", "TVXMapsClientMetadata", "TVXDeviceCountryCode"  strings
// It has no maps user session.
class DefaultsLocationManager final : public LocationManager {
 public:
  // All three must outlive this object.
  DefaultsLocationManager(const platform::UserDefaults& defaults, platform::Clock& clock, platform::DispatchPool& pool);

  void startUpdatingLocation(std::weak_ptr<LocationManagerDelegate> delegate) override;
  void stopUpdatingLocation() override {}
  int authorizationStatus() const override;
  int newsAuthorizationStatus() const override;
  bool locationServicesEnabled() const override;
  std::optional<std::string> mapsEnvironment() const override;
  std::optional<std::string> getMapsClientMetadata() const override;
  std::optional<std::string> getDeviceCountryCode() const override;
  std::optional<TVXMapsUserSession> getMapsUserSessionEntityAndReset(bool) override { return std::nullopt; }

  // The configured fix, timestamped now; empty when none is configured or it is malformed.
  std::optional<TVXLocation> fixedLocation() const;

 private:
  std::optional<std::string> nonEmptyString(const char* key) const;

  const platform::UserDefaults& defaults_;
  platform::Clock& clock_;
  platform::DispatchPool& pool_;
};

// A RoutineManager over the integer default "TVXRoutineMode": no mode when it is not set, a
// failure when it is set to something that is not an integer.
class DefaultsRoutineManager final : public RoutineManager {
 public:
  explicit DefaultsRoutineManager(const platform::UserDefaults& defaults) : defaults_(defaults) {}
  bool modeForLocation(const TVXLocation& location, std::optional<int>* mode) override;

 private:
  const platform::UserDefaults& defaults_;
};

}  // namespace tavix
