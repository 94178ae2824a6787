#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <mutex>

#include "context/location.h"
#include "context/motion.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

using platform::Dictionary;

struct Recorder final : LocationManagerDelegate, MotionManagerDelegate {
  void didUpdateLocations(const std::vector<TVXLocation>& l) override {
    std::lock_guard<std::mutex> hold(lock);
    locations.insert(locations.end(), l.begin(), l.end());
  }
  void didFailWithError(const std::string&) override { ++failures; }
  void didChangeAuthorization(int) override {}
  void didUpdateMotionActivity(const TVXMotionActivity& a) override {
    std::lock_guard<std::mutex> hold(lock);
    modes.push_back(transportationModeForActivity(a));
  }
  std::mutex lock;
  std::vector<TVXLocation> locations;
  std::vector<int> modes;
  std::atomic<int> failures{0};
};

struct StandInTest : ::testing::Test {
  testing::TempHome home;
  platform::DispatchPool pool{1};
  platform::UserDefaults defaults{home.config(), "com.norvel.tavixd"};
  std::shared_ptr<Recorder> recorder = std::make_shared<Recorder>();
};

TEST_F(StandInTest, LocationDeliversTheConfiguredFixOrAFailure) {
  platform::VirtualClock clock;
  DefaultsLocationManager manager(defaults, clock, pool);

  EXPECT_EQ(manager.authorizationStatus(), TVXLocationAuthorizationDenied);
  manager.startUpdatingLocation(recorder);
  pool.drain();
  EXPECT_EQ(recorder->failures.load(), 1);

  defaults.setObject("TVXFixedLocation", Dictionary{{"latitude", 48.5}, {"longitude", -2}, {"type", 1}});
  EXPECT_EQ(manager.authorizationStatus(), TVXLocationAuthorizationWhenInUse);
  defaults.setObject("TVXNewsLocationAuthorizationStatus", 2);
  EXPECT_EQ(manager.newsAuthorizationStatus(), TVXLocationAuthorizationDenied);
  manager.startUpdatingLocation(recorder);
  pool.drain();
  ASSERT_EQ(recorder->locations.size(), 1u);
  EXPECT_DOUBLE_EQ(recorder->locations[0].longitude, -2);
  EXPECT_DOUBLE_EQ(recorder->locations[0].horizontalAccuracy, 1000);  // none given: a city's

  defaults.setObject("TVXFixedLocation", Dictionary{{"latitude", 91}, {"longitude", 0}});
  EXPECT_FALSE(manager.fixedLocation());  // out of range is no location

  DefaultsRoutineManager routine(defaults);
  std::optional<int> mode = 5;
  defaults.setObject("TVXRoutineMode", -1);
  EXPECT_TRUE(routine.modeForLocation({}, &mode) && mode == -1);
  defaults.setObject("TVXRoutineMode", "often");  // not a number: a failure, not "no mode"
  EXPECT_FALSE(routine.modeForLocation({}, &mode));
}

TEST_F(StandInTest, MotionMapsActivitiesInPrecedenceOrderAndStopDropsPendingDeliveries) {
  EXPECT_EQ(transportationModeForActivity({}), 1);
  EXPECT_EQ(transportationModeForActivity({.stationary = true, .automotive = true}), 2);
  EXPECT_EQ(transportationModeForActivity({.automotive = true, .walking = true}), 6);

  DefaultsMotionManager manager(defaults, pool);
  defaults.setObject("TVXMotionActivity", "cycling");
  manager.startUpdatingMotionActivity(recorder);
  pool.drain();
  EXPECT_EQ(recorder->modes, std::vector<int>{5});

  platform::SerialQueue hold(pool, "test.hold");
  std::promise<void> release;
  auto released = release.get_future().share();
  // Keep the pool's one thread busy so the delivery is still pending when we stop.
  hold.async([released] { released.wait(); });
  manager.startUpdatingMotionActivity(recorder);
  manager.stopUpdatingMotionActivity();
  release.set_value();
  pool.drain();
  EXPECT_EQ(recorder->modes, std::vector<int>{5});
}

}  // namespace
}  // namespace tavix
