#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <future>
#include <mutex>

#include "platform/clock.h"
#include "platform/ipc/frame.h"
#include "platform/ipc/server.h"
#include "platform/ipc/unix_socket.h"
#include "platform/log.h"
#include "support/temp_home.h"

namespace tavix::platform::ipc {
namespace {

TEST(FrameDecoder, ReassemblesFramesSplitAnywhereAndRefusesOversizeHeaders) {
  std::string stream = encodeFrame("hello") + encodeFrame("") + encodeFrame(std::string(300, 'x'));
  FrameDecoder decoder;
  std::vector<std::string> got;
  for (char c : stream) {  // worst case: one byte per read
    decoder.append(&c, 1);
    while (auto p = decoder.next()) got.push_back(*p);
  }
  EXPECT_EQ(got, (std::vector<std::string>{"hello", "", std::string(300, 'x')}));
  EXPECT_EQ(decoder.buffered(), 0u);

  FrameDecoder small(8);
  auto exact = encodeFrame("12345678");
  small.append(exact.data(), exact.size());
  EXPECT_EQ(small.next(), "12345678");
  auto over = encodeFrame("123456789");
  small.append(over.data(), 4);  // the header alone is enough to refuse it
  EXPECT_FALSE(small.next());
  EXPECT_TRUE(small.failed());
  EXPECT_EQ(small.rejectedLength(), 9u);
  small.append(exact.data(), exact.size());
  EXPECT_FALSE(small.next()) << "a failed stream stays failed";

  const char huge[] = {'\xff', '\xff', '\xff', '\xff'};
  FrameDecoder big;
  big.append(huge, 4);
  EXPECT_FALSE(big.next());
  EXPECT_EQ(big.rejectedLength(), 0xffffffffu);
}

struct Received {
  std::mutex lock;
  std::vector<std::string> payloads;
  std::vector<UniqueFd> fds;
  std::atomic<int> invalidations{0};
};

std::shared_ptr<IpcConnection> startRecording(const std::shared_ptr<IpcConnection>& c, Received& r) {
  std::weak_ptr<IpcConnection> weak = c;
  c->start(
      [&r, weak](std::string p) {
        auto self = weak.lock();
        std::lock_guard l(r.lock);
        if (p.rfind("fd:", 0) == 0 && self) {
          for (auto& fd : self->takeReceivedFds(1)) r.fds.push_back(std::move(fd));
        }
        r.payloads.push_back(std::move(p));
      },
      [&r] { ++r.invalidations; });
  return c;
}

// Blocking read of the next frame; `d` keeps bytes of later frames between calls.
std::string readFrame(int fd, FrameDecoder& d) {
  char buf[4096];
  for (;;) {
    if (auto p = d.next()) return *p;
    std::vector<int> fds;
    std::size_t n = 0;
    if (receiveWithFds(fd, buf, sizeof buf, true, &fds, &n) || n == 0) return "<eof>";
    d.append(buf, n);
  }
}

TEST(IpcServer, DeliversFramesAndDescriptorsBothWaysWithPeerCredentials) {
  testing::TempHome home;
  DispatchPool pool(2);
  Logger log("test", "ipc");
  const std::string path = (home.runtime() / "svc" / "socket").string();
  std::error_code ec;
  auto listener = IpcListener::listen(pool, path, log, &ec);
  ASSERT_TRUE(listener) << ec.message();

  EXPECT_EQ(std::filesystem::status(path).permissions(), std::filesystem::perms(0600));
  EXPECT_EQ(std::filesystem::status(home.runtime() / "svc").permissions(), std::filesystem::perms(0700));

  Received r;
  std::promise<std::shared_ptr<IpcConnection>> accepted;
  listener->resume([&](const std::shared_ptr<IpcConnection>& c) { accepted.set_value(startRecording(c, r)); },
                   "test.connection");

  UniqueFd client;
  ASSERT_FALSE(connectTo(path, &client));
  int pipeFds[2];
  ASSERT_EQ(::pipe(pipeFds), 0);
  UniqueFd readEnd(pipeFds[0]), writeEnd(pipeFds[1]);
  std::size_t sent = 0;
  ASSERT_FALSE(sendWithFds(client.get(), encodeFrame("first") + encodeFrame("fd:pipe"), {writeEnd.get()}, true, &sent));
  writeEnd.reset();

  ASSERT_TRUE(testing::waitFor([&] {
    std::lock_guard l(r.lock);
    return r.payloads.size() == 2;
  }));
  {
    std::lock_guard l(r.lock);
    EXPECT_EQ(r.payloads[0], "first");
    ASSERT_EQ(r.fds.size(), 1u);
    ASSERT_EQ(::write(r.fds[0].get(), "z", 1), 1);  // the descriptor really is the pipe's write end
    char c = 0;
    ASSERT_EQ(::read(readEnd.get(), &c, 1), 1);
    EXPECT_EQ(c, 'z');
  }
  const std::shared_ptr<IpcConnection> s = accepted.get_future().get();
  EXPECT_EQ(std::pair(s->peer().pid, s->peer().uid), std::pair(::getpid(), ::geteuid()));

  // A reply larger than the socket buffer must arrive whole, and in order.
  const std::string large(3 * 1024 * 1024, 'L');
  ASSERT_TRUE(s->send(large));
  ASSERT_TRUE(s->send("after"));
  FrameDecoder d;
  EXPECT_EQ(readFrame(client.get(), d), large);
  EXPECT_EQ(readFrame(client.get(), d), "after");

  client.reset();
  ASSERT_TRUE(testing::waitFor([&] { return r.invalidations == 1; }));
  EXPECT_FALSE(s->isValid());
  EXPECT_FALSE(s->send("late"));
  s->invalidate();
  pool.drain();
  EXPECT_EQ(r.invalidations, 1);
}

TEST(IpcServer, PeerThatStopsReadingIsDisconnected) {
  DispatchPool pool(2);
  Logger log("test", "ipc");
  LogCapture capture;
  int pair[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
  UniqueFd peer(pair[1]);
  auto c = IpcConnection::make(pool, UniqueFd(pair[0]), {::getpid(), ::getuid(), ::getgid()}, "test", log, 1024);
  Received r;
  startRecording(c, r);
  const std::string frame(1000, 'f');
  for (int i = 0; i < 5000 && c->isValid(); ++i) {
    c->send(frame);
    if (i % 100 == 0) pool.drain();
  }
  EXPECT_TRUE(testing::waitFor([&] { return r.invalidations == 1; }));
  EXPECT_TRUE(capture.contains("peer does not read"));
}

TEST(IpcServer, CallsThatWaitNeverHoldEveryReactorThread) {
  // A call may be answered on the reactor thread that read it; two calls that both wait must
  // still leave a thread to read the third, which is what they wait for.
  DispatchPool pool(4);
  SystemClock clock(pool);
  Logger log("test", "ipc");
  std::mutex lock;
  std::condition_variable changed;
  int entered = 0;
  bool thirdArrived = false;
  std::vector<UniqueFd> peers;
  std::vector<std::shared_ptr<IpcConnection>> connections;
  for (int i = 0; i < 3; ++i) {
    int pair[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    peers.emplace_back(pair[1]);
    auto c = IpcConnection::make(pool, UniqueFd(pair[0]), {::getpid(), ::getuid(), ::getgid()}, "test", log);
    c->start(
        [&, i](std::string) {
          std::unique_lock guard(lock);
          if (i == 2) {
            thirdArrived = true;
          } else {
            ++entered;
            changed.notify_all();
            // Bounded only so that a failure ends the test instead of hanging it.
            clock.waitFor(guard, changed, seconds(10), [&] { return thirdArrived; });
          }
          changed.notify_all();
        },
        [] {});
    connections.push_back(c);
  }
  auto call = [&](int i) {
    std::size_t sent = 0;
    ASSERT_FALSE(sendWithFds(peers[i].get(), encodeFrame("wait"), {}, true, &sent));
  };
  for (int i = 0; i < 2; ++i) {
    call(i);
    std::unique_lock guard(lock);
    changed.wait(guard, [&] { return entered == i + 1; });
  }
  call(2);
  {
    std::unique_lock guard(lock);
    EXPECT_TRUE(changed.wait_for(guard, std::chrono::seconds(10), [&] { return thirdArrived; }));
  }
  pool.drain();
}

TEST(IpcServer, RefusesPeersOfAnotherUser) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to connect as another user";
  testing::TempHome home;
  DispatchPool pool(2);
  Logger log("test", "ipc");
  LogCapture capture;
  const auto dir = home.runtime() / "open";
  std::error_code ec;
  auto listener = IpcListener::listen(pool, (dir / "socket").string(), log, &ec);
  ASSERT_TRUE(listener);
  // Let the other user reach the socket, so that only the credential check stands in the way.
  for (const auto& path : {home.root(), home.runtime(), dir, dir / "socket"})
    std::filesystem::permissions(path, std::filesystem::perms::all);
  std::atomic<int> accepted{0};
  listener->resume([&](const std::shared_ptr<IpcConnection>&) { ++accepted; }, "test.connection");

  const pid_t child = ::fork();
  if (child == 0) {
    if (::setgid(65534) != 0 || ::setuid(65534) != 0) _exit(2);
    UniqueFd fd;
    if (connectTo(listener->path(), &fd)) _exit(3);
    char c;
    _exit(::read(fd.get(), &c, 1) == 0 ? 0 : 4);  // closed on us without a word
  }
  int status = 0;
  ::waitpid(child, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
  EXPECT_TRUE(testing::waitFor([&] { return capture.contains("of uid 65534"); }));
  EXPECT_EQ(accepted, 0);
}

TEST(IpcServer, ReplacesStaleSocketFileButNotLiveListener) {
  testing::TempHome home;
  DispatchPool pool(1);
  Logger log("test", "ipc");
  const std::string path = (home.runtime() / "socket").string();
  {
    UniqueFd stale;
    ASSERT_FALSE(listenAt(path, &stale));
  }  // closed, file left behind as after a crash
  std::error_code ec;
  auto first = IpcListener::listen(pool, path, log, &ec);
  ASSERT_TRUE(first) << ec.message();
  auto second = IpcListener::listen(pool, path, log, &ec);
  EXPECT_FALSE(second);
  EXPECT_EQ(ec, std::errc::address_in_use);
  first.reset();
  EXPECT_FALSE(std::filesystem::exists(path));
}

}  // namespace
}  // namespace tavix::platform::ipc
