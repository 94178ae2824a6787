#include "platform/defaults.h"

#include <gtest/gtest.h>

#include <atomic>
#include <fstream>
#include <mutex>

#include "support/temp_home.h"

namespace tavix::platform {
namespace {

struct DefaultsTest : ::testing::Test {
  testing::TempHome home;
  fs::path folder = home.config() / "com.norvel.tavixd";
};

TEST_F(DefaultsTest, AWriteKeepsAnotherWritersValueAndTheFilePrivate) {
  UserDefaults daemon(folder, "com.norvel.tavixd");
  UserDefaults tool(folder, "com.norvel.tavixd");
  tool.setObject("fromTool", PropertyValue(1));
  daemon.setObject("fromDaemon", PropertyValue(2));  // without a synchronize in between
  UserDefaults fresh(folder, "com.norvel.tavixd");
  EXPECT_EQ(fresh.integerForKey("fromTool"), 1);
  EXPECT_EQ(fresh.integerForKey("fromDaemon"), 2);
  EXPECT_EQ(fs::status(fresh.filePath()).permissions(), fs::perms(0600));
}

TEST_F(DefaultsTest, SynchronizeSeesAHandEditTellsObserversWhatChangedAndSurvivesATornFile) {
  UserDefaults defaults(folder, "com.norvel.tavixd");
  defaults.setObject("keep", PropertyValue("same"));
  defaults.setObject("old", PropertyValue(1));
  std::vector<std::string> heard;
  auto sub = defaults.addObserver([&](const std::string& key) { heard.push_back(key); });

  std::ofstream(defaults.filePath()) << toXmlPlist(PropertyValue(
      Dictionary{{"keep", PropertyValue("same")}, {"TVXNoQueryCache", PropertyValue(true)}}));
  EXPECT_FALSE(defaults.boolForKey("TVXNoQueryCache"));
  ASSERT_TRUE(defaults.synchronize());
  EXPECT_TRUE(defaults.boolForKey("TVXNoQueryCache"));
  std::sort(heard.begin(), heard.end());
  EXPECT_EQ(heard, (std::vector<std::string>{"TVXNoQueryCache", "old"}));

  sub.reset();
  defaults.setObject("after", PropertyValue(1));
  EXPECT_EQ(heard.size(), 2u);

  // A torn file is reported and the values in memory stay.
  std::ofstream(defaults.filePath()) << "<plist><dict><key>k</key>";
  EXPECT_FALSE(defaults.synchronize());
  EXPECT_EQ(defaults.integerForKey("after"), 1);
}

TEST_F(DefaultsTest, WatchPicksUpAFileWrittenByHand) {
  DispatchPool pool(2);
  UserDefaults defaults(folder, "com.norvel.tavixd");
  std::mutex lock;
  std::vector<std::string> heard;
  auto sub = defaults.addObserver([&](const std::string& key) {
    std::lock_guard<std::mutex> guard(lock);
    heard.push_back(key);
  });
  defaults.watch(pool);
  // An editor's save: write a temporary file and rename it over the old one.
  const fs::path tmp = folder / "edit.tmp";
  std::ofstream(tmp) << toXmlPlist(PropertyValue(Dictionary{{"TVXBagURL", PropertyValue("http://127.0.0.1:1/bag")}}));
  fs::rename(tmp, defaults.filePath());
  ASSERT_TRUE(testing::waitFor([&] { return defaults.stringForKey("TVXBagURL").has_value(); }));
  EXPECT_EQ(*defaults.stringForKey("TVXBagURL"), "http://127.0.0.1:1/bag");
  std::lock_guard<std::mutex> guard(lock);
  EXPECT_NE(std::find(heard.begin(), heard.end(), "TVXBagURL"), heard.end());
}

}  // namespace
}  // namespace tavix::platform
