// libtavix against a scripted server built on the daemon's own socket layer.
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

// Answers configure; keeps a notify named "late" until answerLate(); answers everything else
// with call_failed.
struct ScriptedServer {
  platform::DispatchPool pool{2};
  platform::Logger log{"test", "server"};
  std::unique_ptr<ipc::IpcListener> listener;
  std::string path;
  std::mutex lock;
  std::vector<std::shared_ptr<ipc::IpcConnection>> connections;
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
        out.mutable_configure_reply();
        c->send(out.SerializeAsString());
      } else if (in.has_notify() && in.notify().name() == "late") {
        std::lock_guard l(lock);
        late.emplace_back(c, in.call_id());
      } else {
        out.mutable_call_failed()->set_domain("kTVXErrorDomain");
        out.mutable_call_failed()->set_code(500);
        out.mutable_call_failed()->set_reason("not available");
        c->send(out.SerializeAsString());
      }
    }, [] {});
  }
};

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

TEST(Client, ACallWithoutAnAnswerFailsAtItsDeadlineOnceAndTheLateAnswerIsDropped) {
  testing::TempHome home;
  ScriptedServer server(home);
  Client::Options options;
  options.socketPath = server.path;
  options.configuration.set_identifier("tests");
  options.configuration.set_user_agent("tests/1");
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
  // A blocking call keeps its deadline on its own thread.
  proto::Envelope late;
  late.mutable_notify()->set_name("late");
  error = client.callSync(late, nullptr);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, kTimedOut);
  ASSERT_TRUE(server.answerLate());
  // A later call's answer comes after the late one on the same stream: by then it has been read.
  EXPECT_TRUE(client.callSync(proto::Envelope(), nullptr));
  EXPECT_EQ(calls, 1);
}

}  // namespace
}  // namespace tavix::client
