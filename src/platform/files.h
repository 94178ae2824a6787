// File-system helpers: the XDG homes and the few file operations that must be done carefully.
//
// Errors are returned as std::error_code (errno values in the generic category); nothing throws.
#pragma once

#include <filesystem>
#include <string>
#include <string_view>
#include <system_error>

namespace tavix::platform {

namespace fs = std::filesystem;

// The per-user homes of an application, from the XDG variables (with the XDG fallbacks under
// $HOME). Pure values: nothing is created until asked.
struct Paths {
  fs::path cacheHome;    // $XDG_CACHE_HOME or ~/.cache: the user's "caches directory"
  fs::path configHome;   // $XDG_CONFIG_HOME or ~/.config
  fs::path runtimeDir;   // $XDG_RUNTIME_DIR, or a per-uid folder under /tmp when unset

  static Paths fromEnvironment();

  fs::path cachesFolder(std::string_view app) const { return cacheHome / app; }
  fs::path configFolder(std::string_view app) const { return configHome / app; }
  fs::path runtimeFolder(std::string_view app) const { return runtimeDir / app; }
};

// Creates `path` with `mode` (subject to the umask like mkdir(2)). With `intermediates`, missing
// parents are created too and an existing directory is success; without, an existing entry is
// the error EEXIST, as mkdir(2) says.
std::error_code createDirectory(const fs::path& path, bool intermediates, unsigned mode = 0700);

// Writes `bytes` to `path` so that readers see the old file or the new one, never a mix: a
// temporary file in the same folder, fsync, chmod `mode`, rename, fsync of the folder.
std::error_code writeFileAtomically(const fs::path& path, std::string_view bytes, unsigned mode = 0600);

// Reads a whole file. ENOENT when it does not exist.
std::error_code readFile(const fs::path& path, std::string* out);

}  // namespace tavix::platform
