#include "context/desktop_entries.h"

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <set>

#include "core/logging.h"
#include "platform/file_watcher.h"

namespace tavix {

namespace fs = platform::fs;

namespace {

constexpr std::size_t kMaxDesktopFileSize = 1024 * 1024;
constexpr std::string_view kSuffix = ".desktop";

std::string_view trim(std::string_view s) {
  while (!s.empty() && (s.front() == ' ' || s.front() == '\t')) s.remove_prefix(1);
  while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\r')) s.remove_suffix(1);
  return s;
}

std::optional<std::string> readBounded(const fs::path& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  // Read as it comes: entries are a few kilobytes, and a buffer the size of the limit would be
  // written through for each one, and kept by the allocator once the scan is over.
  std::string text;
  char chunk[8192];
  while (in.read(chunk, sizeof chunk) || in.gcount() > 0) {
    text.append(chunk, static_cast<std::size_t>(in.gcount()));
    if (text.size() > kMaxDesktopFileSize) return std::nullopt;
  }
  if (in.bad()) return std::nullopt;
  return text;
}

// "kde4/kate.desktop" under its applications folder → "kde4-kate".
std::string identifierFor(const fs::path& relative) {
  std::string id = relative.generic_string();
  id.resize(id.size() - kSuffix.size());
  std::replace(id.begin(), id.end(), '/', '-');
  return id;
}

}  // namespace

std::vector<fs::path> applicationFolders(const fs::path& dataHome, std::string_view dataDirs) {
  std::vector<fs::path> folders;
  if (dataHome.is_absolute()) folders.push_back(dataHome / "applications");
  while (!dataDirs.empty()) {
    const std::size_t colon = dataDirs.find(':');
    const fs::path dir(dataDirs.substr(0, colon));
    if (dir.is_absolute()) folders.push_back(dir / "applications");
    dataDirs = colon == std::string_view::npos ? std::string_view() : dataDirs.substr(colon + 1);
  }
  return folders;
}

std::vector<fs::path> applicationFoldersFromEnvironment() {
  const char* dataHome = std::getenv("XDG_DATA_HOME");
  const char* home = std::getenv("HOME");
  const char* dataDirs = std::getenv("XDG_DATA_DIRS");
  fs::path homeFolder = dataHome && *dataHome ? fs::path(dataHome)
                        : home && *home      ? fs::path(home) / ".local/share"
                                             : fs::path();
  return applicationFolders(homeFolder, dataDirs && *dataDirs ? dataDirs : "/usr/local/share:/usr/share");
}

std::optional<DesktopEntry> parseDesktopEntry(std::string_view text) {
  std::optional<DesktopEntry> entry;
  bool inGroup = false;
  while (!text.empty()) {
    const std::size_t newline = text.find('\n');
    const std::string_view line = trim(text.substr(0, newline));
    text = newline == std::string_view::npos ? std::string_view() : text.substr(newline + 1);
    if (line.empty() || line.front() == '#') continue;
    if (line.front() == '[') {
      if (inGroup) break;  // only the main group matters
      inGroup = line == "[Desktop Entry]";
      if (inGroup) entry.emplace();
      continue;
    }
    if (!inGroup) continue;
    const std::size_t equals = line.find('=');
    if (equals == std::string_view::npos) continue;
    const std::string_view key = trim(line.substr(0, equals));
    const std::string_view value = trim(line.substr(equals + 1));
    if (key == "Type") {
      entry->type = value;
    } else if (key == "Hidden") {
      entry->hidden = value == "true";
    } else if (key == "X-AppVersion") {
      entry->version = value;
    }
  }
  return entry;
}

std::vector<InstalledApp> installedApps(const std::vector<fs::path>& folders) {
  std::set<std::string> seen;
  std::vector<InstalledApp> apps;
  for (const fs::path& folder : folders) {
    std::error_code error;
    fs::recursive_directory_iterator it(folder, fs::directory_options::skip_permission_denied, error), end;
    for (; !error && it != end; it.increment(error)) {
      const fs::path& path = it->path();
      std::error_code entryError;  // a dangling link must not end the walk
      if (path.extension() != kSuffix || !it->is_regular_file(entryError)) continue;
      std::string id = identifierFor(path.lexically_relative(folder));
      if (id.empty() || !seen.insert(id).second) continue;  // a folder earlier in the list decided
      auto text = readBounded(path);
      auto entry = text ? parseDesktopEntry(*text) : std::nullopt;
      if (!entry || entry->hidden || entry->type != "Application") continue;
      apps.push_back({std::move(id), entry->version.empty() ? "1" : entry->version});
    }
  }
  std::sort(apps.begin(), apps.end(),
            [](const InstalledApp& a, const InstalledApp& b) { return a.bundleIdentifier < b.bundleIdentifier; });
  return apps;
}

DesktopEntryWatcher::DesktopEntryWatcher(platform::DispatchPool& pool, platform::Clock& clock,
                                         std::vector<fs::path> folders, std::function<void()> onChange,
                                         platform::Duration debounce)
    : pool_(pool),
      clock_(clock),
      folders_(std::move(folders)),
      onChange_(std::move(onChange)),
      debounce_(debounce),
      queue_(pool, "com.norvel.tavixd.DesktopEntryWatcher") {
  queue_.sync([this] { rewatch(); });
}

DesktopEntryWatcher::~DesktopEntryWatcher() {
  queue_.sync([this] {
    stopped_ = true;
    timer_.cancel();
    watchers_.clear();
  });
}

void DesktopEntryWatcher::rewatch() {
  queue_.assertCurrent("DesktopEntryWatcher::rewatch");
  watchers_.clear();
  auto watch = [this](const fs::path& folder, std::function<void(const std::string&)> callback) {
    std::error_code error;
    auto watcher = std::make_unique<platform::FileWatcher>(pool_, queue_, folder, std::move(callback), &error);
    if (error) {
      TavixLogForCategory(TavixLoggingCategoryDefault)
          .error("cannot watch application folder {}: {}", folder.string(), error.message());
      return;
    }
    watchers_.push_back(std::move(watcher));
  };
  for (const fs::path& folder : folders_) {
    std::error_code error;
    if (fs::is_directory(folder, error)) {
      watch(folder, [this](const std::string&) { changed(); });
      fs::recursive_directory_iterator it(folder, fs::directory_options::skip_permission_denied, error), end;
      for (; !error && it != end; it.increment(error)) {
        std::error_code entryError;
        if (it->is_directory(entryError) && !it->is_symlink(entryError)) {
          watch(it->path(), [this](const std::string&) { changed(); });
        }
      }
    } else if (fs::is_directory(folder.parent_path(), error)) {
      const std::string name = folder.filename().string();
      watch(folder.parent_path(), [this, name](const std::string& entry) {
        if (entry == name) changed();
      });
    }
  }
}

void DesktopEntryWatcher::changed() {
  queue_.assertCurrent("DesktopEntryWatcher::changed");
  if (stopped_) return;
  timer_.cancel();
  timer_ = clock_.after(debounce_, queue_, [this] {
    if (stopped_) return;
    rewatch();  // folders may have come or gone
    onChange_();
  });
}

}  // namespace tavix
