// The client state's bag handling and the state table, against the development server over
// loopback HTTP with files in a temp home.
#include "query/client_state.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <thread>

#include "bag/tavix_bag_controller.h"
#include "bag/tvx_bag.h"
#include "cache/query_cache.h"
#include "core/assembly.h"
#include "devserver/devserver.h"
#include "network/request_factory.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "platform/notification_center.h"
#include "query/client_state_manager.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

using Clock = std::chrono::steady_clock;
using tavix::testing::waitFor;

class ClientStateTest : public ::testing::Test {
 protected:
  ClientStateTest() {
    EXPECT_TRUE(server.start({}, nullptr));
    defaults = std::make_shared<platform::UserDefaults>(home.config(), "com.norvel.tavixd");
    defaults->setObject("TVXBagURL", server.baseURL() + "/bag");
    assembly.dispatchPool = &pool;
    assembly.clock = &clock;
    assembly.paths = platform::Paths{home.cache(), home.config(), home.runtime()};
    assembly.userDefaults = defaults;
    assembly.notificationCenter = std::make_shared<platform::NotificationCenter>();
    assembly.requestFactory = TVXNetworkRequestFactory::create(assembly);
  }
  // After any fault on /bag has been set, so that no fetch slips by it.
  void startController() { assembly.bagController = TavixBagController::create(assembly); }
  ~ClientStateTest() override {
    states.clear();
    if (assembly.bagController) assembly.bagController->invalidate();
    pool.drain();
    assembly.bagController.reset();
    assembly.requestFactory.reset();
  }

  void post(const std::string& path, const std::string& body) {
    platform::http::URLRequest r;
    r.url = server.baseURL() + path;
    r.method = "POST";
    r.body = body;
    std::promise<void> done;
    assembly.urlSession()->dataTask(r, [&](auto, auto, auto) { done.set_value(); })->resume();
    done.get_future().wait();
  }
  void delayBag(int ms) { post("/_faults", R"({"path": "/bag", "delay_ms": )" + std::to_string(ms) + "}"); }

  std::shared_ptr<ClientState> make(const std::string& identifier = "com.norvel.seekara") {
    states.push_back(ClientState::create(assembly, identifier));
    return states.back();
  }

  // Asks for the bag and answers (bag, error, milliseconds taken).
  std::tuple<std::shared_ptr<const TVXBag>, std::optional<TVXError>, long> askBag(ClientState& state,
                                                                                  const std::string& agent) {
    std::shared_ptr<const TVXBag> bag;
    std::optional<TVXError> error;
    int calls = 0;
    const auto start = Clock::now();
    state.bag(agent, [&](auto b, auto e) {
      ++calls;
      bag = b;
      error = e;
    });
    const long ms = std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
    EXPECT_EQ(calls, 1);
    return {bag, error, ms};
  }

  testing::TempHome home;
  devserver::DevServer server;
  platform::DispatchPool pool{8};
  platform::SystemClock clock{pool};
  std::shared_ptr<platform::UserDefaults> defaults;
  Assembly assembly;
  std::vector<std::shared_ptr<ClientState>> states;
};

TEST_F(ClientStateTest, AnswersErrorsWithoutUserAgentOrInTimeAndRecovers) {
  delayBag(1500);
  startController();
  auto state = make();
  auto [noBag, noAgent, _] = askBag(*state, "");
  EXPECT_FALSE(noBag);
  ASSERT_TRUE(noAgent);
  EXPECT_EQ(noAgent->code, 1);
  EXPECT_EQ(noAgent->reason, "no UserAgent");

  // First launch ever: the query waits the long wait, then gives up.
  auto [late, timeout, waited] = askBag(*state, "seekara/1");
  EXPECT_FALSE(late);
  ASSERT_TRUE(timeout);
  EXPECT_EQ(timeout->reason, "timeout");
  EXPECT_GE(waited, kTVXFirstLaunchBagSemaphoreWait - 20);
  EXPECT_LT(waited, 1400);

  // The fetch still lands; the state then has the bag, labelled with its own user agent, at once.
  ASSERT_TRUE(waitFor([&] { return state->currentBag() != nullptr; }, 5000));
  auto [bag, error, quick] = askBag(*state, "seekara/1");
  ASSERT_TRUE(bag);
  EXPECT_FALSE(error);
  EXPECT_EQ(bag->userAgent(), "seekara/1");
  EXPECT_LT(quick, 100);
}

