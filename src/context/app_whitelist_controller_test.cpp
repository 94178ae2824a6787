#include "context/app_whitelist_controller.h"

#include <gtest/gtest.h>

#include <fstream>

#include "context/desktop_entries.h"
#include "core/names.h"
#include "platform/defaults.h"
#include "platform/json_value.h"
#include "platform/transactions.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

namespace fs = platform::fs;

class AppWhitelistControllerTest : public ::testing::Test {
 protected:
  AppWhitelistControllerTest() {
    fs::create_directories(caches);
    installApp("org.example.Maps");
    installApp("org.example.Notes");
  }

  AppWhitelistController::Environment environment() {
    return {&pool, &clock, &transactions, center, defaults, caches, folders};
  }
  void installApp(const std::string& id) {
    fs::create_directories(folders[0]);
    std::ofstream(folders[0] / (id + ".desktop")) << "[Desktop Entry]\nType=Application\nName=" << id << "\n";
  }
  // Places the whitelist resource and says it arrived, as the download manager does.
  void deliverWhitelist(const std::string& bytes) {
    std::ofstream(caches / kTVXInstalledAppWhitelist, std::ios::binary | std::ios::trunc) << bytes;
    center->post(kTVXFileDownloadCompletedNotification, nullptr, {},
                 {{"identifier", kTVXInstalledAppWhitelist},
                  {"url", "file://" + (caches / kTVXInstalledAppWhitelist).string()}});
  }
  std::optional<std::string> stored() { return defaults->stringForKey(kTVXAppWhitelistSignatureKey); }

  testing::TempHome home;
  fs::path caches = home.cache() / "com.norvel.tavixd";
  std::vector<fs::path> folders = applicationFolders(home.root() / "data", "");
  platform::TransactionTracker transactions;
  platform::DispatchPool pool{2};
  platform::VirtualClock clock;
  std::shared_ptr<platform::NotificationCenter> center = std::make_shared<platform::NotificationCenter>();
  std::shared_ptr<platform::UserDefaults> defaults =
      std::make_shared<platform::UserDefaults>(home.config(), "com.norvel.tavixd");
  const std::string whitelist = platform::toJson(platform::Dictionary{
      {"apps", R"({"version":"0aff1b","apps":{"org.example.Maps":[{"encoding_id":1}],"org.other":[{"encoding_id":3}]}})"},
      {"compression", "RLE"},
      {"encoding", "bitmap"}});
};

TEST_F(AppWhitelistControllerTest, SignatureFollowsTheWhitelistOutlivesARestartAndGoesWithAnUnusableOne) {
  auto controller = AppWhitelistController::create(environment());
  controller->drainQueue();
  EXPECT_FALSE(controller->whitelistSignature());  // no whitelist downloaded yet

  deliverWhitelist(whitelist);
  controller->drainQueue();
  const auto expected = processWhitelist(whitelist, installedApps(folders));
  ASSERT_TRUE(expected);
  EXPECT_EQ(controller->whitelistSignature(), expected);
  EXPECT_EQ(stored(), expected);
  EXPECT_EQ(transactions.openCount(), 0u);

  // The next start has the stored signature at once and does not regenerate: the file it would
  // read now says otherwise.
  controller.reset();
  std::ofstream(caches / kTVXInstalledAppWhitelist, std::ios::trunc) << "{}";
  auto restarted = AppWhitelistController::create(environment());
  restarted->drainQueue();
  EXPECT_EQ(restarted->whitelistSignature(), expected);

  // Malformed whitelists are the parser's business; here, that a failure withdraws the signature,
  // and that an oversized file is refused unread.
  deliverWhitelist(std::string(17 * 1024 * 1024, '\xff'));
  restarted->drainQueue();
  EXPECT_FALSE(restarted->whitelistSignature());
  EXPECT_FALSE(stored());

  // Another whitelisted app arrives (moved in whole: one change); it counts once changes settle.
  deliverWhitelist(whitelist);
  restarted->drainQueue();
  fs::create_directories(home.root() / "staging");
  std::ofstream(home.root() / "staging/org.other.desktop") << "[Desktop Entry]\nType=Application\nName=O\n";
  fs::rename(home.root() / "staging/org.other.desktop", folders[0] / "org.other.desktop");
  ASSERT_TRUE(testing::waitFor([&] { return clock.pendingTimers() > 0; }));  // the inotify event is in
  clock.advance(platform::seconds(59));
  pool.drain();
  EXPECT_EQ(restarted->whitelistSignature(), expected);
  clock.advance(platform::seconds(1));
  pool.drain();
  const auto both = processWhitelist(whitelist, installedApps(folders));
  ASSERT_NE(both, expected);
  EXPECT_EQ(restarted->whitelistSignature(), both);
}

}  // namespace
}  // namespace tavix
