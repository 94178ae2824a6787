// The URL session against the devserver over real loopback HTTP.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <vector>
#include <future>
#include <nlohmann/json.hpp>

#include "devserver/devserver.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "platform/log.h"
#include "support/http_helpers.h"
#include "support/temp_home.h"

namespace {

using namespace tavix::platform;
using namespace tavix::platform::http;
using json = nlohmann::json;

using Outcome = tavix::testing::HTTPOutcome;

class HTTPSessionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string error;
    ASSERT_TRUE(server.start({}, &error)) << error;
  }

  std::string url(const std::string& path) const { return server.baseURL() + path; }

  // Runs one task to its end and checks that the completion came exactly once.
  Outcome run(URLSession& session, URLRequest request, std::shared_ptr<URLSessionDataTask>* keep = nullptr) {
    Outcome outcome = tavix::testing::fetch(session, std::move(request), keep);
    pool.drain();
    EXPECT_EQ(outcome.completions->load(), 1);
    return outcome;
  }

  void fault(const json& body) {
    URLRequest request{url("/_faults"), "POST"};
    request.body = body.dump();
    ASSERT_EQ(run(control, request).response->statusCode, 200);
  }

  json recorded() { return json::parse(run(control, {url("/_recorded")}).data); }

  tavix::devserver::DevServer server;
  DispatchPool pool{2};
  URLSession control{URLSessionConfiguration{.delegatePool = &pool}};
};

TEST_F(HTTPSessionTest, TransportFailuresBecomeURLErrors) {
  URLSession session{URLSessionConfiguration{.delegatePool = &pool}};

  // (A server silent past the time-out is a hostile back end of the daemon's tests.)
  // A port nobody listens on: bind one, note it, close it.
  int closedPort;
  {
    tavix::devserver::DevServer gone;
    ASSERT_TRUE(gone.start({}, nullptr));
    closedPort = gone.port();
  }
  Outcome refused = run(session, {"http://127.0.0.1:" + std::to_string(closedPort) + "/bag"});
  ASSERT_TRUE(refused.error);
  EXPECT_EQ(refused.error->code, URLErrorCannotConnectToHost);

  Outcome unsupported = run(session, {"ftp://127.0.0.1/x"});
  ASSERT_TRUE(unsupported.error);
  EXPECT_EQ(unsupported.error->code, URLErrorUnsupportedURL);
}

TEST_F(HTTPSessionTest, TasksStartWhileTheTransferThreadLeaves) {
  // No linger: the thread leaves as soon as each answer is in, racing the next task's start.
  URLSession session{URLSessionConfiguration{.transferThreadLinger = std::chrono::milliseconds(0), .delegatePool = &pool}};
  for (int i = 0; i < 50; ++i) {
    Outcome outcome = run(session, {url("/bag")});
    ASSERT_FALSE(outcome.error) << "request " << i;
    ASSERT_EQ(outcome.response->statusCode, 200) << "request " << i;
  }
}

TEST_F(HTTPSessionTest, HostileAnswersEndAtTheSessionsLimits) {
  Logger log("test", "http");
  URLSession session{URLSessionConfiguration{
      .requestTimeoutIsDeadline = true, .maximumResponseBodySize = 1 << 20, .logger = &log, .delegatePool = &pool}};

  // Cutting bodies without a length, refusing gzip nobody asked for and ending trickles at the
  // deadline are checked through the daemon (HostileBackEndTest); a gzip body that was asked for
  // is decoded and counted after decoding.
  fault({{"path", "/search"}, {"inflate", 16 << 20}});
  URLRequest asking{url("/search?q=c")};
  asking.headers.set("Accept-Encoding", "gzip");
  Outcome bomb = run(session, asking);
  ASSERT_TRUE(bomb.error);
  EXPECT_EQ(bomb.error->code, URLErrorDataLengthExceedsMaximum);
  fault({{"path", "/search"}, {"inflate", 5000}});
  Outcome inflated = run(session, asking);
  ASSERT_FALSE(inflated.error) << inflated.error->description;
  EXPECT_EQ(inflated.data, std::string(5000, ' '));

  // A header value that would end its field early never goes out.
  const auto before = recorded().size();
  URLRequest injected{url("/bag")};
  injected.headers.set("User-Agent", "seekara/1.0\r\nX-Injected: agent");
  Outcome refused = run(session, injected);
  ASSERT_TRUE(refused.error);
  EXPECT_EQ(refused.error->code, URLErrorBadURL);
  EXPECT_EQ(recorded().size(), before);
}

