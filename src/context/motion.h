// MotionManager: the owner of the device's motion-activity service. The request factory maps each
// activity to a transportation mode.
//
// Linux has no motion coprocessor, so the daemon's MotionManager is backed by defaults
// (DefaultsMotionManager); tests use their own subclass.
#pragma once

#include <memory>
#include <atomic>
#include <cstdint>
#include <optional>
#include <string>

namespace tavix {

namespace platform {
class DispatchPool;
class UserDefaults;
}  // namespace platform

// One motion activity: any mix of the flags may be set, as the service reports them.
struct TVXMotionActivity {
  bool stationary = false;
  bool automotive = false;
  bool walking = false;
  bool running = false;
  bool cycling = false;
};

// Stationary → 2, automotive → 6, walking → 3, running → 4, cycling → 5 (tested in that
// order), none of these → 1.
int transportationModeForActivity(const TVXMotionActivity& activity);

class MotionManagerDelegate {
 public:
  virtual ~MotionManagerDelegate() = default;
  virtual void didUpdateMotionActivity(const TVXMotionActivity& activity) = 0;
};

// Threading: every method is safe from any thread; activities arrive on the manager's own queue.
class MotionManager {
 public:
  virtual ~MotionManager() = default;
  // Starts updates for `delegate` (held weakly) until stopUpdatingMotionActivity().
  virtual void startUpdatingMotionActivity(std::weak_ptr<MotionManagerDelegate> delegate) = 0;
  // Stops updates and forgets the delegate.
  virtual void stopUpdatingMotionActivity() = 0;
};

// A MotionManager over the string default "TVXMotionActivity": one of "stationary",
// "automotive", "walking", "running", "cycling" (anything else is an activity with no flag).
// Each start of updates delivers it once, from the pool; nothing when the key is not set.
class DefaultsMotionManager final : public MotionManager {
 public:
  DefaultsMotionManager(const platform::UserDefaults& defaults, platform::DispatchPool& pool);
  void startUpdatingMotionActivity(std::weak_ptr<MotionManagerDelegate> delegate) override;
  void stopUpdatingMotionActivity() override;

  std::optional<TVXMotionActivity> configuredActivity() const;

 private:
  const platform::UserDefaults& defaults_;
  platform::DispatchPool& pool_;
  // Bumped by every start and stop; a delivery from an older start is dropped.
  std::shared_ptr<std::atomic<std::uint64_t>> generation_ = std::make_shared<std::atomic<std::uint64_t>>(0);
};

}  // namespace tavix
