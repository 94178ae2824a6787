#include <gtest/gtest.h>

#include <future>
#include <mutex>

#include "context/motion.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

struct Recorder final : MotionManagerDelegate {
  void didUpdateMotionActivity(const TVXMotionActivity& a) override {
    std::lock_guard<std::mutex> hold(lock);
    modes.push_back(transportationModeForActivity(a));
  }
  std::mutex lock;
  std::vector<int> modes;
};

TEST(MotionManager, MapsActivitiesInPrecedenceOrderAndStopDropsPendingDeliveries) {
  EXPECT_EQ(transportationModeForActivity({}), 1);
  EXPECT_EQ(transportationModeForActivity({.stationary = true, .automotive = true}), 2);
  EXPECT_EQ(transportationModeForActivity({.automotive = true, .walking = true}), 6);

  testing::TempHome home;
  platform::DispatchPool pool(1);
  platform::UserDefaults defaults(home.config(), "com.norvel.tavixd");
  auto recorder = std::make_shared<Recorder>();
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
