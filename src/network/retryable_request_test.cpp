// The retry loop over real loopback HTTP, its delays on virtual time.
#include "network/retryable_request.h"

#include <gtest/gtest.h>

#include <atomic>
#include <nlohmann/json.hpp>

#include "devserver/devserver.h"
#include "platform/dispatch.h"
#include "support/devserver_control.h"
#include "support/temp_home.h"

namespace {

using namespace tavix;
using namespace tavix::platform;
using namespace tavix::platform::http;
using tavix::testing::waitFor;

class RetryableRequestTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(server.start({}, nullptr)); }

  std::string call(const std::string& path, const std::string& method = "GET", std::string body = {}) {
    return tavix::testing::devserverCall(*session, server.baseURL(), path, method, std::move(body));
  }
  std::size_t attemptsOnTheWire() { return nlohmann::json::parse(call("/_recorded")).size(); }

  struct Result {
    std::atomic<int> calls = 0;
    std::optional<URLError> error;
    URLSessionTaskMetrics metrics;
  };

  void send(const std::string& path, std::optional<TimePoint> deadline, bool delayed, int retries, Result& result) {
    URLRequest r;
    r.url = server.baseURL() + path;
    auto request = std::make_shared<TVXRetryableNetworkRequest>(r, deadline, delayed);
    dataTaskWithRetryableRequest(session, request, 1, retries, clock, retryQueue,
                                 [&](std::string, auto, auto error, const auto& metrics) {
                                   result.error = error;
                                   result.metrics = metrics;
                                   ++result.calls;
                                 })
        ->resume();
  }

  tavix::devserver::DevServer server;
  DispatchPool pool{2};
  SerialQueue retryQueue{pool, "com.norvel.tavixd.test.retry"};
  VirtualClock clock;
  std::shared_ptr<URLSession> session = [this] {
    URLSessionConfiguration config;
    config.delegatePool = &pool;
    return std::make_shared<URLSession>(config);
  }();
};

// Retries through a proxy and an undelayed budget spent are the query tests'; here, the bag
// fetch's whole delayed budget, the timing of the attempt that answered, and a server error that
// ends the retries.
TEST_F(RetryableRequestTest, DelayedRetriesAreSpacedOnTheClockAndTheAnsweringAttemptIsTimed) {
  call("/_faults", "POST", R"({"path":"/bag","drop":true})");
  Result spent;
  // The bag fetch's settings: no deadline, delay on fail, 5 retries.
  send("/bag", std::nullopt, true, 5, spent);
  for (int retry = 1; retry <= 5; ++retry) {
    ASSERT_TRUE(waitFor([&] { return clock.pendingTimers() == 1; })) << "retry " << retry;
    EXPECT_EQ(attemptsOnTheWire(), std::size_t(retry));
    clock.advance(seconds(1.4));
    EXPECT_EQ(clock.pendingTimers(), 1u) << "a retry came early";
    clock.advance(seconds(0.1));
  }
  ASSERT_TRUE(waitFor([&] { return spent.calls == 1; }));
  EXPECT_EQ(attemptsOnTheWire(), 6u);
  ASSERT_TRUE(spent.error);
  EXPECT_EQ(spent.error->code, URLErrorNetworkConnectionLost);

  call("/_faults", "POST", R"({"path":"/search","drop":true,"times":1})");
  Result recovered;
  send("/search?q=w", clock.now() + seconds(10), false, 3, recovered);
  ASSERT_TRUE(waitFor([&] { return recovered.calls == 1; }));
  EXPECT_FALSE(recovered.error);
  EXPECT_GT(recovered.metrics.firstByteSeconds, 0);

  call("/_reset", "POST");
  call("/_faults", "POST", R"({"path":"/search","status":500})");
  Result serverError;
  send("/search?q=w", clock.now() + seconds(10), false, 3, serverError);
  ASSERT_TRUE(waitFor([&] { return serverError.calls == 1; }));
  EXPECT_EQ(attemptsOnTheWire(), 1u);
  pool.drain();
  EXPECT_EQ(spent.calls + recovered.calls + serverError.calls, 3);
  EXPECT_EQ(clock.pendingTimers(), 0u);
}

}  // namespace
