// Named scalar counters, the daemon's aggregate diagnostics. Kept in memory; saved as a property
// list so that the tool can read them while the daemon is stopped.
//
// Threading: every method is safe from any thread.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <map>
#include <mutex>
#include <string>
#include <system_error>

#include "platform/files.h"

namespace tavix::platform {

class CounterStore {
 public:
  void setValue(std::int64_t value, const std::string& key);
  void addValue(std::int64_t delta, const std::string& key);
  void clear(const std::string& key);
  // 0 for a key never set.
  std::int64_t value(const std::string& key) const;
  std::map<std::string, std::int64_t> snapshot() const;

  // True when something changed since the last save or load.
  bool dirty() const;
  // Called, on the thread that made the change, each time a clean store becomes dirty; so a
  // save can be scheduled when there is something to save. Null removes it.
  void setDirtyHandler(std::function<void()> handler);
  // Replaces the counters with the file's; a missing file is an empty store. A corrupt file is
  // an error and leaves the store as it was.
  std::error_code load(const fs::path& file);
  std::error_code save(const fs::path& file);

  // Reads a saved file without a store, for the tool.
  static std::error_code read(const fs::path& file, std::map<std::string, std::int64_t>* out);

 private:
  // With `lock_` held; answers the handler to call once it is released.
  std::shared_ptr<std::function<void()>> markDirty();
  static void notify(const std::shared_ptr<std::function<void()>>& handler);

  mutable std::mutex lock_;
  std::map<std::string, std::int64_t> values_;
  bool dirty_ = false;
  std::shared_ptr<std::function<void()>> dirtyHandler_;
};

}  // namespace tavix::platform
