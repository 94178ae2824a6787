// The client state's bag handling and the state table, against the development server over
// loopback HTTP with files in a temp home.
#include "query/client_state.h"

#include <gtest/gtest.h>

#include <mutex>
#include <thread>

#include "bagview/tvx_bag.h"
#include "cache/query_cache.h"
#include "query/client_state_manager.h"
#include "support/query_fixture.h"

namespace tavix::query_testing {
namespace {

using tavix::testing::waitFor;

// What one bag() call answered.
struct BagAnswer {
  std::mutex lock;
  int calls = 0;
  std::shared_ptr<const TVXBag> bag;
  std::optional<TVXError> error;
  ClientState::BagReply reply() {
    return [this](std::shared_ptr<const TVXBag> b, std::optional<TVXError> e) {
      std::lock_guard hold(lock);
      ++calls;
      bag = std::move(b);
      error = std::move(e);
    };
  }
  int count() {
    std::lock_guard hold(lock);
    return calls;
  }
};

// The bag wait runs on virtual time; the bag itself comes from the development server.
class ClientStateTest : public QueryFixture {
 protected:
  ClientStateTest() : QueryFixture(true) {}
};

TEST_F(ClientStateTest, ABagChangeEndsTheWaitAndAHeldBagAnswersAtOnce) {
  fault("/bag", {{"status", 500}});
  startBagController();
  // A wait that runs out is the search's (VirtualTimeTest). A bag change during the wait ends it
  // at once, with the bag labelled for the waiting client; the timer that would have ended it
  // later stays silent.
  BagAnswer waiting;
  auto news = make("com.norvel.news");
  news->bag("news/1", waiting.reply());
  assembly.notificationCenter->post(kTVXBagChangeNotification, nullptr, {},
                                    bagChangeUserInfo(TVXBag(platform::Dictionary{{"enabled", true}}, "controller")));
  pool.drain();
  ASSERT_EQ(waiting.count(), 1);
  ASSERT_TRUE(waiting.bag);
  EXPECT_EQ(waiting.bag->userAgent(), "news/1");
  advance(kTVXFirstLaunchBagSemaphoreWait / 1000.0);
  EXPECT_EQ(waiting.count(), 1);

  // Held now: answered at once.
  BagAnswer held;
  news->bag("news/1", held.reply());
  EXPECT_EQ(held.count(), 1);
  EXPECT_EQ(held.bag, waiting.bag);
}

TEST_F(ClientStateTest, NewUserAgentRelabelsTheBagAndEmptiesTheQueryCache) {
  serveBag(bagWith());
  auto state = make("com.norvel.seekara");
  BagAnswer first;
  state->bag("seekara/1", first.reply());
  ASSERT_EQ(first.count(), 1);
  auto bag = first.bag;
  ASSERT_TRUE(bag) << (first.error ? first.error->reason : "");
  ASSERT_TRUE(state->queryCache());
  platform::Dictionary reply{{"query", "camera"}};
  state->queryCache()->set(makeRef<CachedResultSet>("ca", nullptr, reply, "u", "[1]", clock.now()));
  ASSERT_TRUE(waitFor([&] { return state->queryCache()->count() == 1; }));

  BagAnswer second;
  state->bag("seekara/2", second.reply());
  ASSERT_TRUE(second.bag);
  EXPECT_EQ(second.bag->userAgent(), "seekara/2");
  EXPECT_EQ(second.bag->sharedRawBag(), bag->sharedRawBag()) << "re-labelled, not fetched again";
  EXPECT_EQ(state->queryCache()->count(), 0u);

  // The tool's path: an empty user agent leaves the state without one, and a bag is refused.
  state->updateClient("");
  EXPECT_FALSE(state->userAgent());
  BagAnswer none;
  state->bag("", none.reply());
  ASSERT_EQ(none.count(), 1) << "answered at once";
  ASSERT_TRUE(none.error);
  EXPECT_EQ(none.error->reason, "no UserAgent");
}

TEST_F(ClientStateTest, ManagerSharesStatesAndPersistsNothingUnlessAsked) {
  startBagController();
  auto manager = testing::makeClientStateManager(*this);
  EXPECT_EQ(manager->stateForClientIdentifier(""), nullptr);

  std::shared_ptr<ClientState> a, b;
  std::thread t1([&] { a = manager->stateForClientIdentifier("com.norvel.seekara"); });
  b = manager->stateForClientIdentifier("com.norvel.seekara");
  t1.join();
  ASSERT_TRUE(a);
  EXPECT_EQ(a, b);
  a->setUserAgent("seekara/1");
  manager->saveState();
  pool.drain();
  EXPECT_FALSE(defaults->objectForKey("sessions")) << "persistence is off by default";
  ASSERT_EQ(manager->sessions().size(), 1u);
}

}  // namespace
}  // namespace tavix::query_testing
