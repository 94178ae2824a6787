// The defaults store: typed settings in a registration domain (in memory, registered at start)
// under a persistent domain (an XML property list, $XDG_CONFIG_HOME/<app>/<domain>.plist, 0600).
// A persistent value wins over a registered one.
//
// Every change is written through at once, read-modify-write against the file, so a value that
// another process (the tool, or a person with an editor) wrote is not lost. Changes made by hand
// are seen after synchronize(), or at once while watch() is on.
//
// Threading: every method is safe from any thread. Observers run on the thread that made the
// change, or on the watch queue for changes found on disk; never with a lock held.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/property_value.h"

namespace tavix::platform {

class FileWatcher;
class Logger;

class UserDefaults {
 public:
  // `folder` holds the domain files; it is created (0700) on the first write or watch.
  UserDefaults(fs::path folder, std::string domain, Logger* log = nullptr);
  ~UserDefaults();
  UserDefaults(const UserDefaults&) = delete;
  UserDefaults& operator=(const UserDefaults&) = delete;

  const std::string& domain() const { return domain_; }
  const fs::path& folder() const { return folder_; }
  fs::path filePath() const;

  // Adds to the registration domain; later registrations of a key replace earlier ones.
  void registerDefaults(const Dictionary& values);

  // The persistent value, else the registered one, else empty.
  std::optional<PropertyValue> objectForKey(std::string_view key) const;
  // Typed readings: false, 0, 0.0 or empty when the key is absent or does not convert.
  bool boolForKey(std::string_view key) const;
  std::int64_t integerForKey(std::string_view key) const;
  double doubleForKey(std::string_view key) const;
  std::optional<std::string> stringForKey(std::string_view key) const;
  std::optional<TimePoint> dateForKey(std::string_view key) const;

  // Writes the value (or removes the key) in the persistent domain and saves the file.
  // False when the file could not be written; the change then still holds in memory.
  bool setObject(const std::string& key, PropertyValue value);
  bool removeObject(const std::string& key);

  // Re-reads the file. Observers hear of every key whose value changed. False when the file
  // exists but is not a property list (the values in memory are kept).
  bool synchronize();

  // Watches the folder with inotify and synchronizes whenever the file changes on disk.
  void watch(DispatchPool& pool);

  // A copy of the persistent domain.
  Dictionary persistentDomain() const;

  // Another domain in the same folder, e.g. a suite shared with other programs.
  std::unique_ptr<UserDefaults> suite(std::string domain) const;

  using Observer = std::function<void(const std::string& key)>;
  // Removes its observer when destroyed. After that returns, the observer is not called again.
  class Subscription {
   public:
    Subscription() = default;
    Subscription(Subscription&&) noexcept = default;
    Subscription& operator=(Subscription&&) noexcept = default;
    ~Subscription();
    void reset();

   private:
    friend class UserDefaults;
    struct Entry;
    std::shared_ptr<Entry> entry_;
  };
  [[nodiscard]] Subscription addObserver(Observer observer);

 private:
  struct Loaded {
    bool ok;  // false: the file exists but could not be parsed
    Dictionary values;
  };
  Loaded load() const;
  bool update(const std::function<void(Dictionary&)>& change);
  bool save(const Dictionary& values);
  void notify(const std::vector<std::string>& keys);
  static std::vector<std::string> changedKeys(const Dictionary& before, const Dictionary& after);

  const fs::path folder_;
  const std::string domain_;
  Logger* log_;

  mutable std::shared_mutex lock_;  // guards registered_ and persistent_
  Dictionary registered_;
  Dictionary persistent_;
  std::mutex fileLock_;  // serialises read-modify-write of the file

  std::mutex observersLock_;
  std::vector<std::weak_ptr<Subscription::Entry>> observers_;

  std::unique_ptr<SerialQueue> watchQueue_;
  std::unique_ptr<FileWatcher> watcher_;
};

}  // namespace tavix::platform
