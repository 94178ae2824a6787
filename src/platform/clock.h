// The one source of time and of delayed work.
//
// No component reads the system clock or sleeps: each takes a Clock and asks it for now() and for
// timers. The daemon runs on a SystemClock; tests run on a VirtualClock whose time moves only when
// the test says, so a 900-second session plays out in microseconds.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/dispatch.h"
#include "platform/time.h"

namespace tavix::platform {

// Cancels a pending timer. Copies share the timer; dropping every copy does not cancel it.
class TimerHandle {
 public:
  TimerHandle() = default;
  // After cancel() returns the task will not start (a task already running finishes).
  void cancel();
  bool isCancelled() const;

 private:
  friend class SystemClock;
  friend class VirtualClock;
  explicit TimerHandle(std::shared_ptr<std::atomic<bool>> flag) : cancelled_(std::move(flag)) {}
  std::shared_ptr<std::atomic<bool>> cancelled_;
};

class Clock {
 public:
  virtual ~Clock() = default;

  // The current wall-clock time.
  virtual TimePoint now() const = 0;

  // Runs `task` on `queue` once `delay` has passed (at once for a delay of zero or less).
  // The queue must outlive the timer, or the timer must be cancelled before the queue goes.
  virtual TimerHandle after(Duration delay, SerialQueue& queue, Task task) = 0;

  // Blocks until `ready()` holds or `timeout` has passed on this clock, and answers ready().
  // `lock` holds the mutex that guards what ready() reads; whoever makes it true notifies
  // `signal` under that mutex. The lock is held again on return.
  virtual bool waitFor(std::unique_lock<std::mutex>& lock, std::condition_variable& signal, Duration timeout,
                       const std::function<bool()>& ready) = 0;
};

// Real time: timers are Asio steady timers on the pool, so they are not moved by wall-clock jumps.
class SystemClock final : public Clock {
 public:
  explicit SystemClock(DispatchPool& pool) : pool_(pool) {}
  TimePoint now() const override;
  TimerHandle after(Duration delay, SerialQueue& queue, Task task) override;
  bool waitFor(std::unique_lock<std::mutex>& lock, std::condition_variable& signal, Duration timeout,
               const std::function<bool()>& ready) override;

 private:
  DispatchPool& pool_;
};

// Test time. Starts at a fixed date and moves only through advance().
// Threading: now() and after() are safe from any thread; advance() is for the test thread only
// (never from a queue, since it waits for fired tasks on their queues).
class VirtualClock final : public Clock {
 public:
  // 2026-01-01 00:00:00 UTC unless told otherwise.
  explicit VirtualClock(TimePoint start = fromUnixSeconds(1767225600));
  TimePoint now() const override;
  TimerHandle after(Duration delay, SerialQueue& queue, Task task) override;
  // Parks the caller until ready() holds or advance() reaches the deadline.
  bool waitFor(std::unique_lock<std::mutex>& lock, std::condition_variable& signal, Duration timeout,
               const std::function<bool()>& ready) override;

  // Moves time forward by `by`. Every timer that falls due on the way fires in due order (ties in
  // the order they were set), with now() equal to its due time, and runs to completion on its
  // queue before the next one. Timers set by fired tasks fire too if they fall within the window.
  void advance(Duration by);

  // Timers set and neither fired nor cancelled.
  std::size_t pendingTimers() const;

  // Callers blocked in waitFor() right now.
  std::size_t parkedWaiters() const;
  // Blocks until at least `count` callers are parked in waitFor(): the barrier a test passes
  // before it advances time past their deadline.
  void awaitParked(std::size_t count) const;

 private:
  struct Pending {
    SerialQueue* queue;
    Task task;
    std::shared_ptr<std::atomic<bool>> cancelled;
  };
  // A caller inside waitFor(). `guard` keeps its mutex and condition alive while advance()
  // wakes it: the waiter takes `guard` before it leaves.
  struct Parked {
    std::mutex guard;
    std::mutex* mutex;
    std::condition_variable* signal;
    TimePoint deadline;
    bool gone = false;
  };
  void wakeDueWaiters();

  mutable std::mutex lock_;
  mutable std::condition_variable parkedChanged_;
  std::vector<std::shared_ptr<Parked>> parked_;
  TimePoint now_;
  std::uint64_t sequence_ = 0;
  std::multimap<std::pair<TimePoint, std::uint64_t>, Pending> timers_;
};

// Runs a task every `interval` until stopped or destroyed. Re-arms after each run, so a slow task
// delays the next run instead of piling runs up. Not thread-safe: start and stop it on one queue.
class RepeatingTimer {
 public:
  RepeatingTimer(Clock& clock, SerialQueue& queue) : clock_(clock), queue_(queue) {}
  ~RepeatingTimer() { stop(); }
  RepeatingTimer(const RepeatingTimer&) = delete;
  RepeatingTimer& operator=(const RepeatingTimer&) = delete;

  void start(Duration interval, Task task);
  void stop();
  bool isRunning() const { return state_ != nullptr; }

 private:
  struct State;
  static void arm(const std::shared_ptr<State>& state);

  Clock& clock_;
  SerialQueue& queue_;
  std::shared_ptr<State> state_;
};

}  // namespace tavix::platform
