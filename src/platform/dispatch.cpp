#include "platform/dispatch.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <future>
#include <thread>
#include <vector>

#include <asio/executor_work_guard.hpp>
#include <asio/io_context.hpp>
#include <asio/post.hpp>
#include <asio/strand.hpp>

#include "platform/asio_context.h"

namespace tavix::platform {

namespace {
[[noreturn]] void die(const std::string& message) {
  std::fprintf(stderr, "fatal: %s\n", message.c_str());
  std::fflush(stderr);
  std::abort();
}
}  // namespace

struct DispatchPool::Impl {
  asio::io_context context;
  asio::executor_work_guard<asio::io_context::executor_type> work{context.get_executor()};
  std::vector<std::thread> threads;
  std::mutex lock;
  std::condition_variable idle;
  std::size_t inFlight = 0;  // posted through post() or a queue and not yet finished
};

DispatchPool::DispatchPool(unsigned threads) : impl_(std::make_unique<Impl>()) {
  // sync() parks a pool thread while it waits, so the pool must be larger than the deepest chain
  // of nested sync calls; eight is comfortably more than any such chain in the daemon.
  if (threads == 0) threads = std::max(8u, std::thread::hardware_concurrency());
  impl_->threads.reserve(threads);
  for (unsigned i = 0; i < threads; ++i) {
    impl_->threads.emplace_back([this] { impl_->context.run(); });
  }
}

DispatchPool::~DispatchPool() {
  drain();
  impl_->work.reset();
  impl_->context.stop();
  for (auto& t : impl_->threads) t.join();
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
  beginWork();
  asio::post(impl_->context, [this, task = std::move(task)] {
    task();
    endWork();
  });
}

void DispatchPool::drain() {
  std::unique_lock<std::mutex> guard(impl_->lock);
  impl_->idle.wait(guard, [this] { return impl_->inFlight == 0; });
}

unsigned DispatchPool::threadCount() const { return static_cast<unsigned>(impl_->threads.size()); }

void* DispatchPool::nativeContext() { return &impl_->context; }

struct SerialQueue::Impl {
  explicit Impl(DispatchPool& p) : pool(p), strand(asio::make_strand(asioContext(p))) {}
  DispatchPool& pool;
  asio::strand<asio::io_context::executor_type> strand;
};

SerialQueue::SerialQueue(DispatchPool& pool, std::string label)
    : label_(std::move(label)), impl_(std::make_unique<Impl>(pool)) {}

SerialQueue::~SerialQueue() = default;

void SerialQueue::async(Task task) {
  // Counted by the pool so that DispatchPool::drain() also waits for queue work.
  DispatchPool& pool = impl_->pool;
  pool.beginWork();
  asio::post(impl_->strand, [&pool, task = std::move(task)] {
    task();
    pool.endWork();
  });
}

void SerialQueue::sync(const Task& task) {
  if (isCurrent()) die("sync onto queue '" + label_ + "' from itself would deadlock");
  std::promise<void> done;
  asio::post(impl_->strand, [&] {
    task();
    done.set_value();
  });
  done.get_future().wait();
}

bool SerialQueue::isCurrent() const { return impl_->strand.running_in_this_thread(); }

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
