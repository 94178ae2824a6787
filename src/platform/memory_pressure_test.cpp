#include "platform/memory_pressure.h"

#include <gtest/gtest.h>

#include <atomic>

#include "support/temp_home.h"

namespace tavix::platform {
namespace {

// Masks and cancelling are seen through the query cache, which listens only while it holds entries.
TEST(MemoryPressure, StallMonitorRaisesOncePerRiseAboveThreshold) {
  EXPECT_FALSE(PressureStallMonitor::fullAverage10("some avg10=1.00 avg60=0.00\n"));

  testing::TempHome home;
  const fs::path file = home.root() / "memory";
  auto setFull = [&](const char* avg10) {
    writeFileAtomically(file, std::string("some avg10=0.00 avg60=0.00 avg300=0.00 total=0\nfull avg10=") + avg10 +
                                  " avg60=0.00 avg300=0.00 total=0\n");
  };
  DispatchPool pool(2);
  SerialQueue queue(pool, "test.psi");
  VirtualClock clock;
  std::atomic<int> heard{0};
  MemoryPressureSource source(MemoryPressureProcessLimitCritical, queue, [&](std::uint32_t) { ++heard; });
  source.resume();

  PressureStallMonitor missing(clock, queue, home.root() / "absent");
  EXPECT_FALSE(missing.start());

  setFull("0.00");
  PressureStallMonitor monitor(clock, queue, file, 10, seconds(2));
  bool started = false;
  queue.sync([&] { started = monitor.start(); });
  ASSERT_TRUE(started);
  // (full avg10 at a poll, events heard after it): one event per rise to the threshold.
  for (auto [avg10, events] : {std::pair{"0.00", 0}, {"12.00", 1}, {"12.00", 1}, {"3.00", 1}, {"10.00", 2}}) {
    setFull(avg10);
    clock.advance(seconds(2));
    queue.sync([] {});
    EXPECT_EQ(heard, events) << avg10;
  }
  queue.sync([&] { monitor.stop(); });
}

}  // namespace
}  // namespace tavix::platform
