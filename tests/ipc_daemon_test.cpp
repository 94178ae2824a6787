// Talks to the real tavixd over its real socket: libtavix, tavix_tool and raw frames.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <future>
#include <optional>
#include <string>

#include "cache/engaged_completion_cache.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "support/raw_frames.h"
#include "support/tavixd.h"
#include "tavix/client.h"

namespace {

using namespace tavix::testing;
using tavix::client::Client;
using Daemon = Tavixd;

Client::Options options(const Daemon& d, const std::string& userAgent = "tests/1") {
  return d.clientOptions("tests", userAgent, 5000);
}

TEST(IpcDaemon, BadFramesAndVanishingClientsDoNotStopTheDaemon) {
  TempHome home;
  Daemon d(home);

  int fd = rawConnect(d.socket);
  ASSERT_GE(fd, 0);
  rawSend(fd, configureFrame("raw", "raw/1", 1));
  EXPECT_NE(rawReceive(fd), "<eof>");
  rawSend(fd, std::string("\xff\xff\xff\xff garbage", 12));  // not a protobuf message
  EXPECT_TRUE(d.waitForLog("malformed message of 12 bytes")) << d.log();
  // A notify call whose name is not UTF-8: refused with our one line, not protobuf's.
  rawSend(fd, std::string("\xe2\x03\x03\x0a\x01\xff", 6));
  EXPECT_TRUE(d.waitForLog("malformed message of 6 bytes")) << d.log();
  EXPECT_EQ(d.log().find("libprotobuf"), std::string::npos) << d.log();
  // A kind the daemon does not take from clients is answered, not ignored.
  tavix::proto::Envelope unknown;
  unknown.set_call_id(7);
  unknown.mutable_did_delete_resource()->set_identifier("x");
  rawSend(fd, unknown.SerializeAsString());
  tavix::proto::Envelope reply;
  ASSERT_TRUE(reply.ParseFromString(rawReceive(fd)));
  EXPECT_EQ(reply.call_id(), 7u);
  ASSERT_TRUE(reply.has_call_failed());
  EXPECT_EQ(reply.call_failed().reason(), "unknown message");
  // Over the limit: this connection ends, the daemon goes on.
  const char oversize[] = {'\x01', '\x00', '\x00', '\x01'};
  ASSERT_EQ(send(fd, oversize, 4, MSG_NOSIGNAL), 4);
  EXPECT_EQ(rawReceive(fd), "<eof>");
  close(fd);
  EXPECT_TRUE(d.waitForLog("over the limit of 16777216")) << d.log();

  // A client that calls and vanishes before the answer.
  for (int i = 0; i < 20; ++i) {
    int v = rawConnect(d.socket);
    rawSend(v, configureFrame("gone", "gone/1", 1));
    tavix::proto::Envelope call;
    call.set_call_id(2);
    call.mutable_request()->mutable_request()->mutable_lookup();
    rawSend(v, call.SerializeAsString());
    close(v);
  }

  Client client(options(d));
  EXPECT_FALSE(client.notifySync("com.norvel.tests.still-alive")) << d.log();
  EXPECT_TRUE(d.waitForLog("launch event for com.norvel.tests.still-alive")) << d.log();
  EXPECT_TRUE(d.alive());
}

TEST(IpcDaemon, BadConfigurationGetsNoReplyAndAClosedConnection) {
  TempHome home;
  Daemon d(home);
  for (auto [identifier, userAgent, message] :
       {std::tuple{"", "ua/1", "configuration requires identifier"}, std::tuple{"id", "", "configuration requires userAgent"}}) {
    int fd = rawConnect(d.socket);
    ASSERT_GE(fd, 0);
    rawSend(fd, configureFrame(identifier, userAgent, 1));
    EXPECT_EQ(rawReceive(fd), "<eof>") << message;
    close(fd);
    EXPECT_TRUE(d.waitForLog(message)) << d.log();
  }

  Client refused(options(d, ""));
  auto error = refused.connect();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, tavix::client::kConnectionLost);
  EXPECT_TRUE(d.alive());

