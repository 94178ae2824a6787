#include "platform/clock.h"

#include <algorithm>
#include <cmath>

#include <asio/steady_timer.hpp>

#include "platform/asio_context.h"

namespace tavix::platform {

double toUnixSeconds(TimePoint t) {
  return std::chrono::duration<double>(t.time_since_epoch()).count();
}

TimePoint fromUnixSeconds(double s) { return TimePoint(seconds(s)); }

TimePoint addSeconds(TimePoint t, double s) {
  // Within a century either way the sum cannot overflow, and stays exact to the nanosecond.
  if (std::abs(s) < 3.2e9) return t + seconds(s);
  return fromUnixSeconds(toUnixSeconds(t) + s);
}

void TimerHandle::cancel() {
  if (cancelled_) cancelled_->store(true);
}

bool TimerHandle::isCancelled() const { return cancelled_ && cancelled_->load(); }

TimePoint SystemClock::now() const { return std::chrono::system_clock::now(); }

TimerHandle SystemClock::after(Duration delay, SerialQueue& queue, Task task) {
  auto cancelled = std::make_shared<std::atomic<bool>>(false);
  if (delay <= Duration::zero()) {
    queue.async([cancelled, task = std::move(task)] {
      if (!cancelled->load()) task();
    });
    return TimerHandle(cancelled);
  }
  auto timer = std::make_shared<asio::steady_timer>(asioContext(pool_));
  timer->expires_after(std::chrono::duration_cast<asio::steady_timer::duration>(delay));
  // A cancelled timer still wakes once at its due time and then does nothing: cheaper and safer
  // than touching the Asio timer from another thread.
  timer->async_wait([timer, cancelled, &queue, task = std::move(task)](const std::error_code& ec) mutable {
    if (ec || cancelled->load()) return;
    queue.async([cancelled, task = std::move(task)] {
      if (!cancelled->load()) task();
    });
  });
  return TimerHandle(cancelled);
}

bool SystemClock::waitFor(std::unique_lock<std::mutex>& lock, std::condition_variable& signal, Duration timeout,
                          const std::function<bool()>& ready) {
  if (ready()) return true;
  DispatchPool::aboutToWait();
  // The condition variable measures on the steady clock, like the timers.
  return signal.wait_for(lock, std::max(timeout, Duration::zero()), ready);
}

VirtualClock::VirtualClock(TimePoint start) : now_(start) {}

bool VirtualClock::waitFor(std::unique_lock<std::mutex>& lock, std::condition_variable& signal, Duration timeout,
                           const std::function<bool()>& ready) {
  if (ready()) return true;
  DispatchPool::aboutToWait();
  auto parked = std::make_shared<Parked>();
  parked->mutex = lock.mutex();
  parked->signal = &signal;
  {
    std::lock_guard<std::mutex> guard(lock_);
    parked->deadline = now_ + std::max(timeout, Duration::zero());
    parked_.push_back(parked);
  }
  parkedChanged_.notify_all();
  bool result;
  for (;;) {
    if ((result = ready())) break;
    // advance() moves now_ before it takes our mutex to notify, so this check cannot miss it.
    if (now() >= parked->deadline) break;
    signal.wait(lock);
  }
  // advance() takes guard, then our mutex: let go of the mutex before taking guard.
  lock.unlock();
  {
    std::lock_guard<std::mutex> hold(parked->guard);
    parked->gone = true;
  }
  {
    std::lock_guard<std::mutex> guard(lock_);
    std::erase(parked_, parked);
  }
  parkedChanged_.notify_all();
  lock.lock();
  return result;
}

void VirtualClock::wakeDueWaiters() {
  std::vector<std::shared_ptr<Parked>> due;
  {
    std::lock_guard<std::mutex> guard(lock_);
    for (const auto& p : parked_) {
      if (p->deadline <= now_) due.push_back(p);
    }
  }
  for (const auto& p : due) {
    std::lock_guard<std::mutex> hold(p->guard);
    if (p->gone) continue;
    // Under the waiter's own mutex, so the wake cannot fall between its check and its wait.
    std::lock_guard<std::mutex> waiter(*p->mutex);
    p->signal->notify_all();
  }
}

std::size_t VirtualClock::parkedWaiters() const {
  std::lock_guard<std::mutex> guard(lock_);
  return parked_.size();
}

void VirtualClock::awaitParked(std::size_t count) const {
  std::unique_lock<std::mutex> guard(lock_);
  parkedChanged_.wait(guard, [&] { return parked_.size() >= count; });
}

TimePoint VirtualClock::now() const {
  std::lock_guard<std::mutex> guard(lock_);
  return now_;
}

TimerHandle VirtualClock::after(Duration delay, SerialQueue& queue, Task task) {
  auto cancelled = std::make_shared<std::atomic<bool>>(false);
  std::lock_guard<std::mutex> guard(lock_);
  const TimePoint due = now_ + std::max(delay, Duration::zero());
  timers_.emplace(std::make_pair(due, sequence_++), Pending{&queue, std::move(task), cancelled});
  return TimerHandle(cancelled);
}

void VirtualClock::advance(Duration by) {
  TimePoint end;
  {
    std::lock_guard<std::mutex> guard(lock_);
    end = now_ + by;
  }
  for (;;) {
    Pending next;
    {
      std::lock_guard<std::mutex> guard(lock_);
      auto first = timers_.begin();
      if (first == timers_.end() || first->first.first > end) {
        now_ = end;
        break;
      }
      now_ = std::max(now_, first->first.first);
      next = std::move(first->second);
      timers_.erase(first);
    }
    wakeDueWaiters();
    if (next.cancelled->load()) continue;
    next.queue->sync([&] {
      if (!next.cancelled->load()) next.task();
    });
  }
  wakeDueWaiters();
}

std::size_t VirtualClock::pendingTimers() const {
  std::lock_guard<std::mutex> guard(lock_);
  std::size_t n = 0;
  for (const auto& [key, pending] : timers_) n += pending.cancelled->load() ? 0 : 1;
  return n;
}

struct RepeatingTimer::State {
  Clock& clock;
  SerialQueue& queue;
  Duration interval;
  Task task;
  TimerHandle pending;
  bool stopped = false;
};

void RepeatingTimer::arm(const std::shared_ptr<State>& state) {
  std::weak_ptr<State> weak = state;
  state->pending = state->clock.after(state->interval, state->queue, [weak] {
    auto s = weak.lock();
    if (!s || s->stopped) return;
    s->task();
    if (!s->stopped) arm(s);
  });
}

void RepeatingTimer::start(Duration interval, Task task) {
  stop();
  state_ = std::make_shared<State>(State{clock_, queue_, interval, std::move(task), {}});
  arm(state_);
}

void RepeatingTimer::stop() {
  if (!state_) return;
  state_->stopped = true;
  state_->pending.cancel();
  state_.reset();
}

}  // namespace tavix::platform
