#include "platform/dispatch.h"

#include <malloc.h>
#include <pthread.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <map>
#include <optional>
#include <thread>
#include <vector>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>

#include "platform/asio_context.h"

namespace tavix::platform {

namespace {
[[noreturn]] void die(const std::string& message) {
  std::fprintf(stderr, "fatal: %s\n", message.c_str());
  std::fflush(stderr);
  std::abort();
}
}  // namespace

void nameThisThread(const char* name) { pthread_setname_np(pthread_self(), name); }

struct DispatchPool::Impl {
  Impl(unsigned limit, Duration idleExit) : limit(limit), idleExit(idleExit) {}

  void startWorker();  // with `lock` held
  void work();
  void joinExited();  // with `lock` held

  const unsigned limit;
  const Duration idleExit;

  std::mutex lock;
  std::condition_variable wake;     // a task arrived, or the pool stops
  std::condition_variable idle;     // inFlight fell to zero, or a worker left
  std::deque<Task> tasks;           // posted and not yet taken by a worker
  std::size_t inFlight = 0;         // posted through post() or a queue and not yet finished
  unsigned workers = 0;             // alive
  unsigned waiting = 0;             // alive and blocked waiting for a task
  bool stopping = false;            // shutdown() has begun: workers leave, none starts
  std::map<std::thread::id, std::thread> threads;
  std::vector<std::thread::id> exited;  // left their loop; joined by the next start or shutdown

  // The reactor: started by the first nativeContext(), stopped by shutdown().
  asio::io_context context{1};
  std::optional<asio::executor_work_guard<asio::io_context::executor_type>> reactorWork;
  std::thread reactor;

  // The queues made on the pool, so that tasks still queued when it stops can be dropped: a task
  // often holds the object that owns its queue, and would keep both alive for ever.
  struct Queue {
    std::weak_ptr<void> queue;
    std::function<void()> dropPending;
  };
  std::vector<Queue> queues;  // under `lock`
};

void DispatchPool::Impl::startWorker() {
  ++workers;
  std::thread t([this] { work(); });
  threads.emplace(t.get_id(), std::move(t));
}

void DispatchPool::Impl::joinExited() {
  // Each of them has left its loop: joining waits for no task, at most for a last trim of the heap.
  for (auto id : exited) {
    auto it = threads.find(id);
    it->second.join();
    threads.erase(it);
  }
  exited.clear();
}

void DispatchPool::Impl::work() {
  nameThisThread("tavixd-pool");
  std::unique_lock<std::mutex> guard(lock);
  for (;;) {
    if (stopping) break;  // what is still queued is dropped with the pool
    if (tasks.empty()) {
      ++waiting;
      // The only timed wait of the pool, and it ends the thread: an idle pool wakes no one.
      const bool more = wake.wait_for(guard, idleExit, [this] { return !tasks.empty() || stopping; });
      --waiting;
      // Decided under the lock that post() takes: a task posted from here on sees this worker gone.
      if (!more) break;
      continue;
    }
    Task task = std::move(tasks.front());
    tasks.pop_front();
    guard.unlock();
    task();
    task = nullptr;  // what it holds goes before the lock is taken again
    guard.lock();
    if (--inFlight == 0) idle.notify_all();
  }
  --workers;
  exited.push_back(std::this_thread::get_id());
  idle.notify_all();
  // The last worker out hands the heap memory freed by the work back to the system: a daemon
  // that went idle should not keep its busiest moment's footprint.
  if (workers == 0 && !stopping) {
    guard.unlock();
    malloc_trim(0);
  }
}

DispatchPool::DispatchPool(unsigned threads, Duration idleExit) {
  // sync() parks a pool thread while it waits, so the pool must be allowed more threads than the
  // deepest chain of nested sync calls; eight is comfortably more than any such chain in the daemon.
  if (threads == 0) threads = std::max(8u, std::thread::hardware_concurrency());
  impl_ = std::make_unique<Impl>(threads, idleExit);
}

DispatchPool::~DispatchPool() {
  shutdown();
  dropPending();
}

void DispatchPool::dropPending() {
  std::vector<Impl::Queue> queues;
  std::deque<Task> tasks;
  {
    std::lock_guard<std::mutex> guard(impl_->lock);
    queues = impl_->queues;
    tasks.swap(impl_->tasks);
  }
  for (auto& q : queues) {
    if (auto alive = q.queue.lock()) q.dropPending();
  }
}

void DispatchPool::shutdown() {
  {
    std::lock_guard<std::mutex> guard(impl_->lock);
    if (impl_->stopping) return;
  }
  drain();
  {
    std::unique_lock<std::mutex> guard(impl_->lock);
    impl_->stopping = true;
    impl_->wake.notify_all();
    impl_->idle.wait(guard, [this] { return impl_->workers == 0; });
    impl_->joinExited();
  }
  if (impl_->reactor.joinable()) {
    impl_->reactorWork.reset();
    impl_->context.stop();
    impl_->reactor.join();
  }
  // Tasks queued meanwhile will never run: destroy them now, while what they hold is alive.
  dropPending();
}

void DispatchPool::registerQueue(std::weak_ptr<void> queue, std::function<void()> dropPending) {
  std::lock_guard<std::mutex> guard(impl_->lock);
  auto& queues = impl_->queues;
  queues.erase(std::remove_if(queues.begin(), queues.end(), [](const auto& q) { return q.queue.expired(); }),
               queues.end());
  queues.push_back({std::move(queue), std::move(dropPending)});
}

void DispatchPool::beginWork() {
  std::lock_guard<std::mutex> guard(impl_->lock);
  ++impl_->inFlight;
}

void DispatchPool::endWork() {
  std::lock_guard<std::mutex> guard(impl_->lock);
  if (--impl_->inFlight == 0) impl_->idle.notify_all();
}

void DispatchPool::post(Task task) {
  Impl& p = *impl_;
  std::unique_lock<std::mutex> guard(p.lock);
  ++p.inFlight;
  p.tasks.push_back(std::move(task));
  if (p.stopping) return;  // never runs; destroyed with the pool
  // Every waiting worker takes one task; beyond them a new worker starts, up to the limit.
  if (p.tasks.size() <= p.waiting) {
    p.wake.notify_one();
  } else if (p.workers < p.limit) {
    p.joinExited();
    p.startWorker();
  }
}

void DispatchPool::drain() {
  std::unique_lock<std::mutex> guard(impl_->lock);
  impl_->idle.wait(guard, [this] { return impl_->inFlight == 0; });
}

unsigned DispatchPool::threadCount() const { return impl_->limit; }

void* DispatchPool::nativeContext() {
  Impl& p = *impl_;
  std::lock_guard<std::mutex> guard(p.lock);
  if (!p.reactor.joinable() && !p.stopping) {
    p.reactorWork.emplace(p.context.get_executor());
    p.reactor = std::thread([&p] {
      nameThisThread("tavixd-io");
      p.context.run();
    });
  }
  return &p.context;
}

// A serial queue is a list of tasks and an owner: at most one thread at a time "is on" the queue
// and runs its tasks. async() appends and, when nobody owns the queue, posts a drain job to the
// pool. sync() never waits for another pool thread to come free: when nobody owns the queue it
// takes ownership and runs the tasks ahead of its own, then its own, on the calling thread; when
// a thread owns it, that thread is running and hands ownership over when it reaches the caller's
// turn. So any number of threads may sync at once, on a pool of any size, without starving it.
struct SerialQueue::Impl {
  explicit Impl(DispatchPool& p) : pool(p) {}

