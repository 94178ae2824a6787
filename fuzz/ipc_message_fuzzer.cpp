// Hands arbitrary payloads to a client connection of the daemon, as frames from a peer would
// arrive: whatever the bytes, the daemon must neither crash nor hang.
#include <sys/socket.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <thread>

#include "core/assembly.h"
#include "daemon/client_connection.h"
#include "platform/activity.h"
#include "platform/ipc/launch_events.h"
#include "platform/ipc/server.h"
#include "platform/log.h"
#include "platform/notification_center.h"
#include "cache/engaged_completion_cache.h"

namespace {

using namespace tavix;

struct World {
  platform::DispatchPool pool{2};
  platform::VirtualClock clock;
  platform::TransactionTracker transactions;
  platform::SerialQueue activityQueue{pool, "fuzz.activities"};
  platform::ActivityScheduler activities{clock, activityQueue, transactions};
  platform::SerialQueue eventQueue{pool, "fuzz.events"};
  platform::ipc::LaunchEventRegistry events{eventQueue};
  platform::Logger log{"fuzz", "connection"};
  Assembly assembly;
  std::shared_ptr<platform::ipc::IpcConnection> connection;
  std::shared_ptr<ClientConnection> client;
  std::thread drainer;

  World() {
    platform::setLogLevel(platform::LogLevel::Fault);
    assembly.dispatchPool = &pool;
    assembly.clock = &clock;
    assembly.transactions = &transactions;
    assembly.activityScheduler = &activities;
    assembly.notificationCenter = std::make_shared<platform::NotificationCenter>();
    assembly.engagedCompletionCache = EngagedCompletionCache::create({assembly.cachesFolder(), &clock, &pool, nullptr});
    activities.checkIn("fuzz.activity", platform::seconds(0), [](const auto&) {});
    events.setHandler("com.norvel.notify.matching", [](const std::string&) {});
    connect();
  }

  // A fresh connection whose peer reads and drops everything the daemon sends.
  void connect() {
    if (drainer.joinable()) drainer.join();
    int pair[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) std::abort();
    drainer = std::thread([fd = pair[1]] {
      char buf[4096];
      while (::read(fd, buf, sizeof buf) > 0) {
      }
      ::close(fd);
    });
    connection = platform::ipc::IpcConnection::make(pool, platform::ipc::UniqueFd(pair[0]),
                                                    {::getpid(), ::getuid(), ::getgid()}, "fuzz.connection", log);
    client = std::make_shared<ClientConnection>(assembly, connection, &events);
    client->start();
    std::weak_ptr<ClientConnection> weak = client;
    connection->start([](std::string) {}, [weak] {
      if (auto c = weak.lock()) c->invalidated();
    });
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static World* world = new World;  // one daemon for the whole run, as in production
  if (!world->connection->isValid()) {
    world->pool.drain();
    world->connect();
  }
  const std::string payload(reinterpret_cast<const char*>(data), size);
  auto client = world->client;
  world->connection->queue().sync([&] { client->handleIncomingMessage(payload); });
  return 0;
}