TEST_F(HTTPSessionTest, CancelCompletesOnceWithCancelled) {
  SerialQueue owner(pool, "com.norvel.tavixd.test.owner");
  std::atomic<int> calls = 0;
  std::promise<std::optional<URLError>> done;
  auto session = std::make_unique<URLSession>(URLSessionConfiguration{.delegatePool = &pool});
  fault({{"path", "/search"}, {"hang", true}});
  auto task = session->dataTask(
      {url("/search?q=n")},
      [&](std::string, auto, auto error) {
        EXPECT_TRUE(owner.isCurrent());
        if (++calls == 1) done.set_value(error);
      },
      &owner);
  task->resume();
  ASSERT_TRUE(tavix::testing::waitFor([&] { return recorded().size() == 1; }));
  task->cancel();
  task->cancel();
  auto error = done.get_future().get();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, URLErrorCancelled);
  EXPECT_EQ(task->state(), URLSessionDataTask::State::Completed);

  // Cancels racing the transfer: whichever wins, each completion comes once.
  fault({{"path", "/search"}, {"delay_ms", 0}});
  std::vector<std::atomic<int>> perTask(40);
  std::vector<std::shared_ptr<URLSessionDataTask>> racing;
  for (std::size_t i = 0; i < perTask.size(); ++i) {
    racing.push_back(session->dataTask({url("/search?q=r")}, [&perTask, i](auto, auto, auto) { ++perTask[i]; }));
    racing.back()->resume();
    if (i % 2 == 0) racing.back()->cancel();
  }
  for (auto& task : racing) task->cancel();
  ASSERT_TRUE(tavix::testing::waitFor([&] {
    return std::all_of(racing.begin(), racing.end(),
                       [](const auto& t) { return t->state() == URLSessionDataTask::State::Completed; });
  }));
  pool.drain();
  for (auto& count : perTask) EXPECT_EQ(count.load(), 1);

  // Tasks never resumed, or still on the wire, end as cancelled when their session goes.
  std::atomic<int> endedWithSession = 0;
  auto counting = [&](std::string, auto, std::optional<URLError> e) {
    if (e && e->code == URLErrorCancelled) ++endedWithSession;
  };
  // A reply that never comes keeps the busy task on the wire until its session goes.
  fault({{"path", "/search"}, {"hang", true}});
  auto idle = session->dataTask({url("/bag")}, counting);
  auto busy = session->dataTask({url("/search?q=x")}, counting);
  busy->resume();
  session.reset();
  pool.drain();
  EXPECT_EQ(endedWithSession, 2);
  idle->resume();  // a no-op now
  pool.drain();
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(endedWithSession, 2);
}

// Replies the server lets keep are served from memory while fresh, asked for again conditionally
// once stale, and asked for afresh once purged; uncacheable replies always go to the server.
TEST_F(HTTPSessionTest, MemoryCacheServesFreshEntriesRevalidatesStaleOnesAndPurges) {
  VirtualClock clock;
  URLSession session{URLSessionConfiguration{.memoryCacheCapacity = 4 << 20, .delegatePool = &pool, .clock = &clock}};
  const std::string resource = url("/resources/hints?max_age=60");
  std::shared_ptr<URLSessionDataTask> second;
  const Outcome first = run(session, {resource});
  EXPECT_EQ(run(session, {resource}, &second).data, first.data);
  EXPECT_TRUE(second->metrics().fromCache);
  clock.advance(seconds(61));
  const Outcome stale = run(session, {resource});
  EXPECT_EQ(stale.response->statusCode, 200) << "the 304 stays inside the session";
  EXPECT_EQ(stale.data, first.data);
  session.purgeMemoryCache();
  run(session, {resource});
  run(session, {url("/bag")});
  run(session, {url("/bag")});
  const json wire = recorded();
  ASSERT_EQ(wire.size(), 5u) << wire;
  EXPECT_TRUE(wire[1]["headers"].contains("if-none-match")) << "stale: asked again, conditionally";
  EXPECT_FALSE(wire[2]["headers"].contains("if-none-match")) << "purged: asked afresh";
}

}  // namespace
