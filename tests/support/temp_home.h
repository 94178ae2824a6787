// A temporary home for one test: XDG folders inside a fresh directory, removed afterwards.
#pragma once

#include <filesystem>
#include <functional>
#include <string>

namespace tavix::testing {

class TempHome {
 public:
  TempHome();
  ~TempHome();
  TempHome(const TempHome&) = delete;
  TempHome& operator=(const TempHome&) = delete;

  const std::filesystem::path& root() const { return root_; }
  std::filesystem::path cache() const { return root_ / "cache"; }
  std::filesystem::path config() const { return root_ / "config"; }
  std::filesystem::path runtime() const { return root_ / "runtime"; }

  // Points XDG_CACHE_HOME, XDG_CONFIG_HOME, XDG_RUNTIME_DIR and HOME of this process here.
  void exportEnvironment() const;

 private:
  std::filesystem::path root_;
};

// Polls `condition` every millisecond for up to `timeoutMs`; true once it holds. For tests that
// wait on real threads (inotify, child processes); virtual-time tests never need it.
bool waitFor(const std::function<bool()>& condition, int timeoutMs = 5000);

// The whole content of `file`; empty when it cannot be read.
std::string readFile(const std::filesystem::path& file);

// How often `what` occurs in `text` (log lines, for tests that wait on the n-th one).
std::size_t occurrences(const std::string& text, const std::string& what);

}  // namespace tavix::testing
