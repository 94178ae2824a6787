#include "daemon/tavix_service.h"

#include <gtest/gtest.h>

#include "core/diagnostics.h"
#include "daemon/client_connection.h"
#include "platform/counters.h"
#include "platform/defaults.h"
#include "platform/ipc/server.h"
#include "platform/log.h"
#include "platform/transactions.h"
#include "query/client_state_manager.h"
#include "support/connection_services.h"
#include "support/raw_frames.h"
#include "tavix_proto/ipc.pb.h"

namespace tavix {
namespace {

namespace ipc = platform::ipc;

struct TavixServiceTest : ::testing::Test, testing::TestAssembly {};

TEST_F(TavixServiceTest, TracksConnectionsFromAcceptanceToInvalidation) {
  platform::LogCapture capture;
  defaults->registerDefaults({{"TVXSharedSession", platform::PropertyValue(true)}});
  platform::Logger log("test", "listener");
  testing::ConnectionServices services(*this, nullptr, nullptr);
  TavixService service({&pool, assembly.urlSession(), [env = services.env](const auto& connection) {
                          return std::make_shared<ClientConnection>(env, connection);
                        }});
  std::error_code ec;
  auto listener = ipc::IpcListener::listen(pool, (home.runtime() / "socket").string(), log, &ec);
  ASSERT_TRUE(listener) << ec.message();
  listener->resume([&](const auto& c) { EXPECT_TRUE(service.shouldAcceptConnection(c)); }, "test.connection");

  ipc::UniqueFd first(testing::rawConnect(listener->path())), second(testing::rawConnect(listener->path()));
  ASSERT_TRUE(testing::waitFor([&] { return service.getClientConnections().size() == 2; }));
  const std::string pid = std::to_string(::getpid());
  EXPECT_TRUE(testing::waitFor([&] { return capture.contains("too many connections 2 from pid " + pid); }));
  EXPECT_EQ(capture.count("too many connections 1"), 0u);
  EXPECT_EQ(transactions.openCount(), 2u) << "each new client holds the daemon up";

  // The first says who it is; its leaving is counted against its client.
  testing::rawSend(first.get(), testing::configureFrame("com.norvel.seekara", "seekara/1", 1));
  ASSERT_TRUE(testing::waitFor([&] { return capture.contains("using client state"); }));
  const std::string invalidations = createCounterKey("seekara", "ipcinvalidation");
  const auto before = TavixDiagnosticDataReporter::store().value(invalidations);

  first.reset();
  EXPECT_TRUE(testing::waitFor([&] { return service.getClientConnections().size() == 1; }));
  EXPECT_EQ(capture.count("purging url cache"), 0u) << "a client is still connected";
  second.reset();
  EXPECT_TRUE(testing::waitFor([&] { return service.getClientConnections().empty(); }));
  EXPECT_TRUE(testing::waitFor([&] { return capture.count("purging url cache") == 1; }));
  // The second never sent a configuration: only the first is counted.
  EXPECT_EQ(TavixDiagnosticDataReporter::store().value(invalidations), before + 1);
  // A client that leaves holds the daemon up a minute more, in case it comes back.
  auto held = [&] { return transactions.open()["com.norvel.tavixd.ipc"]; };
  EXPECT_EQ(held(), 2u);
  clock.advance(platform::seconds(59));
  EXPECT_EQ(held(), 2u);
  clock.advance(platform::seconds(1));
  EXPECT_EQ(held(), 0u);
  listener.reset();
  pool.drain();
}

}  // namespace
}  // namespace tavix
