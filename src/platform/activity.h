// Background activities: named periodic jobs with the RUN / CONTINUE / DONE life cycle.
//
// An activity is checked in once with its handler; the handler is called at once with CHECK_IN,
// and then with RUN each time the activity falls due (every `interval`) or is fired by hand. A
// handler that returns with the state still RUN has finished (DONE). One that needs longer sets
// CONTINUE and later DONE, from any thread. A run in progress holds a keep-alive transaction
// named after the activity, and a due time that comes during a run is skipped.
//
// Threading: the scheduler's methods are safe from any thread; handlers run on the scheduler's
// queue. Activity::setState is safe from any thread.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/clock.h"
#include "platform/transactions.h"

namespace tavix::platform {

enum class ActivityState { CheckIn, Wait, Run, Defer, Continue, Done };

const char* activityStateName(ActivityState state);

class ActivityScheduler;

class Activity {
 public:
  const std::string& name() const { return name_; }
  ActivityState state() const;

  // Allowed: RUN → CONTINUE, DONE or DEFER; CONTINUE → DONE or DEFER; and setting the current
  // state again. Anything else fails and changes nothing.
  bool setState(ActivityState next);

 private:
  friend class ActivityScheduler;
  Activity(ActivityScheduler* scheduler, std::string name) : scheduler_(scheduler), name_(std::move(name)) {}

  ActivityScheduler* scheduler_;
  const std::string name_;
  mutable std::mutex lock_;
  ActivityState state_ = ActivityState::CheckIn;
  TransactionTracker::Transaction transaction_;
};

class ActivityScheduler {
 public:
  using Handler = std::function<void(const std::shared_ptr<Activity>&)>;

  // `queue` runs the handlers; it, the clock and the tracker must outlive the scheduler.
  ActivityScheduler(Clock& clock, SerialQueue& queue, TransactionTracker& transactions);
  ~ActivityScheduler();

  // Registers `name` (replacing an earlier registration) and calls the handler with CHECK_IN.
  // A zero or negative interval means: only when fired by hand.
  void checkIn(const std::string& name, Duration interval, Handler handler);

  // Fires `name` now. False when no such activity is checked in, or a run is in progress.
  bool runNow(const std::string& name);

  std::optional<ActivityState> state(const std::string& name) const;

 private:
  friend class Activity;
  struct Entry {
    std::shared_ptr<Activity> activity;
    Duration interval;
    Handler handler;
    TimerHandle timer;
  };

  void start(const std::string& name);        // on queue_
  void finished(const std::string& name);     // after DONE or DEFER, from any thread
  void scheduleNext(Entry& entry);            // with lock_ held

  Clock& clock_;
  SerialQueue& queue_;
  TransactionTracker& transactions_;
  mutable std::mutex lock_;
  std::map<std::string, Entry> entries_;
};

}  // namespace tavix::platform
