// Installed applications on Linux: the XDG desktop entries of type "Application" in the
// "applications" folders of the XDG data dirs, and a watcher that says, once a burst of changes
// has settled, that the set may have changed.
//
// An app's bundle identifier is its desktop-file ID without the ".desktop" suffix ("org.gnome.Maps"
// for applications/org.gnome.Maps.desktop, "kde4-kate" for applications/kde4/kate.desktop): the
// reverse-DNS application ID the whitelist names apps by. Its version is "X-AppVersion", else "1".
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "context/app_signature.h"
#include "platform/clock.h"
#include "platform/files.h"

namespace tavix {

namespace platform {
class FileWatcher;
}

// The "applications" folders in precedence order: `dataHome` first, then each of `dataDirs` (a
// colon-separated list). Relative entries are ignored, as the XDG rules say.
std::vector<platform::fs::path> applicationFolders(const platform::fs::path& dataHome, std::string_view dataDirs);
// The same from $XDG_DATA_HOME (else ~/.local/share) and $XDG_DATA_DIRS (else
// /usr/local/share:/usr/share).
std::vector<platform::fs::path> applicationFoldersFromEnvironment();

// What the "[Desktop Entry]" group of a desktop file says about installation.
struct DesktopEntry {
  std::string type;     // "Type"
  bool hidden = false;  // "Hidden=true": the entry counts as deleted
  std::string version;  // "X-AppVersion", empty when absent
};
// Empty when the text has no "[Desktop Entry]" group.
std::optional<DesktopEntry> parseDesktopEntry(std::string_view text);

// The installed applications, sorted by identifier. For an ID present in several folders the first
// folder's entry wins, even when it is hidden or not an application: that is how a user masks a
// system entry. Hidden entries are not installed; "NoDisplay" entries are (they are only kept out
// of menus). Unreadable files, files over 1 MiB and unparsable entries are skipped.
std::vector<InstalledApp> installedApps(const std::vector<platform::fs::path>& folders);

// Watches the application folders (and their subfolders) with inotify; a folder that does not
// exist yet is noticed when it appears in its parent. Every change re-arms a one-shot timer on
// `clock`; when it fires, `onChange` runs, so a burst of installs gives one call.
//
// Owns the serial queue "com.norvel.tavixd.DesktopEntryWatcher"; `onChange` runs on it. The pool
// and the clock must outlive the watcher. No call starts after the destructor returns.
class DesktopEntryWatcher {
 public:
  DesktopEntryWatcher(platform::DispatchPool& pool, platform::Clock& clock, std::vector<platform::fs::path> folders,
                      std::function<void()> onChange, platform::Duration debounce = platform::seconds(60));
  ~DesktopEntryWatcher();
  DesktopEntryWatcher(const DesktopEntryWatcher&) = delete;
  DesktopEntryWatcher& operator=(const DesktopEntryWatcher&) = delete;

 private:
  void rewatch();
  void changed();

  platform::DispatchPool& pool_;
  platform::Clock& clock_;
  const std::vector<platform::fs::path> folders_;
  const std::function<void()> onChange_;
  const platform::Duration debounce_;
  platform::SerialQueue queue_;
  // On queue_:
  std::vector<std::unique_ptr<platform::FileWatcher>> watchers_;
  platform::TimerHandle timer_;
  bool stopped_ = false;
};

}  // namespace tavix
