// Searches through the real daemon's socket (libtavix) against the tavix-devserver program: what
// the client gets back, what reached the server, and the records left in the client's session.
#include <gtest/gtest.h>

#include <google/protobuf/text_format.h>

#include <filesystem>
#include <future>
#include <mutex>
#include <optional>

#include "support/query_daemon.h"
#include "tavix_proto/feedback_session.pb.h"

namespace {

using namespace tavix;
using tavix::testing::json;
using tavix::testing::QueryDaemonTest;

TEST_F(QueryDaemonTest, ClientsHearTheBagWhenTheyConfigureWhenTheyAskAndWhenItChanges) {
  ASSERT_FALSE(server.base.empty());
  startDaemon();
  // A second client of the same identifier hears the bag in its own right.
  std::mutex lock;
  std::vector<proto::BagDidLoad> loads;
  client::Client second(clientOptions("com.norvel.seekara", "seekara/1.0"));
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

TEST_F(QueryDaemonTest, FeedbackIsTiedToItsQueryWarmsTheConnectionAndFeedsEngagedCompletions) {
  ASSERT_FALSE(server.base.empty());
  serveBag({{"smart_history_enabled", true}});
  startDaemon();
  auto report = [&](const std::string& text, std::uint64_t id) {
    proto::CTFeedbackPayload payload;
    ASSERT_TRUE(google::protobuf::TextFormat::ParseFromString(text, &payload)) << text;
    proto::Envelope e;
    e.mutable_report_feedback_payload_data()->set_data(payload.SerializeAsString());
    e.mutable_report_feedback_payload_data()->set_query_id(id);
    ASSERT_TRUE(app->post(e));
  };

  // The search view appears from the today view: a search is likely, so the connection is warmed
  // once; a second appearance within 30 seconds does not warm again.
  report("type: 1 search_view_appear { trigger_event: today_view }", 1);
  report("type: 1 search_view_appear { trigger_event: today_view }", 2);
  ASSERT_TRUE(waitForRecord("search_view_appear", 2)) << dumpRecords();
  EXPECT_TRUE(tavix::testing::waitFor([&] { return served("/warm") == 1; })) << tavixd->log();
  EXPECT_EQ(served("/warm"), 1);

  // An engaged completion: the record takes the query id of its result, not the one sent beside
  // it, and the completion goes into the device's history and a completion-feature file.
  report(R"(type: 7 result_engagement { input: "wea" result { query_id: 777 completion: "weather in lisbon"
            result_type: server_suggest } })",
         5);
  ASSERT_TRUE(waitForRecord("result_engagement", 777)) << dumpRecords();
  const auto folder = home.cache() / "com.norvel.tavixd" / "CustomFeedback" / "EngagedCompletion";
  json feature;
  tavix::testing::waitFor([&] {
    std::error_code ec;
    for (const auto& file : std::filesystem::directory_iterator(folder, ec)) {
      feature = json::parse(tavix::testing::readFile(file.path()), nullptr, false);
    }
    return !feature.is_null();
  });
  EXPECT_EQ(feature, (json{{"lc", "weather in lisbon"}, {"q", "wea"}, {"e", true}, {"c", 2}})) << tavixd->log();

  // Undecodable payloads are refused with a log line; the daemon goes on.
  proto::Envelope bad;
  bad.mutable_report_feedback_payload_data()->set_data("\xff\xff not a payload");
  ASSERT_TRUE(app->post(bad));
  EXPECT_TRUE(tavixd->waitForLog("Failed deserializing _CTFeedbackPayload."));
  EXPECT_TRUE(send(request("weather")).replied);
}

}  // namespace
