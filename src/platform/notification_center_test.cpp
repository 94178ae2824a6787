#include "platform/notification_center.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>

namespace tavix::platform {
namespace {

TEST(NotificationCenter, RemovedObserversHearNothingEvenWhenQueuedOrWhileBeingTold) {
  DispatchPool pool(2);
  SerialQueue queue(pool, "test.observer");
  NotificationCenter center;
  std::atomic<int> queued{0};
  auto reg = center.addObserver("N", nullptr, &queue, [&](const Notification&) { queued++; });
  std::promise<void> release;
  queue.async([gate = release.get_future().share()] { gate.wait(); });
  center.post("N");  // queued behind the blocked task
  reg.reset();
  release.set_value();
  queue.sync([] {});
  EXPECT_EQ(queued.load(), 0);

  // An observer may remove itself while it is told; the others still hear.
  NotificationCenter::Registration self;
  int selfCount = 0, otherCount = 0;
  self = center.addObserver("M", nullptr, nullptr, [&](const Notification&) {
    selfCount++;
    self.reset();
  });
  auto other = center.addObserver("M", nullptr, nullptr, [&](const Notification&) { otherCount++; });
  center.post("M");
  center.post("M");
  EXPECT_EQ(std::pair(selfCount, otherCount), std::pair(1, 2));
}

}  // namespace
}  // namespace tavix::platform
