// libtavix against a scripted server built on the daemon's own socket layer.
#include <sys/socket.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <mutex>

#include "platform/ipc/server.h"
#include "platform/log.h"
#include "support/temp_home.h"
#include "tavix/client.h"

namespace tavix::client {
namespace {

namespace ipc = platform::ipc;

// Answers configure; answers listen_to_flusher twice (the duplicate must be ignored) with one
// end of a socket pair; keeps a notify named "late" until answerLate(); answers everything else
// with call_failed; greets with a one-way message.
struct ScriptedServer {
  platform::DispatchPool pool{2};
  platform::Logger log{"test", "server"};
  std::unique_ptr<ipc::IpcListener> listener;
  std::string path;
  std::mutex lock;
  std::vector<std::shared_ptr<ipc::IpcConnection>> connections;
  ipc::UniqueFd flusherPeer;  // the end the server keeps
  std::atomic<int> configures{0};
  std::vector<std::pair<std::shared_ptr<ipc::IpcConnection>, std::uint64_t>> late;  // under lock

  bool answerLate() {
    std::lock_guard l(lock);
    for (auto& [c, id] : late) {
      proto::Envelope out;
      out.set_call_id(id);
      out.mutable_notify_reply()->set_delivered(true);
      c->send(out.SerializeAsString());
    }
    const bool any = !late.empty();
    late.clear();
    return any;
  }

  explicit ScriptedServer(const testing::TempHome& home) : path((home.runtime() / "s.sock").string()) {
    std::error_code ec;
    listener = ipc::IpcListener::listen(pool, path, log, &ec);
    EXPECT_TRUE(listener) << ec.message();
    listener->resume([this](const auto& c) { accept(c); }, "test.server");
  }
  ~ScriptedServer() {
    listener.reset();
    std::lock_guard l(lock);
    for (auto& c : connections) c->invalidate();
    connections.clear();
  }

  void accept(const std::shared_ptr<ipc::IpcConnection>& c) {
    std::lock_guard l(lock);
    connections.push_back(c);
    std::weak_ptr<ipc::IpcConnection> weak = c;
    c->start([this, weak](std::string payload) {
      auto c = weak.lock();
      proto::Envelope in, out;
      if (!c || !in.ParseFromString(payload)) return;
      out.set_call_id(in.call_id());
      if (in.has_configure()) {
        ++configures;
        out.mutable_configure_reply();
        c->send(out.SerializeAsString());
        proto::Envelope hello;
        hello.mutable_did_download_resource()->set_identifier("hello");
        c->send(hello.SerializeAsString());
      } else if (in.has_notify() && in.notify().name() == "late") {
        std::lock_guard l(lock);
        late.emplace_back(c, in.call_id());
      } else if (in.has_listen_to_flusher()) {
        for (int copy = 0; copy < 2; ++copy) {
          int pair[2];
          ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
          if (copy == 0) flusherPeer.reset(pair[1]); else ::close(pair[1]);
          out.mutable_listen_to_flusher_reply()->set_has_endpoint(true);
          out.set_attached_fds(1);
          std::vector<ipc::UniqueFd> fds;
          fds.emplace_back(pair[0]);
          c->send(out.SerializeAsString(), std::move(fds));
        }
      } else {
        out.mutable_call_failed()->set_domain("kTVXErrorDomain");
        out.mutable_call_failed()->set_code(500);
        out.mutable_call_failed()->set_reason("not available");
        c->send(out.SerializeAsString());
      }
    }, [] {});
  }
};

Client::Options optionsFor(const ScriptedServer& s) {
  Client::Options o;
  o.socketPath = s.path;
  o.configuration.set_identifier("tests");
  o.configuration.set_user_agent("tests/1");
  o.timeoutMs = 5000;
  return o;
}

// Clients and daemons of different builds must understand each other: these bytes never change.
TEST(Client, WireFormatOfAConfigureCallIsStable) {
  proto::Envelope e;
  e.set_call_id(1);
  e.mutable_configure()->mutable_configuration()->set_identifier("a");
  e.mutable_configure()->mutable_configuration()->set_user_agent("b");
  EXPECT_EQ(e.SerializeAsString(), std::string("\x08\x01\xa2\x01\x08\x0a\x06\x0a\x01" "a" "\x12\x01" "b", 13));

  proto::Envelope reply;
  reply.set_call_id(2);
  reply.mutable_request_reply()->set_query_id(3);
  reply.mutable_request_reply()->mutable_error()->set_code(500);
  EXPECT_EQ(reply.SerializeAsString(), std::string("\x08\x02\xca\x01\x07\x08\x03\x1a\x03\x10\xf4\x03", 12));
}

TEST(Client, HandsOverDescriptorsAndCallsEachReplyOnce) {
  testing::TempHome home;
  ScriptedServer server(home);
  Client client(optionsFor(server));
  std::promise<std::string> greeted;
  client.setResourceHandlers([&](const std::string& id) { greeted.set_value(id); }, nullptr);

  std::atomic<int> calls{0};
  std::promise<int> endpoint;
  client.listenToFlusher([&](int fd, std::optional<Error> error) {
    EXPECT_FALSE(error) << error->describe();
    if (calls++ == 0) endpoint.set_value(fd);
  });
  auto future = endpoint.get_future();
  ASSERT_EQ(future.wait_for(std::chrono::seconds(5)), std::future_status::ready);
  ipc::UniqueFd fd(future.get());
  ASSERT_TRUE(fd.valid());
  // The descriptor is the daemon's end of a live channel: bytes written here arrive there.
  ASSERT_EQ(::write(fd.get(), "ping", 4), 4);
  char buf[4] = {};
  ASSERT_EQ(::read(server.flusherPeer.get(), buf, 4), 4);
  EXPECT_EQ(std::string(buf, 4), "ping");

  auto greeting = greeted.get_future();
  ASSERT_EQ(greeting.wait_for(std::chrono::seconds(5)), std::future_status::ready);
  EXPECT_EQ(greeting.get(), "hello");

  // A later call proves the duplicate reply has been read, and was not delivered.
  proto::Envelope other;
  other.mutable_get_image_map();
  auto error = client.callSync(other, nullptr);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, 500);
  EXPECT_EQ(error->reason, "not available");
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(server.configures, 1) << "configured once per connection";
}

TEST(Client, ACallWithoutAnAnswerFailsAtItsDeadlineOnceAndTheLateAnswerIsDropped) {
  testing::TempHome home;
  ScriptedServer server(home);
  auto options = optionsFor(server);
  options.timeoutMs = 100;
  Client client(options);
  ASSERT_FALSE(client.connect());
  std::atomic<int> calls{0};
  std::promise<std::optional<Error>> first;
  client.notify("late", [&](std::optional<Error> error) {
    if (calls++ == 0) first.set_value(error);
  });
  auto error = first.get_future().get();
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain, kClientErrorDomain);
  EXPECT_EQ(error->code, kTimedOut);
  ASSERT_TRUE(server.answerLate());
  // A later call's answer comes after the late one on the same stream: by then it has been read.
  EXPECT_TRUE(client.callSync(proto::Envelope(), nullptr));
  EXPECT_EQ(calls, 1);
}

}  // namespace
}  // namespace tavix::client
