#include "context/motion.h"

#include "platform/defaults.h"
#include "platform/dispatch.h"

namespace tavix {

int transportationModeForActivity(const TVXMotionActivity& activity) {
  if (activity.stationary) return 2;
  if (activity.automotive) return 6;
  if (activity.walking) return 3;
  if (activity.running) return 4;
  if (activity.cycling) return 5;
  return 1;
}

DefaultsMotionManager::DefaultsMotionManager(const platform::UserDefaults& defaults, platform::DispatchPool& pool)
    : defaults_(defaults), pool_(pool) {}

std::optional<TVXMotionActivity> DefaultsMotionManager::configuredActivity() const {
  auto name = defaults_.stringForKey("TVXMotionActivity");
  if (!name) return std::nullopt;
  TVXMotionActivity activity;
  activity.stationary = *name == "stationary";
  activity.automotive = *name == "automotive";
  activity.walking = *name == "walking";
  activity.running = *name == "running";
  activity.cycling = *name == "cycling";
  return activity;
}

void DefaultsMotionManager::startUpdatingMotionActivity(std::weak_ptr<MotionManagerDelegate> delegate) {
  std::uint64_t started = ++*generation_;
  auto activity = configuredActivity();
  if (!activity) return;
  pool_.post([generation = generation_, started, delegate = std::move(delegate), activity = *activity] {
    if (generation->load() != started) return;  // stopped or restarted since
    if (auto target = delegate.lock()) target->didUpdateMotionActivity(activity);
  });
}

void DefaultsMotionManager::stopUpdatingMotionActivity() { ++*generation_; }

}  // namespace tavix
