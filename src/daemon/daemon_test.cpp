#include <gtest/gtest.h>

#include <fstream>

#include "daemon/options.h"
#include "daemon/startup.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

TEST(CustomFeedbackDirectories, FailuresAreLoggedAndTheLoopGoesOn) {
  testing::TempHome home;
  const auto folder = home.cache() / "com.norvel.tavixd";
  std::filesystem::create_directories(folder);
  // CustomFeedback leads into procfs, where no folder can be made, not even by root.
  std::filesystem::create_directory_symlink("/proc/self", folder / "CustomFeedback");
  platform::LogCapture capture;
  createCustomFeedbackDirectories(platform::Paths{home.cache(), home.config(), home.runtime()});
  EXPECT_EQ(capture.count("failed creating a CustomFeedback subdir:"), 6u);
  EXPECT_EQ(capture.count("failed creating CustomFeedback dir:"), 0u);

  // A caches folder that is a file.
  std::ofstream(home.root() / "notadir") << "x";
  createCustomFeedbackDirectories(platform::Paths{home.root() / "notadir", home.config(), home.runtime()});
  EXPECT_EQ(capture.count("failed getting a caches dir:"), 1u);
}

// Good flags, and a bad log level, are checked on the daemon's command line.
TEST(DaemonOptions, RejectsBadFlagsWithAReason) {
  std::string error;
  EXPECT_FALSE(parseDaemonOptions({"--exit-when-idle", "soon"}, &error));
  EXPECT_NE(error.find("soon"), std::string::npos);
  EXPECT_FALSE(parseDaemonOptions({"--socket"}, &error));
  EXPECT_FALSE(parseDaemonOptions({"--frobnicate"}, &error));
  EXPECT_NE(error.find("--frobnicate"), std::string::npos);
}

}  // namespace
}  // namespace tavix
