#include "platform/activity.h"

namespace tavix::platform {

const char* activityStateName(ActivityState state) {
  switch (state) {
    case ActivityState::CheckIn: return "CHECK_IN";
    case ActivityState::Wait: return "WAIT";
    case ActivityState::Run: return "RUN";
    case ActivityState::Defer: return "DEFER";
    case ActivityState::Continue: return "CONTINUE";
    case ActivityState::Done: return "DONE";
  }
  return "?";
}

ActivityState Activity::state() const {
  std::lock_guard<std::mutex> guard(lock_);
  return state_;
}

bool Activity::setState(ActivityState next) {
  bool ends = false;
  TransactionTracker::Transaction held;  // closed after the lock is dropped
  {
    std::lock_guard<std::mutex> guard(lock_);
    if (next == state_) return true;
    const bool running = state_ == ActivityState::Run || state_ == ActivityState::Continue;
    const bool allowed = (state_ == ActivityState::Run && next == ActivityState::Continue) ||
                         (running && (next == ActivityState::Done || next == ActivityState::Defer));
    if (!allowed) return false;
    state_ = next;
    ends = next == ActivityState::Done || next == ActivityState::Defer;
    if (ends) held = std::move(transaction_);
  }
  held.reset();
  if (ends) scheduler_->finished(name_);
  return true;
}

ActivityScheduler::ActivityScheduler(Clock& clock, SerialQueue& queue, TransactionTracker& transactions)
    : clock_(clock), queue_(queue), transactions_(transactions) {}

ActivityScheduler::~ActivityScheduler() {
  std::lock_guard<std::mutex> guard(lock_);
  for (auto& [name, entry] : entries_) entry.timer.cancel();
}

void ActivityScheduler::checkIn(const std::string& name, Duration interval, Handler handler) {
  std::shared_ptr<Activity> activity(new Activity(this, name));
  {
    std::lock_guard<std::mutex> guard(lock_);
    auto& entry = entries_[name];
    entry.timer.cancel();
    entry = Entry{activity, interval, handler, {}};
    scheduleNext(entry);
  }
  queue_.async([activity, handler] { handler(activity); });
}

bool ActivityScheduler::runNow(const std::string& name) {
  {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = entries_.find(name);
    if (it == entries_.end()) return false;
    std::shared_ptr<Activity> activity = it->second.activity;
    std::lock_guard<std::mutex> state(activity->lock_);
    if (activity->state_ == ActivityState::Run || activity->state_ == ActivityState::Continue) return false;
    activity->state_ = ActivityState::Run;
    activity->transaction_ = transactions_.begin(name);
    it->second.timer.cancel();
  }
  // A due timer already runs on the queue: start at once, so the run (and the next due time it
  // sets) belongs to the same moment.
  if (queue_.isCurrent()) {
    start(name);
  } else {
    queue_.async([this, name] { start(name); });
  }
  return true;
}

void ActivityScheduler::start(const std::string& name) {
  std::shared_ptr<Activity> activity;
  Handler handler;
  {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = entries_.find(name);
    if (it == entries_.end()) return;
    activity = it->second.activity;
    handler = it->second.handler;
  }
  handler(activity);
  // Returning while still RUN means the work is done.
  if (activity->state() == ActivityState::Run) activity->setState(ActivityState::Done);
}

void ActivityScheduler::finished(const std::string& name) {
  std::lock_guard<std::mutex> guard(lock_);
  auto it = entries_.find(name);
  if (it != entries_.end()) scheduleNext(it->second);
}

void ActivityScheduler::scheduleNext(Entry& entry) {
  entry.timer.cancel();
  if (entry.interval <= Duration::zero()) return;
  const std::string name = entry.activity->name();
  // The timer fires on queue_; runNow re-checks that no run is in progress.
  entry.timer = clock_.after(entry.interval, queue_, [this, name] { runNow(name); });
}

std::optional<ActivityState> ActivityScheduler::state(const std::string& name) const {
  std::lock_guard<std::mutex> guard(lock_);
  auto it = entries_.find(name);
  if (it == entries_.end()) return std::nullopt;
  return it->second.activity->state();
}

}  // namespace tavix::platform
