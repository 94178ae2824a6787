// Watches one folder with inotify and reports the names of entries that were written, created,
// renamed into or out of it, or removed. Events are delivered on the given queue.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <system_error>

#include "platform/dispatch.h"
#include "platform/files.h"

namespace tavix::platform {

class FileWatcher {
 public:
  using Callback = std::function<void(const std::string& name)>;

  // Starts watching at once. `error` (if given) receives the reason when the watch could not be
  // set up; the watcher then reports nothing. `queue` must outlive the watcher.
  FileWatcher(DispatchPool& pool, SerialQueue& queue, const fs::path& folder, Callback callback,
              std::error_code* error = nullptr);
  // Stops watching; no callback starts after the destructor returns.
  ~FileWatcher();
  FileWatcher(const FileWatcher&) = delete;
  FileWatcher& operator=(const FileWatcher&) = delete;

 private:
  struct Impl;
  std::shared_ptr<Impl> impl_;
};

}  // namespace tavix::platform
