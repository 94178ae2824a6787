#include "feedback/tavixd_user_agent.h"

#include <fmt/core.h>
#include <sys/utsname.h>

#include <fstream>
#include <map>

namespace tavix {

const char* const kTVXTavixdNameVersion = "tavixd/0.1.0";

namespace {

std::string firstLine(const char* path) {
  std::ifstream in(path);
  std::string line;
  std::getline(in, line);
  return line;
}

std::map<std::string, std::string> osRelease() {
  std::map<std::string, std::string> values;
  std::ifstream in("/etc/os-release");
  for (std::string line; std::getline(in, line);) {
    const auto eq = line.find('=');
    if (eq == std::string::npos) continue;
    std::string value = line.substr(eq + 1);
    if (value.size() >= 2 && value.front() == '"' && value.back() == '"') value = value.substr(1, value.size() - 2);
    values[line.substr(0, eq)] = value;
  }
  return values;
}

std::string buildUserAgent() {
  const std::string nameVersion = kTVXTavixdNameVersion;
  if (nameVersion.empty()) return {};
  std::string productType = firstLine("/sys/class/dmi/id/product_name");
  if (productType.empty()) productType = "Linux";
  auto release = osRelease();
  struct utsname uts {};
  std::string build = uname(&uts) == 0 ? uts.release : "";
  const std::string device =
      fmt::format("{}; {} {} {}", productType, release["NAME"], release["VERSION_ID"], build);
  return fmt::format("{} ({}) {}", nameVersion, device, nameVersion);
}

}  // namespace

const std::string& tavixdUserAgent() {
  static const std::string agent = buildUserAgent();
  return agent;
}

}  // namespace tavix
