#include "context/desktop_entries.h"

#include <gtest/gtest.h>

#include <condition_variable>
#include <cstdio>
#include <fstream>

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

// Forwards to a virtual clock and lets the test wait until a timer has been armed: the only
// sign that an inotify event, which arrives on its own time, has reached the watcher.
class ArmCountingClock final : public platform::Clock {
 public:
  platform::TimePoint now() const override { return clock.now(); }
  platform::TimerHandle after(platform::Duration delay, platform::SerialQueue& queue, platform::Task task) override {
    auto handle = clock.after(delay, queue, std::move(task));
    std::lock_guard<std::mutex> guard(lock);
    ++armed;
    cv.notify_all();
    return handle;
  }
  bool waitFor(std::unique_lock<std::mutex>& held, std::condition_variable& signal, platform::Duration timeout,
               const std::function<bool()>& ready) override {
    return clock.waitFor(held, signal, timeout, ready);
  }
  bool waitArmed(int count) {
    std::unique_lock<std::mutex> guard(lock);
    return cv.wait_for(guard, std::chrono::seconds(10), [&] { return armed >= count; });
  }
  platform::VirtualClock clock;
  std::mutex lock;
  std::condition_variable cv;
  int armed = 0;
};

TEST(DesktopEntries, WatcherDebouncesBurstsAndNoticesNewFolders) {
  TempDir dir;
  const fs::path staging = dir.path / "staging", home = dir.path / "home", system = dir.path / "usr/applications";
  fs::create_directories(staging);
  fs::create_directories(home);
  fs::create_directories(system);
  // Moved in whole, so each install is exactly one inotify event.
  auto install = [&](const fs::path& folder, const std::string& name) {
    write(staging / name, app());
    ASSERT_EQ(std::rename((staging / name).c_str(), (folder / name).c_str()), 0);
  };
  platform::DispatchPool pool(2);
  ArmCountingClock clock;
  const auto folders = applicationFolders(home, (dir.path / "usr").string());
  std::atomic<int> changes{0};
  std::vector<InstalledApp> seen;
  DesktopEntryWatcher watcher(pool, clock, folders, [&] {
    ++changes;
    seen = installedApps(folders);
  });

  install(system, "a.desktop");
  ASSERT_TRUE(clock.waitArmed(1));
  clock.clock.advance(platform::seconds(30));
  install(system, "b.desktop");
  ASSERT_TRUE(clock.waitArmed(2));
  clock.clock.advance(platform::seconds(59));
  EXPECT_EQ(changes, 0);  // the second install pushed the first deadline back
  clock.clock.advance(platform::seconds(1));
  EXPECT_EQ(changes, 1);
  EXPECT_EQ(seen.size(), 2u);

  // The user's folder did not exist: its creation, then an install in it, are both seen.
  fs::create_directory(home / "applications");
  ASSERT_TRUE(clock.waitArmed(3));
  clock.clock.advance(platform::seconds(60));
  EXPECT_EQ(changes, 2);
  install(home / "applications", "c.desktop");
  ASSERT_TRUE(clock.waitArmed(4));
  clock.clock.advance(platform::seconds(60));
  EXPECT_EQ(changes, 3);
  EXPECT_EQ(seen.size(), 3u);
  EXPECT_EQ(clock.clock.pendingTimers(), 0u);
}

}  // namespace
}  // namespace tavix
