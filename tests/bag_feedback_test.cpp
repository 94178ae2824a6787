// Bag fetches written as feedback sessions, and the bag's feedback switch in the session manager:
// the real bag controller, session manager and session files against the development server over
// loopback HTTP.
#include <gtest/gtest.h>

#include <future>
#include <nlohmann/json.hpp>

#include "bagview/tvx_bag.h"
#include "support/query_fixture.h"

namespace tavix {
namespace {

using tavix::testing::waitFor;

class BagFeedbackTest : public query_testing::QueryFixture {
 protected:
  // A session manager that asks the bag whether each client's feedback is wanted.
  BagFeedbackTest() : QueryFixture(true) {
    startBagController();
    assembly.clientSessionManager = std::make_shared<ClientSessionManager>(
        sessionManagerEnvironment(assembly), assembly.guidController, assembly.bagController, "tavix");
  }

  std::optional<TVXBagError> fetch() {
    std::promise<std::optional<TVXBagError>> done;
    EXPECT_TRUE(assembly.bagController->fetchBagStateWithVersion(std::nullopt,
                                                                 [&](auto, auto error) { done.set_value(error); }));
    auto error = done.get_future().get();
    EXPECT_TRUE(waitFor([&] { return !assembly.bagController->fetchInProgress(); }));
    return error;
  }

  // The waiting sessions, oldest file first, read back; consumed (deleted) as they are read.
  std::vector<proto::CTClientSession> takeSessions() {
    pool.drain();
    std::vector<proto::CTClientSession> out;
    for (auto& handle : assembly.persistentStorage->getAvailableSessionHandles()) {
      if (auto record = handle->readRecord()) out.push_back(*record);
      assembly.persistentStorage->deleteSessionWithFileContainer(handle);
    }
    pool.drain();
    return out;
  }

  FeedbackRef event(const std::string& agent) {
    proto::CTCacheHitFeedback hit;
    hit.set_input("x");
    return makeTavixFeedbackWithCodable(hit, 3, "", agent);
  }
};

TEST_F(BagFeedbackTest, EachFetchIsASessionOfItsOwnWithStartEndAndFailure) {
  const std::string agent = assembly.bagController->userAgent().value_or("");
  ASSERT_FALSE(agent.empty());
  ASSERT_FALSE(fetch());

  auto sessions = takeSessions();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(sessions[0].agent(), agent);
  ASSERT_EQ(sessions[0].feedbacks_size(), 2);
  EXPECT_EQ(sessions[0].feedbacks(0).user_guid(), assembly.guidController->currentUserGUID());
  const auto& start = sessions[0].feedbacks(0).payload().network_search_start();
  EXPECT_EQ(start.endpoint_type(), proto::EndpointType::tavix_bag);
  EXPECT_EQ(start.headers().at("User-Agent"), agent);
  const auto& end = sessions[0].feedbacks(1).payload().network_search_end();
  EXPECT_FALSE(end.uuid().empty());
  EXPECT_EQ(end.uuid(), start.uuid());
  EXPECT_EQ(end.status_code(), 200);
  EXPECT_EQ(end.peer_address(), "127.0.0.1");

  // A server error: the end record carries the status, then the failure follows.
  fault("/bag", {{"status", 503}, {"body", "busy"}, {"times", 1}});
  ASSERT_TRUE(fetch());
  sessions = takeSessions();
  ASSERT_EQ(sessions.size(), 1u);
  ASSERT_EQ(sessions[0].feedbacks_size(), 3);
  EXPECT_EQ(sessions[0].feedbacks(1).payload().network_search_end().status_code(), 503);
  EXPECT_EQ(sessions[0].feedbacks(2).payload().error().reason(), "statusCode 503");

  // Fetch sessions stay apart from the clients' session of the manager.
  EXPECT_FALSE(assembly.clientSessionManager->hasSession());
}

TEST_F(BagFeedbackTest, ABagThatDisablesFeedbackForAClientDropsItsEvents) {
  auto& manager = *assembly.clientSessionManager;
  // No bag yet: events are kept.
  manager.addTavixFeedback(event("com.norvel.Brovane/17"));
  EXPECT_EQ(manager.currentState(), ClientSessionManager::kActive);
  manager.flushSession();
  EXPECT_EQ(manager.currentState(), ClientSessionManager::kNoSession);

  const nlohmann::json bag = {{"version", "7"},
                              {"feedback_enabled", true},
                              {"clients", {{"brovane", {{"feedback_enabled", false}}}}}};
  fault("/bag", {{"body", bag.dump()}, {"times", 1}});
  ASSERT_FALSE(fetch());
  ASSERT_TRUE(assembly.bagController->inMemoryBag());
  takeSessions();

  manager.addTavixFeedback(event("com.norvel.Brovane/17"));
  EXPECT_EQ(manager.currentState(), ClientSessionManager::kNoSession);
  manager.addTavixFeedback(event("seekara/3"));
  EXPECT_EQ(manager.currentState(), ClientSessionManager::kActive);
  manager.addTavixFeedback(event("com.norvel.Brovane/17"));
  manager.flushSession();
  manager.currentState();
  auto sessions = takeSessions();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(sessions[0].agent(), "seekara/3");
  for (const auto& f : sessions[0].feedbacks()) EXPECT_NE(f.user_agent(), "com.norvel.Brovane/17");

  // A bag without the key disables feedback for everyone.
  fault("/bag", {{"body", R"({"version": "8"})"}, {"times", 1}});
  ASSERT_FALSE(fetch());
  takeSessions();
  manager.addTavixFeedback(event("seekara/3"));
  EXPECT_EQ(manager.currentState(), ClientSessionManager::kNoSession);
}

}  // namespace
}  // namespace tavix
