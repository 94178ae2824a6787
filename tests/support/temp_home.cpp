#include "support/temp_home.h"

#include <stdlib.h>

#include <chrono>
#include <fstream>
#include <stdexcept>
#include <thread>

namespace tavix::testing {

TempHome::TempHome() {
  std::string tmpl = (std::filesystem::temp_directory_path() / "tavix-test-XXXXXX").string();
  if (!mkdtemp(tmpl.data())) throw std::runtime_error("mkdtemp failed");
  root_ = tmpl;
  for (const auto& p : {cache(), config(), runtime()}) std::filesystem::create_directories(p);
}

TempHome::~TempHome() {
  std::error_code ec;
  std::filesystem::remove_all(root_, ec);
}

void TempHome::exportEnvironment() const {
  setenv("XDG_CACHE_HOME", cache().c_str(), 1);
  setenv("XDG_CONFIG_HOME", config().c_str(), 1);
  setenv("XDG_RUNTIME_DIR", runtime().c_str(), 1);
  setenv("HOME", root_.c_str(), 1);
}

bool waitFor(const std::function<bool()>& condition, int timeoutMs) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  while (std::chrono::steady_clock::now() < deadline) {
    if (condition()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return condition();
}

std::string readFile(const std::filesystem::path& file) {
  std::ifstream in(file, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

std::size_t occurrences(const std::string& text, const std::string& what) {
  std::size_t n = 0;
  for (auto at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

}  // namespace tavix::testing
