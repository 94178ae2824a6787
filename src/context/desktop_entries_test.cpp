#include "context/desktop_entries.h"

#include <gtest/gtest.h>

#include <atomic>
#include <fstream>

#include "support/temp_home.h"

namespace tavix {
namespace {

namespace fs = platform::fs;

struct TempDir {
  fs::path path;
  TempDir() {
    std::string pattern = (fs::temp_directory_path() / "tavix-desktop-XXXXXX").string();
    path = ::mkdtemp(pattern.data());
  }
  ~TempDir() {
    std::error_code ignored;
    fs::remove_all(path, ignored);
  }
};

void write(const fs::path& path, const std::string& text) {
  fs::create_directories(path.parent_path());
  std::ofstream(path) << text;
}

std::string app(const std::string& extra = "") { return "[Desktop Entry]\nType=Application\nName=X\n" + extra; }

TEST(DesktopEntries, FirstFolderDecidesAndHiddenMasks) {
  TempDir dir;
  const fs::path home = dir.path / "home/applications", system = dir.path / "usr/applications";
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

  const auto folders = applicationFolders(dir.path / "home", (dir.path / "usr").string() + ":relative/dir");
  ASSERT_EQ(folders, (std::vector<fs::path>{home, system}));
  const auto apps = installedApps(folders);
  std::vector<std::string> found;
  for (const auto& a : apps) found.push_back(a.bundleIdentifier + "@" + a.bundleVersion);
  EXPECT_EQ(found, (std::vector<std::string>{"kde4-kate@1", "org.example.Maps@2.1", "org.example.Quiet@1"}));
}

// The debounce itself is seen through the whitelist controller; here, the user's folder that did
// not exist at start: its creation, then an install in it, are both seen.
TEST(DesktopEntries, WatcherNoticesAFolderCreatedLater) {
  TempDir dir;
  const fs::path home = dir.path / "home";
  fs::create_directories(home);
  fs::create_directories(dir.path / "usr/applications");
  platform::DispatchPool pool(2);
  platform::VirtualClock clock;
  const auto folders = applicationFolders(home, (dir.path / "usr").string());
  std::atomic<int> changes{0};
  DesktopEntryWatcher watcher(pool, clock, folders, [&] { ++changes; });
  // An inotify event arrives on its own time; the debounce timer it arms is the sign it came.
  auto settle = [&] {
    ASSERT_TRUE(testing::waitFor([&] { return clock.pendingTimers() == 1; }));
    clock.advance(platform::seconds(60));
  };
  fs::create_directory(home / "applications");
  settle();
  EXPECT_EQ(changes, 1);
  // Moved in whole, so the install is exactly one inotify event.
  write(dir.path / "c.desktop", app());
  fs::rename(dir.path / "c.desktop", home / "applications/c.desktop");
  settle();
  EXPECT_EQ(changes, 2);
  EXPECT_EQ(installedApps(folders).size(), 1u);
}

}  // namespace
}  // namespace tavix
