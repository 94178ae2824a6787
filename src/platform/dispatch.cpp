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
  Impl(DispatchPool* owner, unsigned limit, Duration idleExit) : owner(owner), limit(limit), idleExit(idleExit) {}

  void startWorker();  // with `lock` held
  void work();
  void joinExited();  // with `lock` held

  DispatchPool* const owner;
  const unsigned limit;
  const Duration idleExit;

  std::mutex lock;
  std::condition_variable wake;     // a task arrived, or the pool stops
  std::condition_variable idle;     // inFlight fell to zero, or a worker left
  std::deque<Task> tasks;           // posted and not yet taken by a worker
  // Posted through post() or a queue and not yet finished. Counted without the lock, which is
  // taken only by the step down to zero, to wake drain().
  std::atomic<std::size_t> inFlight{0};
  void finishedOne() {
    if (inFlight.fetch_sub(1) != 1) return;
    std::lock_guard<std::mutex> guard(lock);
    idle.notify_all();
  }
  unsigned workers = 0;             // alive
  unsigned waiting = 0;             // alive and blocked waiting for a task
  bool stopping = false;            // shutdown() has begun: workers leave, none starts
  std::map<std::thread::id, std::thread> threads;
  std::vector<std::thread::id> exited;  // left their loop; joined by the next start or shutdown

  // The reactor: started by the first nativeContext(), stopped by shutdown(). Concurrency hint 1
  // keeps Asio's locking but stops it from waking a second thread for every event; the threads
  // below take turns instead, one leading at a time.
  void startReactorThread();  // with `lock` held
  void reactorThread();
  void updateSpare();  // with `lock` held

  static constexpr unsigned kMaxReactorThreads = 4;
  asio::io_context context{1};
  std::optional<asio::executor_work_guard<asio::io_context::executor_type>> reactorWork;
  std::map<std::thread::id, std::thread> reactorThreads;  // under `lock`, like the rest below
  std::vector<std::thread::id> reactorExited;
  unsigned reactorAlive = 0;    // reactor threads that have not left their loop
  bool reactorLed = false;      // a thread leads the reactor
  unsigned reactorStandby = 0;  // waiting for their turn to lead
  bool reactorStopping = false;
  std::condition_variable reactorTurn;
  // Threads that could take the reactor over now: standing by, or yet to start. Read without
  // the lock by mayAnswerOnReactor().
  std::atomic<unsigned> reactorSpare{0};

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

namespace {
// Joins the threads that have left their loop: it waits for no task, at most for a last trim of
// the heap.
void joinLeft(std::map<std::thread::id, std::thread>& threads, std::vector<std::thread::id>& left) {
  for (auto id : left) {
    auto it = threads.find(id);
    it->second.join();
    threads.erase(it);
  }
  left.clear();
}
}  // namespace

void DispatchPool::Impl::joinExited() { joinLeft(threads, exited); }

namespace {
// The pool whose reactor the calling thread leads at the moment, if any.
thread_local DispatchPool* tLeads = nullptr;

// Work posted by the task running on this thread: a worker runs it itself once the task is done,
// a reactor thread hands it to the pool in one piece once its call is done, so that work which
// follows from work wakes no one. A thread about to wait gives it to the pool first.
struct FollowUps {
  DispatchPool* pool = nullptr;
  std::deque<Task> tasks;
};
thread_local FollowUps* tFollowUps = nullptr;

// Collects the calling thread's posts to `pool` while it lives.
class CollectFollowUps {
 public:
  explicit CollectFollowUps(DispatchPool* pool) : outer_(tFollowUps) {
    mine_.pool = pool;
    tFollowUps = &mine_;
  }
  ~CollectFollowUps() { tFollowUps = outer_; }
  std::deque<Task>& tasks() { return mine_.tasks; }

 private:
  FollowUps mine_;
  FollowUps* outer_;
};
}  // namespace

void DispatchPool::Impl::updateSpare() {
  reactorSpare.store(reactorStandby + (reactorAlive < kMaxReactorThreads ? kMaxReactorThreads - reactorAlive : 0));
}

