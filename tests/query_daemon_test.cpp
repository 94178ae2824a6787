// Searches through the real daemon's socket (libtavix) against the tavix-devserver program: what
// the client gets back, what reached the server, and the records left in the client's session.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <condition_variable>
#include <future>
#include <mutex>
#include <optional>

#include <nlohmann/json.hpp>

#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "support/daemon_process.h"
#include "support/devserver_process.h"
#include "support/temp_home.h"
#include "tavix/client.h"
#include "tavix_proto/feedback_session.pb.h"

namespace {

using nlohmann::json;
using namespace tavix;

struct Answer {
  bool replied = false;
  std::uint64_t queryId = 0;
  std::optional<proto::TVXReply> reply;
  std::optional<client::Error> error;
  int calls = 0;
};

class QueryDaemonTest : public ::testing::Test {
 protected:
  std::string call(const std::string& path, const std::string& method = "GET", std::string body = {}) {
    platform::http::URLRequest r;
    r.url = server.base + path;
    r.method = method;
    r.body = std::move(body);
    std::promise<std::string> done;
    session.dataTask(r, [&](std::string data, auto, auto) { done.set_value(std::move(data)); })->resume();
    return done.get_future().get();
  }
  void fault(const json& f) { call("/_faults", "POST", f.dump()); }
  int served(const std::string& path) {
    int n = 0;
    for (const auto& r : json::parse(call("/_recorded"))) n += r["path"] == path;
    return n;
  }
  // The devserver's bag with `changes` applied, served in its place from now on.
  void serveBag(const json& changes) {
    json bag = json::parse(call("/bag"));
    bag.merge_patch(changes);
    fault({{"path", "/bag"}, {"body", bag.dump()}});
  }

  void startDaemon() {
    {
      platform::UserDefaults defaults(home.config() / "com.norvel.tavixd", "com.norvel.tavixd");
      defaults.setObject("TVXBagURL", server.base + "/bag");
      ASSERT_TRUE(defaults.synchronize());
    }
    tavixd.emplace(TAVIXD_BINARY, home, std::vector<std::string>{"--socket", socket(), "--log-level", "debug"});
    ASSERT_TRUE(tavixd->waitForLog("tavixd started")) << tavixd->log();
    // With the bag in, no client waits for it (a wait counts as network use and delays warming).
    ASSERT_TRUE(tavixd->waitForLog("bag change notification received")) << tavixd->log();
    client::Client::Options options;
    options.socketPath = socket();
    options.configuration.set_identifier("com.norvel.seekara");
    options.configuration.set_user_agent("seekara/1.0");
    app.emplace(options);
    ASSERT_FALSE(app->connect());
  }
  std::string socket() const { return (home.runtime() / "tavixd.socket").string(); }

  proto::TVXRequest request(const std::string& input) {
    proto::TVXRequest r;
    r.set_query_id(++queryId);
    r.set_query_string(input);
    r.set_trigger_event(21);
    r.mutable_search();
    return r;
  }
  // Sends and waits (15 s at most) for the reply.
  Answer send(const proto::TVXRequest& r) {
    auto answer = std::make_shared<Answer>();
    auto done = std::make_shared<std::promise<void>>();
    app->request(r, [answer, done](std::uint64_t id, auto reply, auto error) {
      if (answer->calls++ == 0) {
        answer->queryId = id;
        answer->reply = std::move(reply);
        answer->error = std::move(error);
        answer->replied = true;
        done->set_value();
      }
    });
    done->get_future().wait_for(std::chrono::seconds(15));
    return *answer;
  }
  // The records of the client's open session, as JSON objects.
  std::vector<json> records() {
    proto::Envelope e;
    e.mutable_feedback();
    proto::Envelope reply;
    EXPECT_FALSE(app->callSync(e, &reply));
    std::vector<json> out;
    for (const auto& text : reply.feedback_reply().feedbacks()) out.push_back(json::parse(text));
    return out;
  }
  std::string dumpRecords() {
    std::string out;
    for (const auto& r : records()) out += r.dump() + "\n";
    return out;
  }
  // Waits until the session holds a record of `type` for `queryId`; answers it.
  std::optional<json> waitForRecord(const std::string& type, std::uint64_t id) {
    std::optional<json> found;
    tavix::testing::waitFor([&] {
      for (auto& r : records()) {
        if (r.value("type", "") == type && r.value("query_id", std::int64_t(-1)) == static_cast<std::int64_t>(id)) {
          found = r;
          return true;
        }
      }
      return false;
    });
    return found;
  }