  struct Waiter {
    bool turn = false;  // ownership was handed to this caller
  };
  struct Item {
    Task task;                // an async task
    Waiter* waiter = nullptr;  // or a caller of sync() waiting for its turn
  };

  DispatchPool& pool;
  std::mutex lock;
  std::condition_variable changed;
  std::deque<Item> items;
  bool owned = false;        // a thread is on the queue
  bool drainPosted = false;  // a drain job is posted and has not started

  // Runs tasks from the front while the caller owns the queue, until the list is empty or the
  // front is a waiting sync caller (who then gets the queue) or `until` (left in place).
  // Answers true when ownership passed to a waiter. Called and returns with `guard` held.
  bool runFront(std::unique_lock<std::mutex>& guard, const Waiter* until);
  // Gives the queue up: to the waiter at the front, to a new drain job, or to nobody.
  void release(std::unique_lock<std::mutex>& guard, const std::shared_ptr<Impl>& self);
  void postDrain(const std::shared_ptr<Impl>& self);
  // The pool has stopped: the tasks never to run are destroyed, outside the lock.
  void dropPending() {
    std::deque<Item> dropped;
    {
      std::lock_guard<std::mutex> guard(lock);
      dropped.swap(items);
    }
  }
};

namespace {
// The queues the calling thread is on, innermost last (sync() nests).
thread_local std::vector<const SerialQueue::Impl*> tCurrentQueues;

struct OnQueue {
  explicit OnQueue(const SerialQueue::Impl* q) { tCurrentQueues.push_back(q); }
  ~OnQueue() { tCurrentQueues.pop_back(); }
};
}  // namespace

bool SerialQueue::Impl::runFront(std::unique_lock<std::mutex>& guard, const Waiter* until) {
  while (!items.empty()) {
    Item& front = items.front();
    if (until && front.waiter == until) return false;
    if (front.waiter) {
      front.waiter->turn = true;
      items.pop_front();
      changed.notify_all();
      return true;
    }
    Task task = std::move(front.task);
    items.pop_front();
    guard.unlock();
    {
      OnQueue on(this);
      task();
    }
    pool.endWork();
    guard.lock();
  }
  return false;
}

void SerialQueue::Impl::postDrain(const std::shared_ptr<Impl>& self) {
  drainPosted = true;
  pool.post([self] {
    std::unique_lock<std::mutex> guard(self->lock);
    self->drainPosted = false;
    if (self->owned) return;  // the owner will see the new tasks
    self->owned = true;
    if (self->runFront(guard, nullptr)) return;
    self->owned = false;
    self->changed.notify_all();
  });
}

void SerialQueue::Impl::release(std::unique_lock<std::mutex>& guard, const std::shared_ptr<Impl>& self) {
  if (!items.empty() && items.front().waiter) {
    items.front().waiter->turn = true;
    items.pop_front();
    changed.notify_all();
    return;
  }
  owned = false;
  if (!items.empty() && !drainPosted) postDrain(self);
  changed.notify_all();
}

SerialQueue::SerialQueue(DispatchPool& pool, std::string label)
    : label_(std::move(label)), impl_(std::make_shared<Impl>(pool)) {
  std::weak_ptr<Impl> weak = impl_;
  pool.registerQueue(impl_, [weak] {
    if (auto queue = weak.lock()) queue->dropPending();
  });
}

SerialQueue::~SerialQueue() = default;

DispatchPool& SerialQueue::pool() const { return impl_->pool; }

void SerialQueue::async(Task task) {
  // Counted by the pool so that DispatchPool::drain() also waits for queue work.
  impl_->pool.beginWork();
  std::lock_guard<std::mutex> guard(impl_->lock);
  impl_->items.push_back({std::move(task), nullptr});
  if (!impl_->owned && !impl_->drainPosted) impl_->postDrain(impl_);
}

void SerialQueue::sync(const Task& task) {
  if (isCurrent()) die("sync onto queue '" + label_ + "' from itself would deadlock");
  Impl& q = *impl_;
  std::unique_lock<std::mutex> guard(q.lock);
  Impl::Waiter waiter;
  q.items.push_back({nullptr, &waiter});
  for (;;) {
    if (waiter.turn) break;  // handed over by the owner
    if (!q.owned) {
      // Nobody is on the queue: run what is ahead of us here rather than wait for a pool thread.
      q.owned = true;
      if (q.runFront(guard, &waiter)) continue;  // a waiter ahead of us got the queue
      q.items.pop_front();                       // our own entry
      break;
    }
    q.changed.wait(guard);
  }
  guard.unlock();
  {
    OnQueue on(&q);
    task();
  }
  guard.lock();
  q.release(guard, impl_);
}

bool SerialQueue::isCurrent() const {
  return std::find(tCurrentQueues.begin(), tCurrentQueues.end(), impl_.get()) != tCurrentQueues.end();
}

void SerialQueue::assertCurrent(const char* what) const {
#ifndef NDEBUG
  if (!isCurrent()) die(std::string(what) + " must run on queue '" + label_ + "'");
#else
  (void)what;
#endif
}

ReaderWriterQueue::ReaderWriterQueue(DispatchPool& pool, std::string label)
    : writes_(pool, std::move(label)) {}

ReaderWriterQueue::~ReaderWriterQueue() {
  std::unique_lock<std::mutex> guard(progressLock_);
  progress_.wait(guard, [this] { return finishedWrites_ == submittedWrites_; });
}

void ReaderWriterQueue::read(const Task& task) {
  {
    std::unique_lock<std::mutex> guard(progressLock_);
    const std::uint64_t mustSee = submittedWrites_;
    progress_.wait(guard, [&] { return finishedWrites_ >= mustSee; });
  }
  std::shared_lock<std::shared_mutex> shared(access_);
  task();
}

void ReaderWriterQueue::runWrite(const Task& task) {
  {
    std::unique_lock<std::shared_mutex> exclusive(access_);
    task();
  }
  std::lock_guard<std::mutex> guard(progressLock_);
  ++finishedWrites_;
  progress_.notify_all();
}

void ReaderWriterQueue::writeAsync(Task task) {
  {
    std::lock_guard<std::mutex> guard(progressLock_);
    ++submittedWrites_;
  }
  writes_.async([this, task = std::move(task)] { runWrite(task); });
}

void ReaderWriterQueue::writeSync(const Task& task) {
  {
    std::lock_guard<std::mutex> guard(progressLock_);
    ++submittedWrites_;
  }
  writes_.sync([&] { runWrite(task); });
}

}  // namespace tavix::platform