  // Each refusal is recorded as an error in the daemon's own feedback session.
  EXPECT_EQ(d.stop(), 0);
  int recorded = 0;
  for (const auto& bytes : sessionFileContents(home)) {
    recorded += static_cast<int>(occurrences(bytes, "invalid configuration"));
  }
  EXPECT_EQ(recorded, 3);
}

TEST(IpcDaemon, ClientFailsCallsInFlightOnceAndReconnectsToTheNextDaemon) {
  TempHome home;
  auto d = std::make_unique<Daemon>(home, "first.log");
  Client client(options(*d));
  ASSERT_FALSE(client.connect());

  // Frozen, then killed, with a call in flight: the call fails once, with "connection lost".
  ASSERT_TRUE(d->freeze());
  std::atomic<int> calls{0};
  std::promise<std::optional<tavix::client::Error>> failed;
  client.notify("never", [&](auto error) {
    if (calls++ == 0) failed.set_value(error);
  });
  d->signal(SIGKILL);
  d->waitExit(5000);
  auto future = failed.get_future();
  ASSERT_EQ(future.wait_for(std::chrono::seconds(5)), std::future_status::ready);
  auto error = future.get();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, tavix::client::kConnectionLost);
  EXPECT_FALSE(client.isConnected());

  Daemon next(home, "second.log");
  ASSERT_TRUE(next.waitForLog("tavixd started")) << next.log();
  EXPECT_FALSE(client.notifySync("again")) << next.log();
  EXPECT_TRUE(next.waitForLog("launch event for again")) << next.log();
  EXPECT_EQ(calls, 1);
}

TEST(IpcDaemon, ToolReadsDefaultsAndCountersWithTheDaemonStoppedAndRunsActivities) {
  TempHome home;
  home.exportEnvironment();  // the tool runs in this environment
  std::string out;
  EXPECT_EQ(runTool("defaults write TVXFeedbackFlushDisabled --bool true", &out), 0) << out;
  EXPECT_EQ(runTool("defaults write --domain com.norvel.other Greeting hello", &out), 0) << out;
  EXPECT_EQ(runTool("defaults read TVXFeedbackFlushDisabled", &out), 0);
  EXPECT_EQ(out, "true\n");
  EXPECT_EQ(runTool("defaults read --domain com.norvel.other Greeting", &out), 0);
  EXPECT_EQ(out, "hello\n");
  EXPECT_EQ(runTool("defaults write Count --int twelve", &out), 2) << "a bad integer is refused";
  EXPECT_EQ(runTool("defaults delete TVXFeedbackFlushDisabled", &out), 0) << out;
  EXPECT_EQ(runTool("defaults read TVXFeedbackFlushDisabled", &out), 1);
  EXPECT_EQ(runTool("notify anything", &out), 1) << "no daemon to talk to";
  EXPECT_NE(out.find("tavix.client 1"), std::string::npos) << out;

  {
    Daemon d(home);
    EXPECT_EQ(runTool("activity run com.norvel.tavixd.dp.flush", &out), 0) << out << d.log();
    EXPECT_TRUE(d.waitForLog("Flushing custom feedback.")) << d.log();
    EXPECT_EQ(runTool("activity run com.norvel.tavixd.nothing", &out), 1);
    EXPECT_NE(out.find("no activity com.norvel.tavixd.nothing"), std::string::npos) << out;
    EXPECT_EQ(runTool("--socket " + d.socket + " notify com.norvel.predictions.queries.clearData", &out), 0) << out;
    EXPECT_TRUE(d.waitForLog("launch event for com.norvel.predictions.queries.clearData")) << d.log();
    EXPECT_EQ(runTool("search hello", &out), 1) << "no bag, so the search fails";
    EXPECT_NE(out.find("\"reason\":\"timeout\""), std::string::npos) << out;
    EXPECT_EQ(d.stop(), 0);
  }
  EXPECT_EQ(runTool("counters", &out), 0) << out;
  EXPECT_NE(out.find("com.norvel.tavixd.launch = 1\n"), std::string::npos) << out;
  EXPECT_NE(out.find("com.norvel.tavixd.clientconnection = 4\n"), std::string::npos) << out;
}

