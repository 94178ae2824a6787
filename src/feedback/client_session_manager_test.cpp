#include "feedback/client_session_manager.h"

#include <gtest/gtest.h>

#include "bagview/tvx_bag.h"
#include "context/user_guid_controller.h"
#include "feedback/persistent_storage.h"
#include "platform/defaults.h"
#include "platform/notification_center.h"
#include "support/test_assembly.h"

namespace tavix {
namespace {

struct ManagerFixture : testing::TestAssembly {
  std::shared_ptr<TavixUserGUIDController> guid;
  std::shared_ptr<ClientSessionManager> manager;

  explicit ManagerFixture(bool shared = false, std::int64_t softLimit = 600,
                          std::shared_ptr<TVXInMemoryBagSource> bag = nullptr)
      : testing::TestAssembly(4) {
    assembly.sharedSession = shared;
    defaults->registerDefaults({{"TVXSessionSoftLimitOverride", platform::PropertyValue(softLimit)},
                                {"TVXSessionIdleTimeOverride", platform::PropertyValue(std::int64_t{180})}});
    makeStorage();
    guid = makeGUIDController();
    manager = std::make_shared<ClientSessionManager>(sessionManagerEnvironment(assembly), guid, bag, "tavix");
  }
  ~ManagerFixture() { pool.drain(); }

