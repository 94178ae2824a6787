// Searches through the real daemon's socket (libtavix) against the tavix-devserver program: what
// the client gets back, what reached the server, and the records left in the client's session.
#include <gtest/gtest.h>

#include <algorithm>
#include <future>
#include <mutex>
#include <optional>

#include "support/query_daemon.h"

namespace {

using namespace tavix;
using tavix::testing::json;
using tavix::testing::QueryDaemonTest;

TEST_F(QueryDaemonTest, ClientsHearTheBagWhenTheyConfigureWhenTheyAskAndWhenItChanges) {
  ASSERT_FALSE(server.base.empty());
  tavix::testing::setDaemonDefaults(home, {{"TVXStorefrontIdentifier", "143441-1,29"}});
  startDaemon();
  // A second client of the same identifier hears the bag in its own right.
  std::mutex lock;
  std::vector<proto::BagDidLoad> loads;
  client::Client second(tavixd->clientOptions("com.norvel.seekara", "seekara/1.0"));
  second.setBagDidLoadHandler([&](const proto::BagDidLoad& load) {
    std::lock_guard hold(lock);
    loads.push_back(load);
  });
  auto waitForLoads = [&](std::size_t n) {
    return tavix::testing::waitFor([&] {
      std::lock_guard hold(lock);
      return loads.size() >= n;
    }, 15000);
  };
  ASSERT_FALSE(second.connect());
  ASSERT_TRUE(waitForLoads(1)) << tavixd->log();
  {
    std::lock_guard hold(lock);
    ASSERT_EQ(loads.size(), 1u);
    EXPECT_EQ(loads[0].bag().version(), "1");
    EXPECT_NE(loads[0].bag().user_agent().find(") seekara/1.0"), std::string::npos) << loads[0].bag().user_agent();
    EXPECT_EQ(json::parse(loads[0].bag().json())["search_url"], server.base + "/search");
  }

  // Asked for, the bag comes back as the reply.
  std::promise<std::optional<proto::TVXBagData>> asked;
  second.bag([&](auto bag, auto error) { asked.set_value(error ? std::nullopt : bag); });
  auto bag = asked.get_future().get();
  ASSERT_TRUE(bag);
  EXPECT_EQ(bag->version(), "1");

  // The server asks for a newer bag: it reaches the client as a new bagDidLoad.
  serveBag({{"version", "2"}});
  fault({{"path", "/search"}, {"headers", {{"X-Norvel-ForceFetch", R"({"bag": 2})"}}}, {"times", 1}});
  EXPECT_TRUE(send(request("weather")).reply);
  const json searches = json::parse(call("/_recorded"));
  EXPECT_TRUE(std::any_of(searches.begin(), searches.end(), [](const json& r) {
    return r["path"] == "/search" && r["query"].value("storefront", "") == "143441-1,29";
  })) << "the store front from the defaults goes with each search";
  ASSERT_TRUE(waitForLoads(2)) << tavixd->log();
  std::lock_guard hold(lock);
  EXPECT_EQ(loads.back().bag().version(), "2");
  EXPECT_NE(loads.back().bag().user_agent().find(") seekara/1.0"), std::string::npos);
}

TEST_F(QueryDaemonTest, DisabledBagAnswersNothingAndNeverAsksTheServer) {
  ASSERT_FALSE(server.base.empty());
  serveBag({{"enabled", false}});
  startDaemon();
  auto answer = send(request("weather"));
  ASSERT_TRUE(answer.replied);
  EXPECT_EQ(answer.queryId, queryId);
  EXPECT_FALSE(answer.reply);
  EXPECT_FALSE(answer.error);
  auto skip = waitForRecord("skip_tavix_search", queryId);
  ASSERT_TRUE(skip) << dumpRecords() << tavixd->log();
  EXPECT_EQ((*skip)["reason"], "bag_disabled") << skip->dump();
  EXPECT_EQ(served("/search"), 0);
}

}  // namespace