TEST(IpcDaemon, ClearDataLaunchEventForgetsTheSystemSearchCompletionsOnly) {
  TempHome home;
  tavix::platform::DispatchPool pool(2);
  tavix::platform::SystemClock clock(pool);
  auto open = [&] {
    return tavix::EngagedCompletionCache::create({home.cache() / "com.norvel.tavixd", &clock, &pool, nullptr});
  };
  {
    auto cache = open();
    cache->addCompletion("camera", "cam", 0, tavix::kEngagedCompletionClientBrovane);
    cache->addCompletion("cafe rouge", "caf", 0, tavix::kEngagedCompletionClientSeekara);
    cache->addCompletion("calendar", "cal", 0, tavix::kEngagedCompletionClientSeekara);
    cache->closeDBConnection();
  }
  Daemon d(home);
  Client client(options(d));
  ASSERT_FALSE(client.notifySync("com.norvel.predictions.queries.clearData")) << d.log();
  EXPECT_EQ(d.stop(), 0) << d.log();

  auto cache = open();
  EXPECT_EQ(cache->rowCountForClient(tavix::kEngagedCompletionClientSeekara), 0);
  EXPECT_EQ(cache->rowCountForClient(tavix::kEngagedCompletionClientBrovane), 1);
}

// The client reads a resource through the descriptor the daemon opened for it, never by path.
TEST(IpcDaemon, ResourceFilesTravelAsReadOnlyDescriptors) {
  TempHome home;
  home.exportEnvironment();  // the tool runs in this environment
  const auto caches = home.cache() / "com.norvel.tavixd";
  std::filesystem::create_directories(caches);
  std::ofstream(caches / "dictionary_resources_url") << "[\"wn\"]";
  std::ofstream(home.cache() / "outside") << "not a resource";
  Daemon d(home);
  Client client(options(d));

  struct Answer {
    int fd;
    std::string attributes;
    std::optional<tavix::client::Error> error;
  };
  auto ask = [&](const std::string& identifier) {
    std::promise<Answer> done;
    client.fileHandleForResource(identifier, [&](int fd, std::string attributes, auto error) {
      done.set_value({fd, std::move(attributes), std::move(error)});
    });
    return done.get_future().get();
  };
  auto found = ask("dictionary_resources_url");
  ASSERT_FALSE(found.error) << found.error->describe() << d.log();
  ASSERT_GE(found.fd, 0);
  EXPECT_EQ(fcntl(found.fd, F_GETFL) & O_ACCMODE, O_RDONLY);
  char buffer[64] = {};
  EXPECT_EQ(read(found.fd, buffer, sizeof buffer), 6);
  EXPECT_STREQ(buffer, "[\"wn\"]");
  close(found.fd);
  EXPECT_NE(found.attributes.find("<key>fileSize</key>\n\t<integer>6</integer>"), std::string::npos) << found.attributes;

  for (const char* identifier : {"missing", "../outside"}) {
    auto refused = ask(identifier);
    EXPECT_EQ(refused.fd, -1) << identifier;
    ASSERT_TRUE(refused.error) << identifier;
    EXPECT_EQ(refused.error->domain, "kTVXErrorDomain");
    EXPECT_EQ(refused.error->code, 404) << identifier;
  }

  std::string out;
  EXPECT_EQ(runTool("resources cat dictionary_resources_url", &out), 0) << out;
  EXPECT_EQ(out, "[\"wn\"]");
  EXPECT_EQ(d.stop(), 0) << d.log();
}

}  // namespace
