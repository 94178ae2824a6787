#include "context/user_guid_controller.h"

#include <gtest/gtest.h>

#include <atomic>
#include <latch>

#include "platform/notification_center.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

struct GuidFixture : testing::TestAssembly {
  std::atomic<int> posts{0};
  platform::NotificationCenter::Registration registration =
      center->addObserver(kTVXUserGUIDChangeNotification, nullptr, nullptr,
                          [this](const platform::Notification&) { ++posts; });
};

TEST(TavixUserGUIDController, IdentifierLivesExactly900Seconds) {
  GuidFixture f;
  auto controller = f.makeGUIDController();
  const std::string first = controller->currentUserGUID();
  EXPECT_TRUE(isValidUUIDString(first));
  EXPECT_EQ(first[14], '4') << first;  // a random (version 4) UUID
  f.clock.advance(platform::seconds(899));
  EXPECT_EQ(controller->currentUserGUID(), first);
  f.pool.drain();
  EXPECT_EQ(f.posts, 0);  // creation and plain reads post nothing
  f.clock.advance(platform::seconds(1));
  const std::string second = controller->currentUserGUID();
  EXPECT_NE(second, first);
  EXPECT_EQ(controller->currentUserGUID(), second);
  f.pool.drain();
  EXPECT_EQ(f.posts, 1);
}

TEST(TavixUserGUIDController, EachResetRollsAndAnnouncesToObserversThatMayReadIt) {
  GuidFixture f;
  auto controller = f.makeGUIDController();
  std::string seen;
  auto reg = f.center->addObserver(kTVXUserGUIDChangeNotification, nullptr, nullptr,
                                   [&](const platform::Notification&) { seen = controller->currentUserGUID(); });
  const std::string first = controller->currentUserGUID();
  controller->reset();
  controller->reset();
  const std::string third = controller->currentUserGUID();
  EXPECT_NE(first, third);
  f.pool.drain();
  EXPECT_EQ(f.posts, 2);
  EXPECT_EQ(seen, third);
  // A reset restarts the lifetime.
  f.clock.advance(platform::seconds(899));
  EXPECT_EQ(controller->currentUserGUID(), third);

  // A reset still queued when its controller goes does nothing: every worker is held until the
  // controller is gone.
  reg.reset();
  std::latch held(1);
  for (unsigned i = 0; i < f.pool.threadCount(); ++i) f.pool.post([&] { held.wait(); });
  controller->reset();
  controller.reset();
  held.count_down();
  f.pool.drain();
  EXPECT_EQ(f.posts, 2);
}

}  // namespace
}  // namespace tavix
