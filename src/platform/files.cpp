#include "platform/files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string>

namespace tavix::platform {

namespace {
std::error_code lastError() { return {errno, std::generic_category()}; }

fs::path envPath(const char* name) {
  const char* value = std::getenv(name);
  // The XDG rules ignore relative paths.
  if (value && value[0] == '/') return fs::path(value);
  return {};
}

fs::path home() {
  if (auto h = envPath("HOME"); !h.empty()) return h;
  return fs::path("/tmp");
}
}  // namespace

Paths Paths::fromEnvironment() {
  Paths p;
  p.cacheHome = envPath("XDG_CACHE_HOME");
  if (p.cacheHome.empty()) p.cacheHome = home() / ".cache";
  p.configHome = envPath("XDG_CONFIG_HOME");
  if (p.configHome.empty()) p.configHome = home() / ".config";
  p.runtimeDir = envPath("XDG_RUNTIME_DIR");
  if (p.runtimeDir.empty()) p.runtimeDir = fs::path("/tmp") / ("tavix-runtime-" + std::to_string(getuid()));
  return p;
}

std::error_code createDirectory(const fs::path& path, bool intermediates, unsigned mode) {
  if (!intermediates) {
    if (::mkdir(path.c_str(), mode) != 0) return lastError();
    return {};
  }
  std::error_code ec;
  fs::path partial;
  for (const auto& part : path) {
    partial /= part;
    if (partial == partial.root_path()) continue;
    if (::mkdir(partial.c_str(), mode) == 0) continue;
    if (errno != EEXIST) return lastError();
    if (!fs::is_directory(partial, ec)) return std::make_error_code(std::errc::not_a_directory);
  }
  return {};
}

std::error_code writeFileAtomically(const fs::path& path, std::string_view bytes, unsigned mode) {
  std::string tmpl = (path.parent_path() / ("." + path.filename().string() + ".XXXXXX")).string();
  int fd = ::mkstemp(tmpl.data());
  if (fd < 0) return lastError();
  auto fail = [&](std::error_code ec) {
    ::close(fd);
    ::unlink(tmpl.c_str());
    return ec;
  };
  if (::fchmod(fd, mode) != 0) return fail(lastError());
  const char* data = bytes.data();
  std::size_t left = bytes.size();
  while (left > 0) {
    ssize_t n = ::write(fd, data, left);
    if (n < 0) {
      if (errno == EINTR) continue;
      return fail(lastError());
    }
    data += n;
    left -= static_cast<std::size_t>(n);
  }
  if (::fsync(fd) != 0) return fail(lastError());
  if (::close(fd) != 0) {
    ::unlink(tmpl.c_str());
    return lastError();
  }
  if (::rename(tmpl.c_str(), path.c_str()) != 0) {
    auto ec = lastError();
    ::unlink(tmpl.c_str());
    return ec;
  }
  // Make the rename itself durable.
  int dir = ::open(path.parent_path().empty() ? "." : path.parent_path().c_str(), O_RDONLY | O_DIRECTORY);
  if (dir >= 0) {
    ::fsync(dir);
    ::close(dir);
  }
  return {};
}

std::error_code readFile(const fs::path& path, std::string* out) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return lastError();
  out->clear();
  char buffer[65536];
  for (;;) {
    ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n == 0) break;
    if (n < 0) {
      if (errno == EINTR) continue;
      auto ec = lastError();
      ::close(fd);
      return ec;
    }
    out->append(buffer, static_cast<std::size_t>(n));
  }
  ::close(fd);
  return {};
}

}  // namespace tavix::platform
