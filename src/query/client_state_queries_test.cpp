// The other query kinds against the development server, including a back end that hangs, resets
// the connection or answers garbage.
#include <gtest/gtest.h>

#include <deque>
#include <functional>
#include <future>

#include "core/names.h"
#include "support/query_fixture.h"

namespace tavix::query_testing {
namespace {

using QueriesTest = QueryFixture;

// Sends one query of each kind.
struct Kind {
  const char* name;
  std::function<void(ClientState&, std::uint64_t, TVXReplyBlock)> send;
};

template <typename Request>
Kind kind(const char* name, void (ClientState::*method)(std::shared_ptr<const Request>, TVXReplyBlock),
          std::string text, std::function<void(Request&)> adjust = {}) {
  return {name, [=](ClientState& state, std::uint64_t id, TVXReplyBlock reply) {
            auto request = std::make_shared<Request>();
            request->queryId = id;
            request->queryString = text;
            request->triggerEvent = 1;
            if (adjust) adjust(*request);
            (state.*method)(request, std::move(reply));
          }};
}

TEST_F(QueriesTest, EveryKindRepliesExactlyOnceWhateverTheBackEndDoes) {
  // Short timeouts so that a hanging back end ends quickly: 0.4 s without progress per attempt,
  // and for look-ups and flights a deadline of 1.0 - 0.5 s.
  serveBag(bagWith({{"request_timeout_s", 0.4}, {"search_render_timeout_ms", 1000}}));
  auto state = make("com.norvel.seekara", "Seekara/1.0");
  // Searches differ by id, so that none is answered from the query cache.
  const std::vector<Kind> kinds = {
      kind<TVXSearchRequest>("search", &ClientState::search, "",
                             [](auto& r) { r.queryString = "camera" + std::to_string(r.queryId); }),
      kind("zero-keyword", &ClientState::zeroKeyword, ""), kind("more results", &ClientState::moreResults, "ca"),
      kind("card", &ClientState::card, ""), kind("look-up", &ClientState::lookup, "serendipity"),
      kind<TVXFlightSearchRequest>("flight", &ClientState::flightSearch, "", [](auto& f) { f.flightQuery = "UA 123"; })};

  struct Outcome {
    std::string what;
    std::shared_ptr<Replies> replies = std::make_shared<Replies>();
  };
  std::vector<Outcome> outcomes;
  std::uint64_t id = 100;
  // Each kind's good answer is checked in a test of its own.
  for (const auto& [backEnd, settings] : std::vector<std::pair<std::string, platform::Dictionary>>{
           {"hanging", {{"hang", true}}}, {"resetting", {{"reset", true}}}, {"garbage", {{"body", "\x01garbage\xff"}}}}) {
    for (const char* path : {"/search", "/more", "/card", "/flight"}) fault(path, settings);
    for (const auto& kind : kinds) {
      outcomes.push_back({backEnd + " " + kind.name});
      kind.send(*state, ++id, outcomes.back().replies->block());
    }
    for (auto& outcome : outcomes) outcome.replies->first(15000);
  }

  for (std::size_t i = 0; i < outcomes.size(); ++i) {
    const auto call = outcomes[i].replies->first(0);
    const bool garbage = outcomes[i].what.rfind("garbage", 0) == 0;
    // Garbage still reaches the search-like kinds, with the parse error; a flight body is not
    // JSON anyway. Everything else is an error.
    EXPECT_TRUE(call.error || (garbage && outcomes[i].what == "garbage flight")) << outcomes[i].what;
    if (outcomes[i].what.rfind("hanging", 0) == 0 && call.error) {
      EXPECT_EQ(call.error->code, platform::http::URLErrorTimedOut) << outcomes[i].what;
    }
    if (outcomes[i].what.rfind("resetting", 0) == 0 && call.error) {
      EXPECT_EQ(call.error->domain, platform::http::kURLErrorDomain) << outcomes[i].what;
    }
  }
  // Every request left a start record and either an end record or an error and end record, and
  // none was answered twice.
  auto starts = recordsOfType(*state, kFeedbackTypeNetworkSearchStart, outcomes.size());
  EXPECT_EQ(starts.size(), outcomes.size());
  auto ends = recordsOfType(*state, kFeedbackTypeNetworkSearchEnd, outcomes.size());
  EXPECT_EQ(ends.size(), outcomes.size());
  for (auto& outcome : outcomes) EXPECT_EQ(outcome.replies->count(), 1u) << outcome.what;
}

TEST_F(QueriesTest, CardsAndMoreResultsNeedStatus200AndAListAndGoOutOnce) {
  serveBag(bagWith({{"more_results_url", server.baseURL() + "/more?q=camera%20bag"}}));
  auto state = make("com.norvel.seekara", "Seekara/1.0");
  std::deque<Replies> replies;  // kept alive: a second answer is a fault to see, not a crash
  auto card = [&](std::uint64_t id, int ms = 10000) {
    state->card(request<TVXCardRequest>(id, "", 14), replies.emplace_back().block());
    return replies.back().first(ms);
  };
  auto more = [&](std::uint64_t id) {
    state->moreResults(request<TVXMoreResultsRequest>(id, ""), replies.emplace_back().block());
    return replies.back().first();
  };

  // They follow a result the client already has: without a bag of its own the state does not
  // wait for one, and the failure is recorded like any other.
  auto call = card(39, 0);
  ASSERT_TRUE(call.error) << "answered at once";
  EXPECT_EQ(call.error->domain, platform::http::kURLErrorDomain);
  EXPECT_EQ(recordsOfType(*state, kFeedbackTypeError).size(), 1u);
  ASSERT_TRUE(state->ensureBag());

  // A transport failure is not retried: no deadline, no retry.
  fault("/more", {{"reset", true}, {"times", 1}});
  EXPECT_TRUE(more(43).error);
  EXPECT_EQ(received("/more").size(), 1u);
  EXPECT_EQ(recordsOfType(*state, kFeedbackTypeError, 2).size(), 2u);

  call = card(40);
  ASSERT_TRUE(call.reply);
  EXPECT_EQ(call.reply->data.front(), '[');
  // The more-results record takes its input from the "q" of the URL the bag gives.
  auto starts = recordsOfType(*state, kFeedbackTypeNetworkSearchStart, 2);
  ASSERT_EQ(starts.size(), 2u);
  EXPECT_EQ(starts[0].payload().network_search_start().input(), "camera bag");
  EXPECT_EQ(starts[1].payload().network_search_start().endpoint_type(), 11);

  // A server's status is the server's: not in the daemon's own error domain.
  fault("/card", {{"status", 404}, {"body", ""}, {"times", 1}});
  call = card(41);
  EXPECT_FALSE(call.reply);
  ASSERT_TRUE(call.error);
  EXPECT_EQ(call.error->domain, kTVXHTTPStatusErrorDomain);
  EXPECT_EQ(call.error->code, 404);
  // A failure without a transport error: an empty error record and the end record with the status.
  auto errors = recordsOfType(*state, kFeedbackTypeError, 3);
  ASSERT_EQ(errors.size(), 3u);
  EXPECT_EQ(errors[2].payload().error().code(), 0);
  auto ends = recordsOfType(*state, kFeedbackTypeNetworkSearchEnd, 3);
  ASSERT_EQ(ends.size(), 3u);
  EXPECT_EQ(ends[2].payload().network_search_end().status_code(), 404);
  EXPECT_EQ(received("/card").size(), 2u);

  // More results: an object where a list belongs is a failure.
  fault("/more", {{"body", "{\"results\": []}"}, {"times", 1}});
  EXPECT_TRUE(more(42).error);
  EXPECT_EQ(recordsOfType(*state, kFeedbackTypeError, 4).size(), 4u);
  EXPECT_EQ(received("/more").size(), 2u);
}

TEST_F(QueriesTest, LookupsFlightsAndZeroKeywordRecordWhatTheyAskedFor) {
  serveBag(bagWith());
  auto state = make("com.norvel.lookup", "Lookup/1.0");
  Replies replies;
  state->lookup(request<TVXLookupRequest>(50, "serendipity"), replies.block());
  ASSERT_TRUE(replies.first().reply);
  Replies suggestions;
  state->zeroKeyword(request<TVXZeroKeywordRequest>(51, "", 9), suggestions.block());
  auto call = suggestions.first();
  ASSERT_TRUE(call.reply);
  EXPECT_NE(call.reply->data.find("\"zkw\""), std::string::npos);
  auto flight = request<TVXFlightSearchRequest>(52, "");
  flight->flightQuery = "UA 123";
  Replies flights;
  state->flightSearch(flight, flights.block());
  EXPECT_TRUE(flights.first().reply);

  // (input, trigger event, endpoint type) of each start record.
  std::vector<std::tuple<std::string, int, int>> started;
  for (const auto& record : recordsOfType(*state, kFeedbackTypeNetworkSearchStart, 3)) {
    const auto& start = record.payload().network_search_start();
    started.emplace_back(start.input(), start.trigger_event(), start.endpoint_type());
  }
  EXPECT_EQ(started, (std::vector<std::tuple<std::string, int, int>>{
                         {"serendipity", 11, 6}, {"", 9, 6}, {"UA 123", 20, 13}}));
  // These replies' first element has a status but no duration: the end record says so.
  auto ends = recordsOfType(*state, kFeedbackTypeNetworkSearchEnd, 3);
  ASSERT_EQ(ends.size(), 3u);
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(ends[i].payload().network_search_end().tavix_status(), "ok") << i;
    EXPECT_EQ(ends[i].payload().network_search_end().tavix_duration(), 0.0) << i;
  }
  const auto sent = received("/search");
  ASSERT_EQ(sent.size(), 2u);
  EXPECT_EQ(sent[1].at("qtype"), platform::PropertyValue("zkw"));
}

// Timers and deadlines on a clock the test moves.
class VirtualTimeTest : public QueryFixture {
 protected:
  VirtualTimeTest() : QueryFixture(true) {}
};

TEST_F(VirtualTimeTest, WithoutABagInTimeASearchFailsAtTheEndOfTheWaitAndRecordsWhy) {
  // The bag never comes: the search waits the first-launch wait on this clock, no longer.
  fault("/bag", {{"hang", true}});
  startBagController();
  auto waiting = make("com.norvel.seekara", "Seekara/1.0");
  Replies timedOut;
  auto searching = std::async(std::launch::async,
                              [&] { waiting->search(request<TVXSearchRequest>(7, "weather"), timedOut.block()); });
  clock.awaitParked(1);
  clock.advance(platform::seconds(kTVXFirstLaunchBagSemaphoreWait / 1000.0 - 0.001));
  EXPECT_EQ(timedOut.count(), 0u);
  clock.advance(platform::seconds(0.001));
  searching.get();
  auto call = timedOut.first();
  EXPECT_FALSE(call.reply);
  ASSERT_TRUE(call.error);
  EXPECT_EQ(call.error->reason, "timeout");
  auto skipped = recordsOfType(*waiting, 38);
  ASSERT_EQ(skipped.size(), 1u);
  EXPECT_EQ(skipped[0].payload().skip_tavix_search().reason(), 3);
  EXPECT_TRUE(received("/search").empty());
}

TEST_F(VirtualTimeTest, ALookupIsRetriedOnlyUntilItsRenderDeadline) {
  // searchRenderTimeout 2000 ms: the deadline is 1.5 s after the request goes out.
  serveBag(bagWith({{"search_render_timeout_ms", 2000}}));
  auto state = make("com.norvel.lookup", "Lookup/1.0");

  // Before the deadline every reset is retried: the first attempt and three retries.
  fault("/search", {{"reset", true}});
  Replies inTime;
  state->lookup(request<TVXLookupRequest>(70, "serendipity"), inTime.block());
  EXPECT_TRUE(inTime.first().error);
  EXPECT_EQ(received("/search").size(), 4u);

  // Past it, the first failure is the last: the attempt is held at the server while time passes
  // the deadline, then reset. A retry would now be answered.
  fault("/search", {{"hang", true}, {"reset", true}, {"times", 1}});
  Replies late;
  state->lookup(request<TVXLookupRequest>(71, "serendipity"), late.block());
  ASSERT_TRUE(testing::waitFor([&] { return received("/search").size() == 5; }));
  clock.advance(platform::seconds(1.6));
  send("POST", "/_reset");
  EXPECT_TRUE(late.first().error);
  EXPECT_TRUE(received("/search").empty()) << "retried past the deadline";
}

}  // namespace
}  // namespace tavix::query_testing
