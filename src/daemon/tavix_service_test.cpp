#include "daemon/tavix_service.h"

#include <gtest/gtest.h>

#include "core/assembly.h"
#include "daemon/client_connection.h"
#include "platform/defaults.h"
#include "platform/ipc/server.h"
#include "platform/log.h"
#include "platform/transactions.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

namespace ipc = platform::ipc;

TEST(TavixService, TracksConnectionsFromAcceptanceToInvalidation) {
  testing::TempHome home;
  platform::DispatchPool pool(2);
  platform::SystemClock clock(pool);
  platform::TransactionTracker transactions;
  platform::LogCapture capture;
  Assembly assembly;
  assembly.dispatchPool = &pool;
  assembly.clock = &clock;
  assembly.transactions = &transactions;
  assembly.userDefaults = std::make_shared<platform::UserDefaults>(home.config(), "com.norvel.tavixd");
  assembly.userDefaults->registerDefaults({{"TVXSharedSession", platform::PropertyValue(true)}});
  platform::Logger log("test", "listener");

  {
    TavixService service(assembly);
    EXPECT_TRUE(assembly.sharedSession);
    std::error_code ec;
    auto listener = ipc::IpcListener::listen(pool, (home.runtime() / "socket").string(), log, &ec);
    ASSERT_TRUE(listener);
    listener->resume([&](const auto& c) { EXPECT_TRUE(service.shouldAcceptNewConnection(c)); }, "test.connection");

    ipc::UniqueFd first, second;
    ASSERT_FALSE(ipc::connectTo(listener->path(), &first));
    ASSERT_FALSE(ipc::connectTo(listener->path(), &second));
    ASSERT_TRUE(testing::waitFor([&] { return service.getClientConnections().size() == 2; }));
    const std::string pid = std::to_string(::getpid());
    EXPECT_TRUE(capture.contains("new connection from daemon_tests (" + pid + ")"));
    EXPECT_TRUE(testing::waitFor([&] { return capture.contains("too many connections 2 from pid " + pid); }));
    EXPECT_EQ(capture.count("too many connections 1"), 0u);
    EXPECT_EQ(transactions.openCount(), 2u) << "each new client holds the daemon up";

    first.reset();
    EXPECT_TRUE(testing::waitFor([&] { return service.getClientConnections().size() == 1; }));
    EXPECT_EQ(capture.count("purging url cache"), 0u) << "a client is still connected";
    second.reset();
    EXPECT_TRUE(testing::waitFor([&] { return service.getClientConnections().empty(); }));
    EXPECT_TRUE(testing::waitFor([&] { return capture.count("purging url cache") == 1; }));
    // These peers never sent a configuration: no session of theirs to close.
    EXPECT_EQ(capture.count("session not flushed on invalidation"), 2u);
    EXPECT_EQ(capture.count("connection from daemon_tests (" + pid + ") invalidated"), 2u);
    EXPECT_TRUE(testing::waitFor([&] { return transactions.openCount() == 0; }));
    listener.reset();
    pool.drain();
  }
}

}  // namespace
}  // namespace tavix