  tavix::testing::TempHome home;
  tavix::testing::DevServerProcess server{DEVSERVER_BINARY};
  platform::DispatchPool pool{1};
  platform::http::URLSession session{platform::http::URLSessionConfiguration{.delegatePool = &pool}};
  std::optional<tavix::testing::DaemonProcess> tavixd;
  std::optional<client::Client> app;
  std::uint64_t queryId = 100;
};

TEST_F(QueryDaemonTest, ClientsHearTheBagWhenTheyConfigureWhenTheyAskAndWhenItChanges) {
  ASSERT_FALSE(server.base.empty());
  startDaemon();
  // A second client of the same identifier hears the bag in its own right.
  std::mutex lock;
  std::condition_variable arrived;
  std::vector<proto::BagDidLoad> loads;
  client::Client::Options options;
  options.socketPath = socket();
  options.configuration.set_identifier("com.norvel.seekara");
  options.configuration.set_user_agent("seekara/1.0");
  client::Client second(options);
  second.setBagDidLoadHandler([&](const proto::BagDidLoad& load) {
    std::lock_guard hold(lock);
    loads.push_back(load);
    arrived.notify_all();
  });
  auto waitForLoads = [&](std::size_t n) {
    std::unique_lock hold(lock);
    return arrived.wait_for(hold, std::chrono::seconds(15), [&] { return loads.size() >= n; });
  };
  ASSERT_FALSE(second.connect());
  ASSERT_TRUE(waitForLoads(1)) << tavixd->log();
  {
    std::lock_guard hold(lock);
    ASSERT_EQ(loads.size(), 1u);
    EXPECT_FALSE(loads[0].has_error());
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
  EXPECT_EQ((*skip)["input"], "weather");
  EXPECT_EQ(served("/search"), 0);
}

TEST_F(QueryDaemonTest, ShortInputsCacheHitsBadBodiesAndBrokenConnections) {
  ASSERT_FALSE(server.base.empty());
  serveBag({{"min_query_length", 3}});
  startDaemon();

  // Shorter than the bag's minimum: neither result nor error, and a skip record.
  auto shortInput = send(request("we"));
  ASSERT_TRUE(shortInput.replied);
  EXPECT_FALSE(shortInput.reply);
  EXPECT_FALSE(shortInput.error);
  auto skip = waitForRecord("skip_tavix_search", queryId);
  ASSERT_TRUE(skip) << tavixd->log();
  EXPECT_EQ((*skip)["reason"], "less_than_minimum_query_length") << skip->dump();
  EXPECT_EQ(served("/search"), 0);

  // The same keystroke twice: the second never reaches the server.
  auto first = send(request("weather"));
  ASSERT_TRUE(first.reply) << (first.error ? first.error->describe() : "");
  EXPECT_NE(first.reply->data().find("weather"), std::string::npos);
  EXPECT_TRUE(waitForRecord("network_search_start", queryId)) << dumpRecords();
  EXPECT_TRUE(waitForRecord("network_search_end", queryId));
  auto second = send(request("weather"));
  ASSERT_TRUE(second.reply);
  EXPECT_EQ(second.reply->data(), first.reply->data());
  EXPECT_TRUE(waitForRecord("cache_hit", queryId)) << tavixd->log();
  EXPECT_EQ(served("/search"), 1);

  // A body that is not JSON reaches the client with the parse error, and is not cached.
  fault({{"path", "/search"}, {"body", "<html>oops</html>"}});
  auto garbage = send(request("zebra crossing"));
  ASSERT_TRUE(garbage.reply);
  EXPECT_EQ(garbage.reply->data(), "<html>oops</html>");
  ASSERT_TRUE(garbage.error);
  auto again = send(request("zebra crossing"));
  ASSERT_TRUE(again.replied);
  EXPECT_EQ(served("/search"), 3) << "the unparsed body was cached";

  // The server resets the connection: one error reply, and the daemon goes on.
  fault({{"path", "/search"}, {"reset", true}});
  auto reset = send(request("yellowstone"));
  ASSERT_TRUE(reset.replied);
  EXPECT_FALSE(reset.reply);
  EXPECT_TRUE(reset.error);
  EXPECT_TRUE(waitForRecord("error", queryId)) << tavixd->log();

  // A card answered with 204 is a failure.
  fault({{"path", "/card"}, {"status", 204}, {"body", ""}});
  auto card = request("");
  card.mutable_card();
  auto cardAnswer = send(card);
  ASSERT_TRUE(cardAnswer.replied);
  EXPECT_TRUE(cardAnswer.error);
  EXPECT_FALSE(cardAnswer.reply);

  EXPECT_TRUE(tavixd->alive());
  EXPECT_EQ(tavixd->stop(), 0);
}

TEST_F(QueryDaemonTest, FeedbackIsTiedToItsQueryWarmsTheConnectionAndFeedsEngagedCompletions) {
  ASSERT_FALSE(server.base.empty());
  serveBag({{"smart_history_enabled", true}});
  startDaemon();
  auto report = [&](const proto::CTFeedbackPayload& payload, std::uint64_t id) {
    proto::Envelope e;
    e.mutable_report_feedback_payload_data()->set_data(payload.SerializeAsString());
    e.mutable_report_feedback_payload_data()->set_query_id(id);
    ASSERT_TRUE(app->post(e));
  };

  // The search view appears from the today view: a search is likely, so the connection is warmed
  // once; a second appearance within 30 seconds does not warm again.
  proto::CTFeedbackPayload appear;
  appear.set_type(1);
  appear.mutable_search_view_appear()->set_trigger_event(proto::AppearEvent::today_view);
  report(appear, 1);
  report(appear, 2);
  ASSERT_TRUE(waitForRecord("search_view_appear", 2)) << dumpRecords();
  EXPECT_TRUE(tavix::testing::waitFor([&] { return served("/warm") == 1; })) << tavixd->log();
  EXPECT_EQ(served("/warm"), 1);

  // An engaged completion: the record takes the query id of its result, not the one sent beside
  // it, and the completion goes into the device's history and a completion-feature file.
  proto::CTFeedbackPayload engaged;
  engaged.set_type(7);
  auto* engagement = engaged.mutable_result_engagement();
  engagement->set_input("wea");
  engagement->mutable_result()->set_query_id(777);
  engagement->mutable_result()->set_completion("weather in lisbon");
  engagement->mutable_result()->set_result_type(proto::ResultType::server_suggest);
  report(engaged, 5);
  auto record = waitForRecord("result_engagement", 777);
  ASSERT_TRUE(record) << dumpRecords();
  const auto folder = home.cache() / "com.norvel.tavixd" / "CustomFeedback" / "EngagedCompletion";
  std::optional<json> feature;
  tavix::testing::waitFor([&] {
    std::error_code ec;
    for (const auto& file : std::filesystem::directory_iterator(folder, ec)) {
      std::ifstream in(file.path());
      feature = json::parse(in, nullptr, false);
      return true;
    }
    return false;
  });
  ASSERT_TRUE(feature) << tavixd->log();
  EXPECT_EQ(*feature, (json{{"lc", "weather in lisbon"}, {"q", "wea"}, {"e", true}, {"c", 2}}));

  // Undecodable payloads are refused with a log line; the daemon goes on.
  proto::Envelope bad;
  bad.mutable_report_feedback_payload_data()->set_data("\xff\xff not a payload");
  ASSERT_TRUE(app->post(bad));
  EXPECT_TRUE(tavixd->waitForLog("Failed deserializing _CTFeedbackPayload."));
  EXPECT_TRUE(send(request("weather")).replied);
}

}  // namespace