  void send(int type, double atSeconds, const std::string& agent = "seekara/1") {
    const double now = platform::toUnixSeconds(clock.now()) - 1767225600;
    if (atSeconds > now) clock.advance(platform::seconds(atSeconds - now));
    proto::CTFeedbackPayload payload;
    payload.set_type(type);
    payload.mutable_cache_hit()->set_timestamp(static_cast<std::uint64_t>(atSeconds * 1e9));
    payload.mutable_cache_hit()->set_input("t=" + std::to_string(static_cast<int>(atSeconds)));
    manager->addTavixFeedback(makeTavixFeedback(payload, 1, "", agent));
    manager->currentState();  // wait for the event to be handled
  }
  void advanceTo(double atSeconds) {
    const double now = platform::toUnixSeconds(clock.now()) - 1767225600;
    clock.advance(platform::seconds(atSeconds - now));
  }
  // The closed sessions, each as its events' (type, input) pairs.
  std::vector<proto::CTClientSession> closed() {
    pool.drain();
    std::vector<proto::CTClientSession> out;
    for (auto& handle : assembly.persistentStorage->getAvailableSessionHandles()) {
      if (auto record = handle->readRecord()) out.push_back(*record);
    }
    std::sort(out.begin(), out.end(), [](auto& a, auto& b) { return a.session_start() < b.session_start(); });
    return out;
  }
};

int endReason(const proto::CTClientSession& s) {
  const auto& last = s.feedbacks(s.feedbacks_size() - 1).payload();
  return last.has_session_end() ? last.session_end().reason() : -1;
}

TEST(ClientSessionManager, SteadyFeedbackRunsToTheMaxTimeAndClosesWithReason4) {
  ManagerFixture f;
  int softLimitPosts = 0;
  auto reg = f.assembly.notificationCenter->addObserver(kTVXSessionSoftLimitNotification, nullptr, nullptr,
                                                        [&](const platform::Notification&) { ++softLimitPosts; });
  for (int t = 0; t <= 850; t += 170) {
    f.send(39, t);
    EXPECT_EQ(f.manager->currentState(), t < 600 ? 0u : 1u) << "at " << t;
  }
  f.advanceTo(899);
  EXPECT_TRUE(f.manager->hasSession());
  f.advanceTo(900);
  EXPECT_EQ(f.manager->currentState(), 2u);
  f.pool.drain();
  EXPECT_EQ(softLimitPosts, 1);
  auto sessions = f.closed();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(sessions[0].feedbacks_size(), 7);  // six events and the session end
  EXPECT_EQ(endReason(sessions[0]), 4);
}

TEST(ClientSessionManager, IdleOrSentinelPastTheSoftLimitEndsTheSession) {
  ManagerFixture f;
  f.send(39, 0);
  f.send(39, 500);
  f.advanceTo(600);
  EXPECT_EQ(f.manager->currentState(), 1u);
  f.send(39, 681);  // 181 s after the last event: idle
  EXPECT_EQ(f.manager->currentState(), 0u);
  auto sessions = f.closed();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(endReason(sessions[0]), 3);
  EXPECT_EQ(sessions[0].feedbacks_size(), 3);

  // The idle event opened the next session; past its soft limit a visible-results event is its last.
  f.advanceTo(681 + 600);
  EXPECT_EQ(f.manager->currentState(), 1u);
  f.send(8, 681 + 610);
  EXPECT_EQ(f.manager->currentState(), 2u);
  sessions = f.closed();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(sessions[1].feedbacks(0).payload().cache_hit().input(), "t=681");
  EXPECT_EQ(sessions[1].previous_session_end_reason(), 3);
  EXPECT_EQ(endReason(sessions[1]), 7);
  EXPECT_EQ(sessions[1].feedbacks(1).payload().type(), 8);
  EXPECT_NE(sessions[1].user_guid_string(), sessions[0].user_guid_string());  // the idle close rolled it
}

TEST(ClientSessionManager, NewUserGuidClosesTheSessionAtOnce) {
  ManagerFixture f;
  f.send(39, 0);
  f.send(39, 10);
  f.guid->reset();
  f.send(39, 20);
  EXPECT_EQ(f.manager->currentState(), 0u);
  auto sessions = f.closed();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(endReason(sessions[0]), 5);
  EXPECT_EQ(sessions[0].feedbacks_size(), 3);
  f.manager->flushSession();
  sessions = f.closed();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(sessions[1].feedbacks(0).payload().cache_hit().input(), "t=20");
  EXPECT_EQ(sessions[1].previous_session_end_reason(), 5);
}

TEST(ClientSessionManager, LimitsOverridesAndFlushes) {
  {
    ManagerFixture f(false, 900);
    EXPECT_EQ(f.manager->softLimitTime(), 600);
    EXPECT_EQ(f.manager->maxTime(), 300);
  }
  ManagerFixture f(false, 899);
  EXPECT_EQ(f.manager->maxTime(), 1);
  bool called = false;
  f.manager->flushSession([&] { called = true; });
  EXPECT_EQ(f.manager->currentState(), 2u);
  EXPECT_TRUE(called);  // even with no session open

  f.send(39, 0);
  f.advanceTo(599);
  EXPECT_EQ(f.manager->currentState(), 0u);  // the soft-limit timer does not follow the override
  f.advanceTo(600);
  EXPECT_EQ(f.manager->currentState(), 1u);
  f.advanceTo(601);
  EXPECT_EQ(f.manager->currentState(), 2u);
  auto sessions = f.closed();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(endReason(sessions[0]), 4);
}

TEST(ClientSessionManager, AMaxTimerAnnouncesOnlyWhatItDidNotCloseItself) {
  ManagerFixture f;
  int maxPosts = 0;
  auto reg = f.assembly.notificationCenter->addObserver(kTVXSessionMaxLimitNotification, nullptr, nullptr,
                                                        [&](const platform::Notification&) { ++maxPosts; });
  f.send(39, 0);
  f.advanceTo(600);  // session 1 past its soft limit: its max timer is due at 900
  f.manager->flushSession();
  f.send(39, 700);  // session 2
  f.advanceTo(900);
  EXPECT_EQ(maxPosts, 1) << "an earlier session's timer still announces the max limit";
  EXPECT_EQ(f.manager->currentState(), 0u) << "... but leaves the later session open";

  f.advanceTo(1300);  // session 2 past its soft limit, then closed before its own max timer
  EXPECT_EQ(f.manager->currentState(), 1u);
  f.manager->flushSession();
  f.advanceTo(1600);
  EXPECT_EQ(maxPosts, 1) << "a timer that finds its own session gone posts nothing";
  EXPECT_EQ(f.manager->pendingTimers(), 0u) << "fired timers are forgotten";
  auto sessions = f.closed();
  ASSERT_EQ(sessions.size(), 2u);
  EXPECT_EQ(endReason(sessions[0]), 2);
  EXPECT_EQ(endReason(sessions[1]), 2);
}

TEST(ClientSessionManager, SharedSessionKeepsOneMemberPerClientAndClosesThemTogether) {
  ManagerFixture f(true);
  f.send(39, 0, "seekara/1");
  f.send(39, 10, "brovane/2");
  f.send(39, 20, "seekara/1");
  bool invalidated = true;
  f.manager->flushSessionInvalidationWithAgent("brovane/2", [&](bool flushed) { invalidated = flushed; });
  EXPECT_FALSE(invalidated);
  f.manager->flushSession();
  EXPECT_EQ(f.manager->currentState(), 2u);
  auto sessions = f.closed();
  ASSERT_EQ(sessions.size(), 2u);
  for (const auto& s : sessions) {
    EXPECT_EQ(endReason(s), 2);
    ASSERT_EQ(s.feedbacks_size(), 3);
    if (s.agent() == "brovane/2") {
      EXPECT_TRUE(s.feedbacks(1).payload().has_connection_invalidated());
    }
  }
}

// What a user shares is the bag's to allow, client by client; a bag that does not say so allows
// nothing.
TEST(ClientSessionManager, OnlyTheClientsTheBagAllowsHaveTheirFeedbackKept) {
  struct Bag : TVXInMemoryBagSource {
    std::shared_ptr<const TVXBag> bag;
    std::shared_ptr<const TVXBag> inMemoryBag() override { return bag; }
  };
  using platform::Dictionary;
  auto source = std::make_shared<Bag>();
  source->bag = std::make_shared<const TVXBag>(
      Dictionary{{"feedback_enabled", true}, {"clients", Dictionary{{"brovane", Dictionary{{"feedback_enabled", false}}}}}},
      "");
  ManagerFixture f(true, 600, source);
  f.send(39, 0, "seekara/1");
  f.send(39, 10, "brovane/2");
  f.manager->flushSession();
  auto sessions = f.closed();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(sessions[0].agent(), "seekara/1");

  source->bag = std::make_shared<const TVXBag>(Dictionary{}, "");
  f.send(39, 20, "seekara/1");
  f.manager->flushSession();
  EXPECT_EQ(f.closed().size(), 1u);
}

}  // namespace
}  // namespace tavix
