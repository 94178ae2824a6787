// Serial queues on one shared thread pool: the daemon's concurrency model.
//
// Every object that owns state owns a SerialQueue and runs its private operations on it. Public
// operations hop onto the queue: reads with sync(), writes with async(). A queue is a task list
// over the process's pool, so queues cost nothing while idle and never need a thread of their own;
// sync() runs on the calling thread, so waiting callers never starve the pool.
//
// Threading: every method of SerialQueue and ReaderWriterQueue is safe from any thread.
#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <shared_mutex>
#include <string>

#include "platform/time.h"

namespace tavix::platform {

using Task = std::function<void()>;

// Names the calling thread as tools (top, /proc/<pid>/task/*/comm) show it: at most 15 bytes.
void nameThisThread(const char* name);

// The process's worker pool. One per process, created at start-up (or per test) and outliving
// every queue made on it. The destructor stops the workers after the queued work has drained.
//
// Workers start as work needs them, up to the limit, and one that has found nothing to do for
// `idleExit` leaves: an idle process keeps no worker and no timer. Sockets, timers and signals
// (nativeContext()) run on a reactor of their own, started by the first that needs it.
//
// The reactor is led by one thread at a time, which waits on the sockets and timers and runs
// their handlers; an event wakes no other thread. A handler may answer a call in place
// (mayAnswerOnReactor()): should the call wait, its thread hands the reactor to a standby thread
// first (aboutToWait()), so that no socket or timer ever waits with it, and stands by itself once
// the call is done. Standby threads start as hand-offs need them and leave after `idleExit`.
class DispatchPool {
 public:
  explicit DispatchPool(unsigned threads = 0, Duration idleExit = seconds(10));  // 0: a size fit for the machine
  ~DispatchPool();
  DispatchPool(const DispatchPool&) = delete;
  DispatchPool& operator=(const DispatchPool&) = delete;

  // Runs `task` on some pool thread: the platform's "global queue". No ordering between tasks.
  // Posted from a pool task, it runs on the same thread once that task is done (unless the task
  // waits first): work that follows from work wakes no other thread.
  void post(Task task);

  // Waits until every task posted so far, and everything they post in turn, has run.
  // Only for tests and shutdown; never call it from a pool thread.
  void drain();

  // Drains, then stops the workers and destroys the queued tasks that will never run: nothing runs
  // on the pool afterwards, so the objects whose queues live on it can be destroyed safely. Work
  // queued later never runs (it is destroyed with the pool); a sync() still does, on its caller's
  // thread. From the thread that owns the pool. The destructor calls it.
  void shutdown();

  // The most workers that run at once.
  unsigned threadCount() const;

  // From a handler of the reactor: answers true when a call may run here, in place, because
  // another thread can take the reactor over should the call wait. Elsewhere false: the caller
  // hands its work to a queue.
  bool mayAnswerOnReactor() const;

  // Every wait of the daemon calls this just before it blocks: on the thread leading a reactor it
  // hands the reactor to another thread first. Cheap, and a no-op on any other thread.
  static void aboutToWait();

  // The Asio io_context behind the pool's sockets and timers, as an opaque pointer for the few
  // platform pieces that need it. Cast with asioContext() in platform sources. The first call
  // starts the reactor. Its handlers are short, or call aboutToWait() before they block.
  void* nativeContext();

 private:
  friend class SerialQueue;
  // A queue made on the pool: `dropPending` runs once the pool has stopped, while `queue` lives.
  void registerQueue(std::weak_ptr<void> queue, std::function<void()> dropPending);
  void dropPending();
  void beginWork();
  void endWork();
  void handOffReactor();
  // Puts a task already counted in flight on the pool's list, waking or starting a worker.
  void enqueue(Task task);

  struct Impl;
  std::unique_ptr<Impl> impl_;
};

// A serial queue: tasks run one at a time, in submission order, on some pool thread.
class SerialQueue {
 public:
  struct Impl;  // the task list, private to dispatch.cpp

  SerialQueue(DispatchPool& pool, std::string label);
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const { return label_; }
  DispatchPool& pool() const;

  // Queues `task` and returns at once.
  void async(Task task);

  // As async(), but when nobody is on the queue and nothing waits on it, runs `task` here and now
  // instead: the same order, without waking a second thread. For a caller that would otherwise
  // only hand the task over and wait for the next event (a reactor handler, for instance).
  void runHereOrAsync(Task task);

  // Runs `task` on the queue and waits for it; the task runs on the calling thread, after every
  // task queued before it (which the caller may run too). Never call sync() on the queue you are running
  // on (directly or through a chain of sync calls): that would wait on itself for ever, so it is
  // checked and stops the process with a message naming the queue.
  void sync(const Task& task);

  // True while the calling thread runs a task of this queue.
  bool isCurrent() const;

  // Aborts with `what` unless the caller runs on this queue: the sequence check of private
  // operations. Compiled in debug builds only.
  void assertCurrent(const char* what) const;

 private:
  std::string label_;
  std::shared_ptr<Impl> impl_;  // shared with drain jobs still posted when the queue goes
};

// A dispatch group: notify runs on `queue` once every enter() has been matched by a leave(). The
// group starts entered once, for whoever fills it, who leaves last. Safe from any thread; share it
// (shared_ptr) with the work it waits for.
class DispatchGroup {
 public:
  DispatchGroup(SerialQueue& queue, Task notify) : queue_(queue), notify_(std::move(notify)) {}
  DispatchGroup(const DispatchGroup&) = delete;
  DispatchGroup& operator=(const DispatchGroup&) = delete;
  void enter() { ++pending_; }
  void leave() {
    if (--pending_ == 0) queue_.async(std::move(notify_));
  }

 private:
  std::atomic<int> pending_{1};
  SerialQueue& queue_;
  Task notify_;
};

// "Synchronous reads, barrier writes": reads run on the caller's thread and may overlap one
// another; a write waits for reads in progress, runs alone, and every read submitted after the
// write was submitted sees its effect. Writes run in submission order.
class ReaderWriterQueue {
 public:
  ReaderWriterQueue(DispatchPool& pool, std::string label);
  ~ReaderWriterQueue();

  // Runs `task` on the calling thread under shared access, after every earlier write.
  void read(const Task& task);

  // Queues `task` as a barrier and returns at once.
  void writeAsync(Task task);

  // Runs `task` as a barrier and waits for it. Not from inside a read or write of this queue.
  void writeSync(const Task& task);

 private:
  void runWrite(const Task& task);

  SerialQueue writes_;
  std::shared_mutex access_;
  std::mutex progressLock_;
  std::condition_variable progress_;
  std::uint64_t submittedWrites_ = 0;
  std::uint64_t finishedWrites_ = 0;
};

}  // namespace tavix::platform
