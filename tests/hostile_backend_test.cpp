// Back ends that misbehave, and a client that floods: through the real daemon against the
// devserver's fault modes. Every call gets exactly one answer by the daemon's own deadline (the
// client's deadline, far later, would answer with kTimedOut instead), and the daemon goes on
// serving other clients meanwhile.
#include <gtest/gtest.h>

#include "platform/http/url_request.h"
#include "support/query_daemon.h"

namespace {

using namespace tavix;
using tavix::testing::json;
using tavix::testing::QueryDaemonTest;

struct HostileBackEnd {
  const char* name;
  json fault;  // for the next search only
  // Either the body reaches the client with a parse error, or the call fails with this code.
  bool bodyWithParseError;
  long errorCode;
  const char* logLine;  // what the daemon says about it; empty: nothing in particular
};

void PrintTo(const HostileBackEnd& backEnd, std::ostream* os) { *os << backEnd.name; }

class HostileBackEndTest : public QueryDaemonTest, public ::testing::WithParamInterface<HostileBackEnd> {};

TEST_P(HostileBackEndTest, OneAnswerByTheDeadlineAndTheDaemonServesOn) {
  const HostileBackEnd& backEnd = GetParam();
  ASSERT_FALSE(server.base.empty());
  // Queries may take half a second in all: the hang and the trickle end there.
  serveBag({{"request_timeout_s", 0.5}});
  startDaemon();
  json fault = backEnd.fault;
  fault.update({{"path", "/search"}, {"times", 1}});
  this->fault(fault);

  auto hostile = start(*app, request("weather"));
  const std::uint64_t hostileId = queryId;
  ASSERT_TRUE(tavix::testing::waitFor([&] { return served("/search") == 1; })) << tavixd->log();

  // Another client is served while the hostile answer is dealt with.
  client::Client other(tavixd->clientOptions("com.norvel.brovane", "brovane/1.0"));
  auto card = request("");
  card.mutable_card();
  const auto otherAnswer = send(other, card);
  ASSERT_TRUE(otherAnswer.reply) << (otherAnswer.error ? otherAnswer.error->describe() : "no answer");

  const auto& answer = hostile.wait();
  ASSERT_TRUE(answer.replied) << tavixd->log();
  EXPECT_EQ(answer.queryId, hostileId);
  ASSERT_TRUE(answer.error) << "a hostile answer must not pass for a good one";
  EXPECT_NE(answer.error->domain, client::kClientErrorDomain) << "the daemon never answered: "
                                                              << answer.error->describe();
  if (backEnd.bodyWithParseError) {
    // A body that is not JSON (or not within the bounds) still reaches the client, with the error.
    ASSERT_TRUE(answer.reply);
    EXPECT_FALSE(answer.reply->data().empty());
    EXPECT_EQ(answer.error->domain, "TavixJSONErrorDomain") << answer.error->describe();
    EXPECT_TRUE(waitForRecord("network_search_end", hostileId)) << dumpRecords();
  } else {
    EXPECT_FALSE(answer.reply);
    EXPECT_EQ(answer.error->domain, platform::http::kURLErrorDomain) << answer.error->describe();
    if (backEnd.errorCode != 0) {
      EXPECT_EQ(answer.error->code, backEnd.errorCode) << answer.error->describe();
    }
    EXPECT_TRUE(waitForRecord("error", hostileId)) << dumpRecords();
  }
  if (backEnd.logLine[0] != '\0') {
    EXPECT_TRUE(tavixd->waitForLog(backEnd.logLine)) << tavixd->log();
  }

  // The same client goes on; its next answer comes after any second answer to the first call, and
  // from the server: nothing of the hostile answer was cached.
  const auto next = send(request("weather"));
  ASSERT_TRUE(next.reply) << (next.error ? next.error->describe() : "no answer");
  EXPECT_FALSE(next.error) << next.error->describe();
  EXPECT_EQ(answer.calls, 1);
  EXPECT_TRUE(tavixd->alive());
  EXPECT_EQ(tavixd->stop(), 0);
}

INSTANTIATE_TEST_SUITE_P(
    , HostileBackEndTest,
    ::testing::Values(
        // 400 KB of nested arrays: refused at the 65th level, not a stack overflow.
        HostileBackEnd{"Nested", {{"nested", 200000}}, true, 0, ""},
        // 64 MiB without a length: cut at the 4 MiB a query may take.
        HostileBackEnd{"Huge", {{"huge", 64 << 20}}, false, platform::http::URLErrorDataLengthExceedsMaximum,
                       "response body over the limit of 4194304 bytes"},
        // 64 KiB of gzip that would inflate to 64 MiB, never asked for.
        HostileBackEnd{"Inflating", {{"inflate", 64 << 20}}, false, platform::http::URLErrorBadServerResponse,
                       "which the request did not ask for"},
        HostileBackEnd{"Reset", {{"reset", true}}, false, 0, ""},
        HostileBackEnd{"Hang", {{"hang", true}}, false, platform::http::URLErrorTimedOut, ""},
        // A byte every 20 ms is never idle for long, but the query's half second ends it.
        HostileBackEnd{"Trickle", {{"trickle_ms", 20}}, false, platform::http::URLErrorTimedOut, ""}),
    [](const ::testing::TestParamInfo<HostileBackEnd>& info) { return std::string(info.param.name); });

// A client that sends far more calls than it has answered: the daemon holds 64 of them and stops
// reading the rest until one is answered; meanwhile other clients are served, and in the end
// every call has exactly one answer.
TEST_F(QueryDaemonTest, AFloodingClientWaitsOnItsOwnSocketWhileOthersAreServed) {
  ASSERT_FALSE(server.base.empty());
  serveBag({{"request_timeout_s", 20}});
  startDaemon();
  fault({{"path", "/search"}, {"hang", true}});

  constexpr int kCalls = 200;
  std::vector<InFlight> flood;
  for (int i = 0; i < kCalls; ++i) flood.push_back(start(*app, request("flood " + std::to_string(i))));
  ASSERT_TRUE(tavixd->waitForLog("calls unanswered")) << tavixd->log();
  ASSERT_TRUE(tavix::testing::waitFor([&] { return served("/search") == 64; })) << served("/search");

  client::Client other(tavixd->clientOptions("com.norvel.brovane", "brovane/1.0"));
  auto card = request("");
  card.mutable_card();
  const auto otherAnswer = send(other, card);
  ASSERT_TRUE(otherAnswer.reply) << (otherAnswer.error ? otherAnswer.error->describe() : "no answer");
  // Had the daemon read on, the rest of the flood would have reached the server by now.
  EXPECT_EQ(served("/search"), 64);
  int answered = 0;
  for (const auto& call : flood) answered += call.answer->calls;
  EXPECT_EQ(answered, 0);

  // The server lets go: the held calls are answered, the rest read, sent and answered in turn.
  call("/_reset", "POST");
  for (const auto& call : flood) {
    const auto& answer = call.wait();
    ASSERT_TRUE(answer.replied);
    EXPECT_TRUE(answer.reply) << (answer.error ? answer.error->describe() : "");
  }
  const auto last = send(request("news"));
  ASSERT_TRUE(last.reply);
  for (const auto& call : flood) EXPECT_EQ(call.answer->calls, 1);
  EXPECT_EQ(tavixd->stop(), 0);
}

}  // namespace
