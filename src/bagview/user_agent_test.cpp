#include "bagview/user_agent.h"

#include <gtest/gtest.h>

#include "platform/defaults.h"
#include "platform/files.h"
#include "support/temp_home.h"

namespace tavix {
namespace {

// A fake system root with the files the device answers come from.
struct DeviceRoot {
  testing::TempHome home;
  std::filesystem::path root = home.root() / "sysroot";
  DeviceRoot() {
    write("etc/os-release", "PRETTY_NAME=\"Debian GNU/Linux 12 (bookworm)\"\nNAME=\"Debian GNU/Linux\"\nVERSION_ID=\"12\"\n");
    write("sys/class/dmi/id/product_name", "ThinkPad X1\n");
    write("proc/sys/kernel/osrelease", "6.1.0-18-amd64\n");
  }
  void write(const std::string& rel, const std::string& text) {
    platform::createDirectory((root / rel).parent_path(), true);
    ASSERT_FALSE(platform::writeFileAtomically(root / rel, text));
  }
};

TEST(UserAgent, BuildsFromSystemFilesWithDefaultsOverridingThemAndFallsBackWithoutThem) {
  DeviceRoot sys;
  platform::UserDefaults defaults(sys.home.config(), "com.norvel.tavixd");
  DeviceInformation device(&defaults, sys.root);

  EXPECT_EQ(createUserAgentString("Seekara/1", device),
            "tavixd/0.1 (ThinkPad X1; Debian GNU/Linux 12 6.1.0-18-amd64) Seekara/1");
  EXPECT_FALSE(createUserAgentString("", device));

  defaults.setObject("TVXDeviceModel", "Tablet7");
  defaults.setObject("TVXDeviceOSVersion", "99");  // too late: the version is read once
  sys.write("proc/sys/kernel/osrelease", "6.5.0\n");
  EXPECT_EQ(createUserAgentString("x", device), "tavixd/0.1 (Tablet7; Debian GNU/Linux 12 6.5.0) x");

  DeviceInformation fresh(&defaults, sys.root);
  EXPECT_EQ(fresh.answer("OSVersion"), "99");
  EXPECT_EQ(fresh.answer("Serial"), "");

  // Without the system files (nor defaults), plain fallbacks.
  EXPECT_EQ(createUserAgentString("c/1", DeviceInformation(nullptr, sys.root / "empty")),
            "tavixd/0.1 (Linux; Linux 0 0) c/1");
}

TEST(UserAgent, ClientNamesComeFromTheFirstKnownNameInTableOrder) {
  EXPECT_EQ(extractClientNameFromString("LookupMessages"), "lookup");  // table order, not position
  EXPECT_FALSE(extractClientNameFromString("curl/8.0"));
  EXPECT_EQ(getClientFromUserAgent("SEEKARA/1 brovane"), "brovane");
  EXPECT_EQ(getClientFromUserAgent("News/1"), "unknown");
}

}  // namespace
}  // namespace tavix
