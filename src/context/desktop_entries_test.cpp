#include "context/desktop_entries.h"

#include <gtest/gtest.h>

#include <fstream>

#include "support/temp_home.h"

namespace tavix {
namespace {

namespace fs = platform::fs;

void write(const fs::path& path, const std::string& text) {
  fs::create_directories(path.parent_path());
  std::ofstream(path) << text;
}

std::string app(const std::string& extra = "") { return "[Desktop Entry]\nType=Application\nName=X\n" + extra; }

TEST(DesktopEntries, FirstFolderDecidesAndHiddenMasks) {
  testing::TempHome dir;
  const fs::path home = dir.root() / "home/applications", system = dir.root() / "usr/applications";
  write(home / "org.example.Maps.desktop", app("X-AppVersion = 2.1\n"));
  write(system / "org.example.Maps.desktop", app("X-AppVersion=1.0\n"));
  write(home / "org.example.Gone.desktop", app("Hidden=true\n"));
  write(system / "org.example.Gone.desktop", app());
  write(system / "org.example.Quiet.desktop", app("NoDisplay=true\n"));
  write(system / "kde4/kate.desktop", app("[Desktop Action New]\nX-AppVersion=9\n"));
  write(system / "org.example.Link.desktop", "[Desktop Entry]\nType=Link\nURL=https://x\n");
  write(system / "org.example.Broken.desktop", "Type=Application\n");
  write(system / "notes.txt", app());
  write(system / "org.example.Huge.desktop", app(std::string(2 * 1024 * 1024, '#')));

  const auto folders = applicationFolders(dir.root() / "home", (dir.root() / "usr").string() + ":relative/dir");
  ASSERT_EQ(folders, (std::vector<fs::path>{home, system}));
  const auto apps = installedApps(folders);
  std::vector<std::string> found;
  for (const auto& a : apps) found.push_back(a.bundleIdentifier + "@" + a.bundleVersion);
  EXPECT_EQ(found, (std::vector<std::string>{"kde4-kate@1", "org.example.Maps@2.1", "org.example.Quiet@1"}));
}

}  // namespace
}  // namespace tavix