void DispatchPool::Impl::startReactorThread() {
  joinLeft(reactorThreads, reactorExited);
  std::thread t([this] { reactorThread(); });
  reactorThreads.emplace(t.get_id(), std::move(t));
  ++reactorAlive;
  updateSpare();
}

void DispatchPool::Impl::reactorThread() {
  nameThisThread("tavixd-io");
  DispatchPool* const pool = owner;
  std::unique_lock<std::mutex> guard(lock);
  for (;;) {
    if (reactorLed && !reactorStopping) {
      ++reactorStandby;
      updateSpare();
      // The only timed wait of the reactor, and it ends a standby thread: the leader never times out.
      const bool turn = reactorTurn.wait_for(guard, idleExit, [this] { return !reactorLed || reactorStopping; });
      --reactorStandby;
      updateSpare();
      if (!turn) break;
    }
    if (reactorStopping) break;
    reactorLed = true;
    guard.unlock();
    tLeads = pool;
    while (tLeads == pool && context.run_one() > 0) {
    }
    const bool stopped = tLeads == pool;  // run_one() answers 0 only once the context stopped
    tLeads = nullptr;
    // What the handler that handed the reactor over posted meanwhile is queued, and nobody was
    // woken for it: run it here before standing by.
    if (!stopped) context.poll();
    guard.lock();
    if (stopped) break;
  }
  reactorExited.push_back(std::this_thread::get_id());
  --reactorAlive;
  updateSpare();
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
    {
      CollectFollowUps followUps(owner);
      for (;;) {
        task();
        task = nullptr;  // what it holds goes before the next one runs
        finishedOne();
        if (followUps.tasks().empty()) break;
        task = std::move(followUps.tasks().front());
        followUps.tasks().pop_front();
      }
    }
    guard.lock();
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
  impl_ = std::make_unique<Impl>(this, threads, idleExit);
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
  std::map<std::thread::id, std::thread> reactorThreads;
  {
    std::lock_guard<std::mutex> guard(impl_->lock);
    impl_->reactorStopping = true;
    impl_->reactorTurn.notify_all();
    reactorThreads.swap(impl_->reactorThreads);
  }
  if (!reactorThreads.empty()) {
    impl_->reactorWork.reset();
    impl_->context.stop();
    for (auto& [id, thread] : reactorThreads) thread.join();
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

void DispatchPool::beginWork() { impl_->inFlight.fetch_add(1); }

void DispatchPool::endWork() { impl_->finishedOne(); }

void DispatchPool::post(Task task) {
  ++impl_->inFlight;
  if (tFollowUps && tFollowUps->pool == this) {
    tFollowUps->tasks.push_back(std::move(task));
    return;
  }
  enqueue(std::move(task));
}

void DispatchPool::enqueue(Task task) {
  Impl& p = *impl_;
  std::unique_lock<std::mutex> guard(p.lock);
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
  if (p.reactorThreads.empty() && !p.stopping && !p.reactorStopping) {
    p.reactorWork.emplace(p.context.get_executor());
    p.startReactorThread();
  }
  return &p.context;
}

bool DispatchPool::mayAnswerOnReactor() const {
  return tLeads == this && impl_->reactorSpare.load(std::memory_order_relaxed) > 0;
}

void DispatchPool::aboutToWait() {
  if (tFollowUps && !tFollowUps->tasks.empty()) {
    // What it waits for may be among them.
    auto pending = std::move(tFollowUps->tasks);
    tFollowUps->tasks.clear();
    for (auto& task : pending) tFollowUps->pool->enqueue(std::move(task));
  }
  if (tLeads) tLeads->handOffReactor();
}

void DispatchPool::handOffReactor() {
  tLeads = nullptr;  // this thread stands by once its handler returns
  Impl& p = *impl_;
  std::lock_guard<std::mutex> guard(p.lock);
  p.reactorLed = false;
  if (p.reactorStopping) return;
  if (p.reactorStandby > 0) {
    p.reactorTurn.notify_one();
  } else {
    p.startReactorThread();  // past the limit too: a handler that waits must never hold the reactor
  }
}

// A serial queue is a list of tasks and an owner: at most one thread at a time "is on" the queue
// and runs its tasks. async() appends and, when nobody owns the queue, posts a drain job to the
// pool. sync() never waits for another pool thread to come free: when nobody owns the queue it
// takes ownership and runs the tasks ahead of its own, then its own, on the calling thread; when
// a thread owns it, that thread is running and hands ownership over when it reaches the caller's
// turn. So any number of threads may sync at once, on a pool of any size, without starving it.
struct SerialQueue::Impl {
  explicit Impl(DispatchPool& p) : pool(p) {}

  // A caller of sync() waiting on the queue. Each has its own condition, so that passing the
  // queue on wakes the one thread it is passed to, not every thread waiting on the queue.
  struct Waiter {
    bool turn = false;  // ownership was handed to this caller
    std::condition_variable wake;
  };
  struct Item {
    Task task;                // an async task
    Waiter* waiter = nullptr;  // or a caller of sync() waiting for its turn
  };

  DispatchPool& pool;
  std::mutex lock;
  std::deque<Item> items;
  bool owned = false;        // a thread is on the queue
  bool drainPosted = false;  // a drain job is posted and has not started

  // Runs tasks from the front while the caller owns the queue, until the list is empty or the
  // front is a waiting sync caller (who then gets the queue) or `until` (left in place).
  // Answers true when ownership passed to a waiter. Called and returns with `guard` held.
  bool runFront(std::unique_lock<std::mutex>& guard, const Waiter* until);
  // Gives the queue up: to the waiter at the front, to a new drain job, or to nobody.
  void release(std::unique_lock<std::mutex>& guard, const std::shared_ptr<Impl>& self);
  // With `lock` held: the queue is owned by `front`'s caller from now on.
  void handTo(Waiter* front) {
    front->turn = true;
    items.pop_front();
    front->wake.notify_one();
  }
  // With `lock` held, once nobody owns the queue: the first caller of sync() waiting behind
  // queued tasks takes it and runs them itself rather than waiting for the drain job.
  void wakeFirstWaiter() {
    for (auto& item : items) {
      if (item.waiter) return item.waiter->wake.notify_one();
    }
  }
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
      handTo(front.waiter);
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
  });
}

