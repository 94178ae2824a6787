// The device context the real daemon sends with a search: the installed-app signature from the
// whitelist resource and the desktop entries, the subscriptions and the store front from the
// defaults, as the devserver program receives them.
#include <gtest/gtest.h>

#include <stdlib.h>

#include <ctime>
#include <filesystem>
#include <fstream>

#include "context/app_signature.h"
#include "support/query_daemon.h"

namespace {

using namespace tavix;
using tavix::testing::json;
using tavix::testing::QueryDaemonTest;

TEST_F(QueryDaemonTest, SearchesCarryTheAppSignatureSubscriptionsAndStoreFront) {
  // Installed: one whitelisted app among the desktop entries of the user's data folder only.
  const auto data = home.root() / "data";
  std::filesystem::create_directories(data / "applications");
  std::ofstream(data / "applications/org.example.Maps.desktop") << "[Desktop Entry]\nType=Application\nName=Maps\n";
  setenv("XDG_DATA_HOME", data.c_str(), 1);
  setenv("XDG_DATA_DIRS", (home.root() / "none").c_str(), 1);
  const std::string whitelist =
      json{{"apps", R"({"version":"0aff1b","apps":{"org.example.Maps":[{"encoding_id":9}],"org.other":[{"encoding_id":2}]}})"},
           {"compression", "RLE"},
           {"encoding", "bitmap"}}
          .dump();
  const auto caches = home.cache() / "com.norvel.tavixd";
  std::filesystem::create_directories(caches);
  std::ofstream(caches / kTVXInstalledAppWhitelist) << whitelist;
  const auto now = static_cast<std::int64_t>(std::time(nullptr));
  // The second changed before the bag's TTL reaches back: it is not reported.
  const platform::PropertyValue::Array subscriptions{
      platform::Dictionary{{"identifier", "com.example.tv"}, {"type", "app"}, {"modified", now - 10}},
      platform::Dictionary{{"identifier", "com.example.old"}, {"modified", now - 86400 - 600}}};
  tavix::testing::setDaemonDefaults(home, {{"TVXVideoSubscriptions", subscriptions},
                                           {"TVXMusicSubscriptionStatus", 3},
                                           {"TVXStorefrontIdentifier", "143441-1,29"}});
  serveBag({{"subscription_bundle_id_whitelist", {"com.example.tv", "com.example.old"}},
            {"subscription_domain_whitelist", json::array()},
            {"subscription_ttl_s", 86400}});

  startDaemon();
  // Both are made in the background at start; a search after these lines carries them.
  ASSERT_TRUE(tavixd->waitForLog("installed app signature: ")) << tavixd->log();
  ASSERT_TRUE(tavixd->waitForLog("2 subscription records passed on")) << tavixd->log();
  ASSERT_TRUE(send(request("weather")).reply);

  auto lastSearch = [&] {
    json search;
    for (const auto& r : json::parse(call("/_recorded"))) {
      if (r["path"] == "/search") search = r;
    }
    return search;
  };
  const json search = lastSearch();
  ASSERT_FALSE(search.is_null());
  const auto expected = processWhitelist(whitelist, {{"org.example.Maps", "1"}});
  ASSERT_TRUE(expected);
  EXPECT_EQ(search["headers"].value("x-norvel-whitelisted-app-signature", ""), *expected);
  EXPECT_EQ(json::parse(search["headers"].value("x-norvel-subscriptions", "null")),
            json::parse(R"([{"provider":"com.example.tv","type":"app","active":true},
                            {"provider":"tarn","attribute":"premium","active":true}])"));
  EXPECT_EQ(search["query"].value("storefront", ""), "143441-1,29");

  // A bag without the domain whitelist withdraws the subscriptions.
  serveBag({{"version", "2"}, {"subscription_domain_whitelist", nullptr}});
  fault({{"path", "/search"}, {"headers", {{"X-Norvel-ForceFetch", R"({"bag": 2})"}}}, {"times", 1}});
  ASSERT_TRUE(send(request("forecast")).reply);
  ASSERT_TRUE(tavixd->waitForLog("0 subscription records passed on")) << tavixd->log();
  ASSERT_TRUE(send(request("news")).reply);
  EXPECT_FALSE(lastSearch()["headers"].contains("x-norvel-subscriptions"));
  EXPECT_EQ(lastSearch()["headers"].value("x-norvel-whitelisted-app-signature", ""), *expected);
}

}  // namespace
