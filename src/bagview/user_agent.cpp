#include "bagview/user_agent.h"

#include <fmt/core.h>

#include <array>

#include "platform/defaults.h"
#include "platform/files.h"
#include "platform/strings.h"

namespace tavix {

namespace {

std::string trim(std::string_view s) { return std::string(platform::trimmedWhitespace(s)); }

// One field of an os-release file; quotes around the value are dropped.
std::string osReleaseField(const std::string& text, std::string_view field) {
  std::size_t pos = 0;
  while (pos < text.size()) {
    std::size_t end = text.find('\n', pos);
    if (end == std::string::npos) end = text.size();
    std::string_view line(text.data() + pos, end - pos);
    if (line.size() > field.size() && line.substr(0, field.size()) == field && line[field.size()] == '=') {
      std::string value(line.substr(field.size() + 1));
      value = trim(value);
      if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front()) {
        value = value.substr(1, value.size() - 2);
      }
      return value;
    }
    pos = end + 1;
  }
  return {};
}

constexpr std::array<const char*, 9> kClientNames = {
    "brovane", "seekara", "vocly", "lookup", "messages", "news", "suggestions", "flightinfo", "tavixd"};

}  // namespace

DeviceInformation::DeviceInformation(const platform::UserDefaults* defaults, std::filesystem::path root)
    : defaults_(defaults), root_(std::move(root)) {}

std::string DeviceInformation::answer(std::string_view key) const {
  if (key == "OSVersion") {
    std::call_once(versionOnce_, [this] { osVersion_ = read("OSVersion"); });
    return osVersion_;
  }
  if (key == "Model" || key == "OSName" || key == "OSBuild") return read(key);
  return {};
}

std::string DeviceInformation::read(std::string_view key) const {
  if (defaults_) {
    auto override = defaults_->stringForKey(fmt::format("TVXDevice{}", key));
    if (override && !override->empty()) return *override;
  }
  std::string text;
  if (key == "Model") {
    if (!platform::readFile(root_ / "sys/class/dmi/id/product_name", &text)) {
      text = trim(text);
      if (!text.empty()) return text;
    }
    return "Linux";
  }
  if (key == "OSBuild") {
    if (!platform::readFile(root_ / "proc/sys/kernel/osrelease", &text)) {
      text = trim(text);
      if (!text.empty()) return text;
    }
    return "0";
  }
  // OSName and OSVersion come from os-release, with its documented fallback file.
  if (platform::readFile(root_ / "etc/os-release", &text)) {
    text.clear();
    platform::readFile(root_ / "usr/lib/os-release", &text);
  }
  std::string value = osReleaseField(text, key == "OSName" ? "NAME" : "VERSION_ID");
  if (!value.empty()) return value;
  return key == "OSName" ? "Linux" : "0";
}

std::optional<std::string> createUserAgentString(std::optional<std::string_view> clientAgent,
                                                 const DeviceInformation& device) {
  if (clientAgent && clientAgent->empty()) return std::nullopt;
  std::string devicePart = fmt::format("{}; {} {} {}", device.answer("Model"), device.answer("OSName"),
                                       device.answer("OSVersion"), device.answer("OSBuild"));
  return fmt::format("{} ({}) {}", kTVXTavixdNameVersion, devicePart,
                     clientAgent ? *clientAgent : std::string_view(kTVXTavixdNameVersion));
}

std::optional<std::string> extractClientNameFromString(std::string_view userAgent) {
  std::string lower = platform::asciiLowercased(userAgent);
  for (const char* name : kClientNames) {
    if (lower.find(name) != std::string::npos) return std::string(name);
  }
  return std::nullopt;
}

std::string getClientFromUserAgent(std::optional<std::string_view> userAgent) {
  if (!userAgent) return "unknown";
  std::string lower = platform::asciiLowercased(*userAgent);
  if (lower.find("brovane") != std::string::npos) return "brovane";
  if (lower.find("seekara") != std::string::npos) return "seekara";
  return "unknown";
}

TVXClientType clientTypeFromString(std::string_view name) {
  if (name == "brovane") return TVXClientTypeBrovane;
  if (name == "seekara") return TVXClientTypeSeekara;
  return TVXClientTypeUnknown;
}

std::string stringFromClientType(int type) {
  if (type == TVXClientTypeSeekara) return "seekara";
  if (type == TVXClientTypeBrovane) return "brovane";
  return "unknown";
}

const std::string& tavixdUserAgent() {
  static const std::string agent =
      createUserAgentString(std::nullopt, DeviceInformation(nullptr)).value_or(kTVXTavixdNameVersion);
  return agent;
}

}  // namespace tavix