void SerialQueue::Impl::release(std::unique_lock<std::mutex>& guard, const std::shared_ptr<Impl>& self) {
  if (!items.empty() && items.front().waiter) return handTo(items.front().waiter);
  owned = false;
  if (!items.empty() && !drainPosted) postDrain(self);
  wakeFirstWaiter();
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

void SerialQueue::runHereOrAsync(Task task) {
  Impl& q = *impl_;
  std::unique_lock<std::mutex> guard(q.lock);
  if (q.owned || !q.items.empty()) {
    guard.unlock();
    return async(std::move(task));
  }
  q.owned = true;
  guard.unlock();
  q.pool.beginWork();  // counted like queued work, so that drain() waits for it
  {
    CollectFollowUps followUps(&q.pool);
    {
      OnQueue on(&q);
      task();
    }
    task = nullptr;
    // What the task posted goes to a worker in one piece (each was counted when posted), where it
    // joins that worker's own follow-ups.
    if (!followUps.tasks().empty()) {
      q.pool.beginWork();
      q.pool.enqueue([pending = std::make_shared<std::deque<Task>>(std::move(followUps.tasks()))] {
        for (auto& t : *pending) tFollowUps->tasks.push_back(std::move(t));
      });
    }
  }
  q.pool.endWork();
  guard.lock();
  // Whatever was queued or began to wait meanwhile goes to a worker or to its waiter.
  q.release(guard, impl_);
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
    DispatchPool::aboutToWait();
    waiter.wake.wait(guard);
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
    if (finishedWrites_ < mustSee) {
      DispatchPool::aboutToWait();
      progress_.wait(guard, [&] { return finishedWrites_ >= mustSee; });
    }
  }
  std::shared_lock<std::shared_mutex> shared(access_, std::try_to_lock);
  if (!shared.owns_lock()) {
    DispatchPool::aboutToWait();
    shared.lock();
  }
  task();
}

void ReaderWriterQueue::runWrite(const Task& task) {
  {
    std::unique_lock<std::shared_mutex> exclusive(access_, std::try_to_lock);
    if (!exclusive.owns_lock()) {
      DispatchPool::aboutToWait();
      exclusive.lock();
    }
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
