#include "platform/dispatch.h"

#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <future>
#include <latch>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/clock.h"

namespace tavix::platform {
namespace {

TEST(SerialQueue, RunsTasksOneAtATimeInSubmissionOrder) {
  DispatchPool pool(4);
  SerialQueue queue(pool, "test.serial");
  std::vector<int> order;
  std::atomic<int> running{0};
  std::atomic<int> overlap{0};
  for (int i = 0; i < 500; ++i) {
    queue.async([&, i] {
      if (running.fetch_add(1) != 0) overlap++;
      order.push_back(i);
      running.fetch_sub(1);
    });
  }
  queue.sync([] {});
  EXPECT_EQ(overlap.load(), 0);
  ASSERT_EQ(order.size(), 500u);
  for (int i = 0; i < 500; ++i) EXPECT_EQ(order[i], i);
}

TEST(SerialQueue, ManyQueuesSyncingOntoOneNeverStarveASmallPool) {
  // Every pool thread is busy in a task that syncs onto one shared queue, which also has async
  // work pending: no caller may wait for a free pool thread, or this never ends.
  platform::DispatchPool pool(2);
  platform::SerialQueue shared(pool, "test.shared");
  std::vector<std::unique_ptr<platform::SerialQueue>> callers;
  std::atomic<int> inside{0}, maxInside{0}, done{0};
  int counter = 0;  // touched only on `shared`
  for (int i = 0; i < 16; ++i) {
    callers.push_back(std::make_unique<platform::SerialQueue>(pool, "test.caller"));
    shared.async([&] { ++counter; });
    callers.back()->async([&, &caller = *callers.back()] {
      shared.sync([&] {
        const int now = ++inside;
        maxInside = std::max(maxInside.load(), now);
        EXPECT_TRUE(shared.isCurrent());
        EXPECT_TRUE(caller.isCurrent()) << "still on the caller's queue while on the shared one";
        ++counter;
        --inside;
      });
      ++done;
    });
  }
  pool.drain();
  EXPECT_FALSE(shared.isCurrent());
  EXPECT_EQ(done.load(), 16);
  EXPECT_EQ(maxInside.load(), 1) << "the shared queue ran two tasks at once";
  int seen = 0;
  shared.sync([&] { seen = counter; });
  EXPECT_EQ(seen, 32);
}

TEST(SerialQueueDeathTest, SyncOntoItselfStopsWithTheQueueName) {
  EXPECT_DEATH(
      {
        DispatchPool pool(2);
        SerialQueue a(pool, "test.self");
        a.sync([&] { a.sync([] {}); });
      },
      "test.self");
}

TEST(DispatchPool, DrainWaitsForQueueWorkPostedByQueueWork) {
  DispatchPool pool(3);
  SerialQueue a(pool, "test.a");
  std::atomic<int> done{0};
  std::promise<void> started, release;
  a.async([&, gate = release.get_future().share()] {
    started.set_value();
    gate.wait();
    a.async([&] { done++; });
    pool.post([&] { done++; });
  });
  started.get_future().wait();
  // The task posts its work only once let go, which races with drain() below; either way drain()
  // must not return before that work has run.
  std::thread releaser([&] { release.set_value(); });
  pool.drain();
  releaser.join();
  EXPECT_EQ(done.load(), 2);
}

TEST(DispatchPool, GrowsToItsLimitAndLosesNoWorkWhileWorkersLeave) {
  // Workers leave as soon as they find nothing to do, so posts keep racing the last one out.
  DispatchPool pool(4, Duration::zero());
  std::atomic<int> ran{0};
  std::vector<std::thread> posters;
  for (int t = 0; t < 2; ++t) {
    posters.emplace_back([&] {
      for (int i = 0; i < 2000; ++i) pool.post([&] { ran++; });
    });
  }
  for (auto& t : posters) t.join();
  pool.drain();
  EXPECT_EQ(ran.load(), 4000);

  // Every worker blocks until all of them run at once: only a pool that grew to its limit ends.
  std::latch together(pool.threadCount());
  for (unsigned i = 0; i < pool.threadCount(); ++i) pool.post([&] { together.arrive_and_wait(); });
  pool.drain();
}

TEST(DispatchPool, WorkPostedByATaskThatThenWaitsForItStillRuns) {
  // Work posted from a pool task runs after it on the same thread, unless the task waits first:
  // a task that waits for what it posted must not wait for ever.
  DispatchPool pool(4);
  SystemClock clock(pool);
  SerialQueue outer(pool, "test.outer");
  SerialQueue inner(pool, "test.inner");
  std::mutex lock;
  std::condition_variable done;
  bool innerRan = false;
  std::atomic<bool> seen{false};
  outer.async([&] {
    inner.async([&] {
      std::lock_guard guard(lock);
      innerRan = true;
      done.notify_all();
    });
    std::unique_lock guard(lock);
    // Bounded only so that a failure ends the test instead of hanging it.
    seen = clock.waitFor(guard, done, seconds(10), [&] { return innerRan; });
  });
  pool.drain();
  EXPECT_TRUE(seen);
}

TEST(ReaderWriterQueue, ReadsSeeEveryWriteSubmittedBeforeThem) {
  DispatchPool pool(4);
  ReaderWriterQueue rw(pool, "test.rw");
  int value = 0;
  for (int i = 1; i <= 200; ++i) {
    rw.writeAsync([&, i] {
      std::this_thread::yield();
      value = i;
    });
    int seen = -1;
    rw.read([&] { seen = value; });
    ASSERT_EQ(seen, i);
  }
}

TEST(ReaderWriterQueue, WritesExcludeReadersAndEachOther) {
  DispatchPool pool(4);
  ReaderWriterQueue rw(pool, "test.rw");
  std::atomic<int> readers{0};
  std::atomic<bool> violated{false};
  std::vector<int> log;
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 200; ++i) {
        rw.read([&] {
          readers++;
          std::this_thread::yield();
          readers--;
        });
      }
    });
  }
  for (int i = 0; i < 200; ++i) {
    rw.writeAsync([&, i] {
      if (readers.load() != 0) violated = true;
      log.push_back(i);
    });
  }
  for (auto& t : threads) t.join();
  rw.writeSync([] {});
  EXPECT_FALSE(violated.load());
  ASSERT_EQ(log.size(), 200u);
  for (int i = 0; i < 200; ++i) EXPECT_EQ(log[i], i);
}

}  // namespace
}  // namespace tavix::platform
