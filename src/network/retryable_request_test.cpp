// The retry loop over real loopback HTTP, its delays on virtual time.
#include "network/retryable_request.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <nlohmann/json.hpp>

#include "devserver/devserver.h"
#include "platform/dispatch.h"
#include "support/devserver_control.h"
#include "support/temp_home.h"

namespace {

using namespace tavix;
using namespace tavix::platform;
using namespace tavix::platform::http;

class RetryableRequestTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(server.start({}, nullptr)); }

  URLRequest request(const std::string& path) {
    URLRequest r;
    r.url = server.baseURL() + path;
    return r;
  }

  // The devserver's control routes.
  std::string call(const std::string& path, const std::string& method = "GET", std::string body = {}) {
    return tavix::testing::devserverCall(*session, server.baseURL(), path, method, std::move(body));
  }
  void fault(const nlohmann::json& f) { call("/_faults", "POST", f.dump()); }
  std::size_t attemptsOnTheWire() { return nlohmann::json::parse(call("/_recorded")).size(); }

  struct Result {
    std::atomic<int> calls = 0;
    std::optional<HTTPURLResponse> response;
    std::optional<URLError> error;
    URLSessionTaskMetrics metrics;
    TimePoint at;
  };

  std::shared_ptr<URLSessionDataTask> send(const TVXRetryableNetworkRequest& r, int retries, Result& result) {
    return dataTaskWithRetryableRequest(session, std::make_shared<TVXRetryableNetworkRequest>(r), 1, retries, clock,
                                        retryQueue, [&](std::string, auto response, auto error, const auto& metrics) {
                                          result.response = response;
                                          result.error = error;
                                          result.metrics = metrics;
                                          result.at = clock.now();
                                          ++result.calls;
                                        });
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

TEST_F(RetryableRequestTest, DelayedRetriesAreSpacedOnTheClockUntilSpent) {
  fault({{"path", "/bag"}, {"drop", true}});
  const TimePoint start = clock.now();
  Result result;
  // The bag fetch's settings: no deadline, delay on fail, 5 retries.
  send(TVXRetryableNetworkRequest(request("/bag"), std::nullopt, true), 5, result)->resume();

  for (int retry = 1; retry <= 5; ++retry) {
    ASSERT_TRUE(tavix::testing::waitFor([&] { return clock.pendingTimers() == 1; })) << "retry " << retry;
    EXPECT_EQ(attemptsOnTheWire(), std::size_t(retry));
    clock.advance(seconds(1.4));
    EXPECT_EQ(clock.pendingTimers(), 1u) << "a retry came early";
    clock.advance(seconds(0.1));
  }
  ASSERT_TRUE(tavix::testing::waitFor([&] { return result.calls == 1; }));
  EXPECT_EQ(attemptsOnTheWire(), 6u);
  ASSERT_TRUE(result.error);
  EXPECT_EQ(result.error->code, URLErrorNetworkConnectionLost);
  EXPECT_EQ(result.at - start, seconds(7.5));
  pool.drain();
  EXPECT_EQ(result.calls, 1);
  EXPECT_EQ(clock.pendingTimers(), 0u);
}

// Retries through a proxy, and an undelayed budget spent, are the lookup tests' (query path).
TEST_F(RetryableRequestTest, UndelayedRetriesStopAtTheFirstResponseWhateverItsStatus) {
  fault({{"path", "/search"}, {"drop", true}, {"times", 1}});
  Result recovered;
  send(TVXRetryableNetworkRequest(request("/search?q=w"), clock.now() + seconds(10), false), 3, recovered)->resume();
  ASSERT_TRUE(tavix::testing::waitFor([&] { return recovered.calls == 1; }));
  EXPECT_FALSE(recovered.error);
  EXPECT_GT(recovered.metrics.firstByteSeconds, 0);  // the attempt that answered
  EXPECT_EQ(clock.pendingTimers(), 0u);

  call("/_reset", "POST");
  fault({{"path", "/search"}, {"status", 500}});
  Result serverError;
  send(TVXRetryableNetworkRequest(request("/search?q=w"), clock.now() + seconds(10), false), 3, serverError)->resume();
  ASSERT_TRUE(tavix::testing::waitFor([&] { return serverError.calls == 1; }));
  EXPECT_EQ(serverError.response->statusCode, 500);
  EXPECT_EQ(attemptsOnTheWire(), 1u);
}

}  // namespace
