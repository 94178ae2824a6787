#include "platform/notification_center.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>

namespace tavix::platform {
namespace {

TEST(NotificationCenter, RemovedObserverHearsNothingEvenWhenQueued) {
  DispatchPool pool(2);
  SerialQueue queue(pool, "test.observer");
  NotificationCenter center;
  std::atomic<int> heard{0};
  auto reg = center.addObserver("N", nullptr, &queue, [&](const Notification&) { heard++; });
  std::promise<void> release;
  queue.async([gate = release.get_future().share()] { gate.wait(); });
  center.post("N");  // queued behind the blocked task
  reg.reset();
  release.set_value();
  queue.sync([] {});
  EXPECT_EQ(heard.load(), 0);
}

}  // namespace
}  // namespace tavix::platform