TEST_F(ClientStateTest, ABagArrivingEndsTheWaitAndAKnownDeviceWaitsLess) {
  defaults->setObject("download_resources", platform::PropertyValue::Array{});
  delayBag(1500);
  startController();

  // A bag change that comes during the wait ends it at once; the query goes on with that bag.
  auto waiting = make("com.norvel.news");
  auto raw = std::make_shared<const platform::Dictionary>(platform::Dictionary{{"enabled", true}});
  std::thread poster([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    assembly.notificationCenter->post(kTVXBagChangeNotification, nullptr,
                                      std::make_shared<const TVXBag>(raw, "controller"));
  });
  auto [bag, noError, ms] = askBag(*waiting, "news/1");
  poster.join();
  ASSERT_TRUE(bag);
  EXPECT_FALSE(noError);
  EXPECT_LT(ms, kTVXDefaultBagSemaphoreWait);
  EXPECT_EQ(bag->userAgent(), "news/1");

  // The controller's fetch is still on its way: a state that missed the change waits the short
  // wait (resources were recorded, so this is not a first launch) and gives up.
  auto slow = make("com.norvel.brovane");
  auto [none, error, waited] = askBag(*slow, "brovane/1");
  EXPECT_FALSE(none);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->reason, "timeout");
  EXPECT_GE(waited, kTVXDefaultBagSemaphoreWait - 20);
  EXPECT_LT(waited, kTVXFirstLaunchBagSemaphoreWait - 50);
}

TEST_F(ClientStateTest, NewUserAgentRelabelsTheBagAndEmptiesTheQueryCache) {
  startController();
  auto state = make();
  auto [bag, error, _] = askBag(*state, "seekara/1");
  ASSERT_TRUE(bag) << (error ? error->reason : "");
  ASSERT_TRUE(state->queryCache());
  platform::Dictionary reply{{"query", "camera"}};
  state->queryCache()->set(makeRef<CachedResultSet>("ca", nullptr, reply, "u", "[1]", clock.now()));
  ASSERT_TRUE(waitFor([&] { return state->queryCache()->count() == 1; }));

  auto [relabelled, none, ms] = askBag(*state, "seekara/2");
  ASSERT_TRUE(relabelled);
  EXPECT_EQ(relabelled->userAgent(), "seekara/2");
  EXPECT_EQ(relabelled->sharedRawBag(), bag->sharedRawBag()) << "re-labelled, not fetched again";
  EXPECT_EQ(state->queryCache()->count(), 0u);

  // The tool's path: same user agent again changes nothing, a new one re-labels.
  state->updateClient("seekara/2");
  EXPECT_EQ(state->currentBag(), relabelled);
  state->updateClient("tool/3");
  EXPECT_EQ(state->currentBag()->userAgent(), "tool/3");
}

TEST_F(ClientStateTest, ManagerSharesStatesAndPersistsOnlyWhenAsked) {
  startController();
  auto manager = std::make_shared<ClientStateManager>(assembly);
  EXPECT_EQ(manager->stateForClientIdentifier(""), nullptr);

  std::shared_ptr<ClientState> a, b;
  std::thread t1([&] { a = manager->stateForClientIdentifier("com.norvel.seekara"); });
  std::thread t2([&] { b = manager->stateForClientIdentifier("com.norvel.seekara"); });
  t1.join();
  t2.join();
  ASSERT_TRUE(a);
  EXPECT_EQ(a, b);
  a->setUserAgent("seekara/1");
  manager->saveState();
  pool.drain();
  EXPECT_FALSE(defaults->objectForKey("sessions")) << "persistence is off by default";
  ASSERT_EQ(manager->sessions().size(), 1u);

  // Persisted: an element without identifier is skipped; one without agent makes a state that the
  // next save leaves out.
  defaults->setObject("TVXPersistSessions", true);
  defaults->setObject(
      "sessions", platform::PropertyValue::Array{
                      platform::Dictionary{{"agent", "lost/1"}},
                      platform::Dictionary{{"identifier", "com.norvel.brovane"}, {"agent", "brovane/7"}},
                      platform::Dictionary{{"identifier", "com.norvel.news"}},
                  });
  auto loaded = std::make_shared<ClientStateManager>(assembly);
  auto sessions = loaded->sessions();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(*sessions[0].dictionary()->at("agent").string(), "brovane/7");
  EXPECT_EQ(loaded->stateForClientIdentifier("com.norvel.brovane")->userAgent(), "brovane/7");
  EXPECT_FALSE(loaded->stateForClientIdentifier("com.norvel.news")->userAgent());
  loaded->stateForClientIdentifier("com.norvel.seekara")->setUserAgent("seekara/9");
  loaded->saveState();
  pool.drain();
  auto saved = defaults->objectForKey("sessions");
  ASSERT_TRUE(saved && saved->array());
  EXPECT_EQ(saved->array()->size(), 2u);
}

}  // namespace
}  // namespace tavix
