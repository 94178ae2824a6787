#include "daemon/client_connection.h"

#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>

#include "platform/activity.h"
#include "platform/defaults.h"
#include "platform/ipc/launch_events.h"
#include "platform/ipc/server.h"
#include "platform/log.h"
#include "cache/query_cache.h"
#include "query/client_state.h"
#include "query/client_state_manager.h"
#include "support/connection_services.h"
#include "support/raw_frames.h"
#include "tavix_proto/ipc.pb.h"

namespace tavix {
namespace {

namespace ipc = platform::ipc;

// A ClientConnection on one end of a socket pair; the test plays the client on the other.
struct Harness : testing::TestAssembly {
  platform::SerialQueue activityQueue{pool, "test.activities"};
  platform::ActivityScheduler activities{clock, activityQueue, transactions};
  platform::SerialQueue eventQueue{pool, "test.events"};
  ipc::LaunchEventRegistry events{eventQueue};
  testing::ConnectionServices services{*this, &activities, &events};
  platform::Logger log{"test", "connection"};
  ipc::UniqueFd client;
  std::shared_ptr<ipc::IpcConnection> connection;
  std::shared_ptr<ClientConnection> subject;

  explicit Harness(std::size_t maxFrame = ipc::kMaxFrameSize) {
    int fds[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    client.reset(fds[1]);
    // A missing reply fails the test instead of hanging it.
    const timeval timeout{10, 0};
    ::setsockopt(fds[1], SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    connection = ipc::IpcConnection::make(pool, ipc::UniqueFd(fds[0]), {::getpid(), ::getuid(), ::getgid()},
                                          "test.connection", log, maxFrame);
    subject = std::make_shared<ClientConnection>(services.env, connection);
    subject->start();
    std::weak_ptr<ClientConnection> weak = subject;
    connection->start([weak](std::string p) { if (auto s = weak.lock()) s->handleIncomingMessage(p); },
                      [weak] { if (auto s = weak.lock()) s->invalidated(); });
  }
  ~Harness() {
    connection->invalidate();
    pool.drain();
  }

  void post(proto::Envelope e, std::uint64_t id = 0) {
    e.set_call_id(id);
    testing::rawSend(client.get(), e.SerializeAsString());
  }
  proto::Envelope call(proto::Envelope e, std::uint64_t id = 1) {
    post(std::move(e), id);
    return receive();
  }
  // The next message; an empty one when the connection was closed.
  proto::Envelope receive() {
    proto::Envelope reply;
    const std::string bytes = testing::rawReceive(client.get());
    EXPECT_NE(bytes, "<timeout>");
    if (bytes != "<eof>" && bytes != "<timeout>") EXPECT_TRUE(reply.ParseFromString(bytes));
    return reply;
  }
  // The connection's keep-alive transactions (a bag fetch holds one of its own).
  std::size_t keepAlives() { return transactions.open()["com.norvel.tavixd.ipc"]; }
};

proto::Envelope configure(const std::string& identifier, const std::string& userAgent) {
  proto::Envelope e;
  e.mutable_configure()->mutable_configuration()->set_identifier(identifier);
  e.mutable_configure()->mutable_configuration()->set_user_agent(userAgent);
  return e;
}

proto::Envelope notify(const std::string& name, const std::string& stream = "") {
  proto::Envelope e;
  e.mutable_notify()->set_name(name);
  e.mutable_notify()->set_stream(stream);
  return e;
}

TEST(ClientConnection, SilenceEndsTheKeepAliveTransactionAndTheNextMessageOpensOne) {
  Harness h;
  EXPECT_EQ(h.keepAlives(), 1u);
  ASSERT_TRUE(h.call(configure("com.norvel.seekara", "seekara/1")).has_configure_reply());
  auto state = h.assembly.clientStateManager->stateForClientIdentifier("com.norvel.seekara");
  ASSERT_TRUE(state && state->queryCache());
  state->queryCache()->set(
      makeRef<CachedResultSet>("ca", nullptr, platform::Dictionary{{"query", "camera"}}, "u", "[1]", h.clock.now()));
  // The bag server refuses: once the wait is over the client hears why it has no bag.
  h.advance(1);
  auto loaded = h.receive();
  ASSERT_TRUE(loaded.has_bag_did_load());
  EXPECT_EQ(loaded.bag_did_load().error().reason(), "timeout");
  h.advance(58);
  h.call(notify("a"));
  h.advance(59);
  EXPECT_EQ(h.keepAlives(), 1u) << "each message re-arms the idle timer";
  EXPECT_EQ(state->queryCache()->count(), 1u);
  h.advance(2);
  EXPECT_EQ(h.keepAlives(), 0u);
  EXPECT_EQ(state->queryCache()->count(), 0u) << "a silent client's cached replies go with its transaction";
  h.call(notify("b"));
  EXPECT_EQ(h.keepAlives(), 1u);
}

TEST(ClientConnection, OneBagPerClientHoweverOftenItConfiguresAndLateRepliesAreLogged) {
  Harness h;
  platform::LogCapture capture;
  const auto seekara = configure("com.norvel.seekara", "seekara/1");
  ASSERT_TRUE(h.call(seekara).has_configure_reply());
  ASSERT_TRUE(h.call(seekara, 2).has_configure_reply()) << "the first bag has not come yet";
  h.advance(1);
  auto loaded = h.receive();
  ASSERT_TRUE(loaded.has_bag_did_load());
  EXPECT_EQ(loaded.bag_did_load().error().reason(), "timeout");
  EXPECT_EQ(h.call(notify("next"), 3).call_id(), 3u) << "no second bagDidLoad came before this reply";

  // The client asks again and leaves before the answer: what the daemon still sends is logged,
  // not dropped silently.
  proto::Envelope ask;
  ask.mutable_bag();
  h.post(ask, 5);
  h.pool.drain();
  h.client.reset();
  ASSERT_TRUE(tavix::testing::waitFor([&] { return !h.connection->isValid(); }));
  h.advance(1);
  EXPECT_TRUE(capture.contains("(pid:" + std::to_string(::getpid()) + ") remote proxy error: connection invalidated"));
}

TEST(ClientConnection, RelaysResourceNotificationsThatNameAResource) {
  Harness h;
  auto& center = *h.assembly.notificationCenter;
  center.post("TVXFileDownloadCompletedNotification", nullptr, {}, {});  // no identifier: nothing sent
  center.post("TVXFileDownloadCompletedNotification", nullptr, {}, {{"identifier", platform::PropertyValue("hints")}});
  center.post("TVXFileDeletedNotification", nullptr, {}, {{"identifier", platform::PropertyValue("old")}});
  h.pool.drain();
  std::vector<std::string> got;
  for (int i = 0; i < 2; ++i) {
    auto e = h.receive();
    EXPECT_EQ(e.call_id(), 0u);
    if (e.has_did_download_resource()) got.push_back("+" + e.did_download_resource().identifier());
    if (e.has_did_delete_resource()) got.push_back("-" + e.did_delete_resource().identifier());
  }
  std::sort(got.begin(), got.end());
  EXPECT_EQ(got, (std::vector<std::string>{"+hints", "-old"}));
}

TEST(ClientConnection, RefusesConfigurationsThatWouldInjectHeaders) {
  platform::LogCapture capture;
  {
    Harness h;
    EXPECT_FALSE(h.call(configure("com.norvel.seekara", "seekara/1.0\r\nX-Injected: agent")).has_configure_reply())
        << "closed without a reply";
    EXPECT_TRUE(capture.contains("configuration carries a control character"));
    EXPECT_TRUE(capture.contains("seekara/1.0\\x0d\\x0aX-Injected: agent")) << "logged, escaped";
    EXPECT_TRUE(h.assembly.clientStateManager->sessions().empty()) << "no state for a refused client";
  }
  // The device's part of the agent comes from defaults, and is held to the same rule.
  capture.clear();
  Harness h;
  h.assembly.userDefaults->setObject("TVXDeviceModel", "Desk\nX-Injected: model");
  EXPECT_FALSE(h.call(configure("com.norvel.seekara", "seekara/1.0")).has_configure_reply());
  EXPECT_TRUE(capture.contains("configuration carries a control character"));
}

TEST(ClientConnection, AnswersTooLargeForAFrameAndDatesThatAreNotNumbersAreRefused) {
  Harness h(300);
  platform::LogCapture capture;
  // The answer names the stream, which makes it larger than the connection's frames.
  auto reply = h.call(notify("x", std::string(250, 's')), 7);
  EXPECT_EQ(reply.call_id(), 7u);
  ASSERT_TRUE(reply.has_call_failed());
  EXPECT_NE(reply.call_failed().reason().find("over the frame limit of 300 bytes"), std::string::npos);

  proto::Envelope clear;
  clear.mutable_clear_engaged_completions()->set_from_date(std::nan(""));
  clear.mutable_clear_engaged_completions()->set_to_date(1e300);
  h.post(clear);
  EXPECT_EQ(h.call(notify("after"), 8).call_id(), 8u);
  EXPECT_TRUE(capture.contains("are not both numbers"));
}

// Delivered launch events and activity runs, and the full user agent a client is known by, are
// checked over the daemon's socket.
TEST(ClientConnection, RefusesWhatItCannotServeAndKeepsItsFirstIdentifier) {
  Harness h;
  auto reply = h.call(notify("x", "no.such.stream"), 2);
  EXPECT_EQ(reply.call_id(), 2u);
  EXPECT_FALSE(reply.notify_reply().delivered());
  EXPECT_EQ(reply.notify_reply().error().code(), 404) << "a stream nobody registered";

  proto::Envelope request;
  request.mutable_request()->mutable_request()->set_query_id(9);
  request.mutable_request()->mutable_request()->mutable_flight_search()->set_flight_query("NV 12");
  h.post(request, 3);  // no state bound yet
  request.mutable_request()->mutable_request()->clear_kind();
  h.post(request, 4);  // no kind
  EXPECT_EQ(h.call(notify("after"), 5).call_id(), 5u) << "neither request got a reply";

  EXPECT_TRUE(h.call(configure("first", "client/2")).has_configure_reply());
  EXPECT_TRUE(h.call(configure("second", "client/2")).has_configure_reply());
  h.connection->queue().sync([&] {
    ASSERT_TRUE(h.subject->configuration());
    EXPECT_EQ(h.subject->configuration()->identifier, "first");
    EXPECT_EQ(h.subject->state(), h.assembly.clientStateManager->stateForClientIdentifier("first"));
  });
}

}  // namespace
}  // namespace tavix
