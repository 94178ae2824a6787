// The Assembly's four URL sessions: made once per assembly and configured for their traffic.
#include <gtest/gtest.h>

#include <thread>

#include "core/assembly.h"
#include "platform/defaults.h"
#include "platform/http/url_session.h"
#include "support/temp_home.h"

namespace {

using tavix::Assembly;
using tavix::platform::UserDefaults;
using tavix::platform::http::URLSession;

TEST(HTTPAssemblyTest, SessionsAreMadeOncePerAssemblyAndReadNoParallaxOnlyThen) {
  tavix::testing::TempHome home;
  auto defaults = std::make_shared<UserDefaults>(home.config(), "com.norvel.tavixd");
  defaults->setObject("TVXNoParallax", true);
  Assembly first, second;
  first.userDefaults = defaults;
  second.userDefaults = defaults;

  std::shared_ptr<URLSession> a, b;
  std::thread t1([&] { a = first.urlSession(); });
  std::thread t2([&] { b = first.urlSession(); });
  t1.join();
  t2.join();
  ASSERT_TRUE(a);
  EXPECT_EQ(a, b);
  EXPECT_NE(second.urlSession(), a) << "each assembly owns its sessions";
  EXPECT_FALSE(a->configuration().tcpFastOpen);
  EXPECT_FALSE(a->configuration().tlsSessionReuse);
  EXPECT_EQ(a->configuration().memoryCacheCapacity, 4194304u);

  defaults->setObject("TVXNoParallax", false);
  EXPECT_FALSE(first.urlSession()->configuration().tcpFastOpen) << "the default is read once";

  // Four different sessions, each the same on every later call.
  const auto bag = first.bagSession(), download = first.downloadURLSession(), upload = first.uploadURLSession();
  EXPECT_NE(bag, a);
  EXPECT_NE(download, bag);
  EXPECT_NE(upload, download);
  EXPECT_EQ(first.bagSession(), bag);
  EXPECT_EQ(first.downloadURLSession(), download);
  EXPECT_EQ(first.uploadURLSession(), upload);
  EXPECT_EQ(bag->configuration().memoryCacheCapacity, 0u);
  EXPECT_EQ(download->configuration().identifier, "com.norvel.tavixd");
  EXPECT_EQ(upload->configuration().identifier, "com.norvel.tavixd.flusher.urlsession");
  EXPECT_EQ(upload->configuration().timeoutIntervalForRequest, 300);
  EXPECT_EQ(upload->configuration().timeoutIntervalForResource, 604800);
}

}  // namespace
