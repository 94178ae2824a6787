// The search path against the development server: what reaches the network, what the client gets
// back and what the client's feedback session records.
#include <gtest/gtest.h>

#include "cache/engaged_completion_cache.h"
#include "core/diagnostics.h"
#include "platform/counters.h"
#include "core/names.h"
#include "feedback/vocabulary.h"
#include "support/query_fixture.h"

namespace tavix::query_testing {
namespace {

using SearchTest = QueryFixture;

TEST_F(SearchTest, ABagWithoutASearchURLFailsAsTheTransportWouldAndRecordsIt) {
  platform::Dictionary bag = bagWith();
  bag.erase("search_url");
  serveBag(bag);
  auto state = make("com.norvel.seekara", "Seekara/1.0");
  Replies failed;
  state->search(request<TVXSearchRequest>(12, "weather"), failed.block());
  const auto error = failed.first().error;
  ASSERT_TRUE(error);
  EXPECT_EQ(std::pair(error->domain, error->code),
            std::pair(std::string(platform::http::kURLErrorDomain),
                      std::int64_t{platform::http::URLErrorUnsupportedURL}));
  EXPECT_EQ(recordsOfType(*state, kFeedbackTypeError).size(), 1u);
}

TEST_F(SearchTest, ShortInputIsSkippedUnlessALocalCompletionCarriesIt) {
  serveBag(bagWith({{"min_query_length", 3},
                    {"smart_history_enabled", true},
                    {"smart_history_min_query_length", 2},
                    {"smart_history_timeout_ms", 3000}}));
  auto seekara = make("com.norvel.seekara", "Seekara/1.0");
  Replies skipped;
  seekara->search(request<TVXSearchRequest>(1, "zq"), skipped.block());
  auto call = skipped.first();
  EXPECT_FALSE(call.reply || call.error);
  auto skips = recordsOfType(*seekara, kFeedbackTypeSkipSearch);
  ASSERT_EQ(skips.size(), 1u);
  EXPECT_EQ(skips[0].payload().skip_tavix_search().reason(), 1);
  EXPECT_EQ(skips[0].payload().skip_tavix_search().input(), "zq");
  EXPECT_TRUE(received("/search").empty());

  // Engaged completions for "zq": the browser gets one and no more, kept for the keystroke;
  // with it the short input goes to the network after all.
  auto engaged = assembly.engagedCompletionCache;
  for (const char* completion : {"zqalpha", "zqbeta", "zqgamma", "zqdelta"}) {
    engaged->addCompletion(completion, "zq", 0, 1);
    engaged->addCompletion(completion, "zq", 0, 2);
  }
  auto brovane = make("com.norvel.brovane", "Brovane/1.0");
  Replies one;
  brovane->search(request<TVXSearchRequest>(2, "zq"), one.block());
  call = one.first();
  ASSERT_TRUE(call.reply);
  EXPECT_TRUE(call.reply->localSuggestions.empty());
  EXPECT_EQ(brovane->completionCacheSuggestions().size(), 1u);
  EXPECT_EQ(received("/search").size(), 1u);
  auto localStart = recordsOfType(*brovane, kFeedbackTypeLocalSearchStart);
  ASSERT_EQ(localStart.size(), 1u);
  EXPECT_EQ(localStart[0].payload().local_search_start().trigger_event(), 1);

  // The search screen asks for three on a suggestion keystroke (21): the first is kept, the
  // other two go to the client; a plain keystroke looks for none.
  Replies three;
  seekara->search(request<TVXSearchRequest>(3, "zq", 21), three.block());
  call = three.first();
  ASSERT_TRUE(call.reply);
  EXPECT_EQ(call.reply->localSuggestions.size(), 2u);
  EXPECT_EQ(seekara->completionCacheSuggestions().size(), 1u);
}

TEST_F(SearchTest, TheSameKeystrokeTwiceIsServedFromTheQueryCache) {
  serveBag(bagWith());
  auto state = make("com.norvel.seekara", "Seekara/1.0");
  // (cache hits, server answers with status 200) counted so far.
  auto counted = [] {
    auto& store = TavixDiagnosticDataReporter::store();
    return std::pair(store.value(createCounterKey("seekara", "ondevicecachehits")),
                     store.value(createCounterKey("Seekara/1.0", "fedapicall.serverstatus") + "200"));
  };
  const auto before = counted();

  Replies first;
  state->search(request<TVXSearchRequest>(10, "cam"), first.block());
  auto call = first.first();
  ASSERT_TRUE(call.reply);
  EXPECT_FALSE(call.error);
  // The end record carries the server's own account of the request and the transport's timing.
  auto ends = recordsOfType(*state, kFeedbackTypeNetworkSearchEnd);
  auto starts = recordsOfType(*state, kFeedbackTypeNetworkSearchStart);
  ASSERT_EQ((std::vector{starts.size(), ends.size()}), (std::vector<std::size_t>{1, 1}));
  const auto& end = ends[0].payload().network_search_end();
  EXPECT_EQ(end.uuid(), starts[0].payload().network_search_start().uuid());
  EXPECT_EQ(end.response_size(), call.reply->data.size());
  EXPECT_EQ(end.tavix_partial_client_ip(), "127.0.0");
  EXPECT_EQ(end.fbq().rfind("devserver-", 0), 0u) << end.fbq();
  EXPECT_GT(end.network_timing_data().at("total"), 0.0);

  Replies second;
  state->search(request<TVXSearchRequest>(11, "cam"), second.block());
  auto cached = second.first();
  ASSERT_TRUE(cached.reply);
  EXPECT_EQ(cached.reply->data, call.reply->data);
  EXPECT_EQ(received("/search").size(), 1u);
  auto hits = recordsOfType(*state, 39);
  ASSERT_EQ(hits.size(), 1u);
  EXPECT_EQ(hits[0].payload().cache_hit().reason(), 4);
  EXPECT_EQ(counted(), std::pair(before.first + 1, before.second + 1));
}

TEST_F(SearchTest, MessagesReturnKeyRecordsAGoToSearchAndVerboseRepliesCarryTheExchange) {
  serveBag(bagWith());
  auto state = make("com.norvel.messages", "Messages/2.0");
  auto typed = request<TVXSearchRequest>(30, "camera", 23);
  typed->verboseReply = true;
  Replies replies;
  state->search(typed, replies.block());
  auto call = replies.first();
  ASSERT_TRUE(call.reply && call.reply->httpRequest && call.reply->httpResponse);
  EXPECT_NE(call.reply->httpRequest->url.find("q=camera"), std::string::npos);
  auto went = recordsOfType(*state, 29);
  ASSERT_EQ(went.size(), 1u);
  EXPECT_EQ(went[0].payload().did_go_to_search().input(), "camera");
}

TEST_F(SearchTest, TheBagCanRouteSearchesAndEveryLookupAttemptThroughItsProxy) {
  devserver::DevServer proxy;
  ASSERT_TRUE(proxy.start({}, nullptr));
  serveBag(bagWith({{"marvola_configuration",
                     platform::Dictionary{{"enabled", true}, {"proxy", proxy.baseURL()}}}}));
  auto state = make("com.norvel.seekara", "Seekara/1.0");

  // With the proxy feature off, requests go straight to the server. (A server's request for a
  // newer bag reaches the client: QueryDaemonTest.)
  defaults->setObject("TVXUseMarvola", false);
  Replies direct;
  state->search(request<TVXSearchRequest>(40, "camera"), direct.block());
  EXPECT_TRUE(direct.first().reply);
  EXPECT_EQ(received("/search").size(), 1u);
  auto starts = recordsOfType(*state, kFeedbackTypeNetworkSearchStart);
  ASSERT_FALSE(starts.empty());
  EXPECT_FALSE(starts.back().payload().network_search_start().has_marvola_status());

  // With it on, the request goes to the bag's proxy, which is asked for the absolute URL.
  defaults->setObject("TVXUseMarvola", true);
  Replies proxied;
  state->search(request<TVXSearchRequest>(41, "lens"), proxied.block());
  proxied.first();
  EXPECT_EQ(received("/search").size(), 1u);
  EXPECT_EQ(received(server.baseURL() + "/search", &proxy).size(), 1u);
  starts = recordsOfType(*state, kFeedbackTypeNetworkSearchStart, 2);
  ASSERT_EQ(starts.size(), 2u);
  EXPECT_EQ(starts.back().payload().network_search_start().marvola_status(), 1);

  // A retried look-up goes through the proxy on every attempt.
  send("POST", "/_faults", R"({"path":")" + server.baseURL() + R"(/search","reset":true,"times":1})", &proxy);
  auto lookup = request<TVXLookupRequest>(42, "lens");
  Replies lookedUp;
  state->lookup(lookup, lookedUp.block());
  lookedUp.first();
  EXPECT_EQ(received(server.baseURL() + "/search", &proxy).size(), 3u);
  EXPECT_EQ(received("/search").size(), 1u);
}

}  // namespace
}  // namespace tavix::query_testing
