// The user agent and the small client vocabulary: which client a request comes from, as a short
// name taken from its user agent. Free functions without state, except the device answers.
#pragma once

#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

namespace tavix {

namespace platform {
class UserDefaults;
}

// The daemon's name/version token: the client part of the daemon's own user agent.
inline constexpr const char* kTVXTavixdNameVersion = "tavixd/0.1";

// The device-information answers under the keys "Model", "OSName", "OSVersion"
// and "OSBuild". On Linux they come from:
//   Model     the DMI product name (/sys/class/dmi/id/product_name), else "Linux"
//   OSName    NAME of /etc/os-release, else "Linux"
//   OSVersion VERSION_ID of /etc/os-release, else "0"
//   OSBuild   the kernel release (/proc/sys/kernel/osrelease), else "0"
// Each is overridden by a non-empty string default "TVXDevice" + key ("TVXDeviceModel",
// "TVXDeviceOSName", "TVXDeviceOSVersion", "TVXDeviceOSBuild").
// "OSVersion" is read once and kept, the others on every call, so an edited default or a
// kernel update shows in the next request without a restart.
//
// Threading: safe from any thread.
class DeviceInformation {
 public:
  // `defaults` may be null (no overrides) and must outlive this object. `root` prefixes the
  // system files, so that tests can stand up their own /etc and /sys.
  explicit DeviceInformation(const platform::UserDefaults* defaults, std::filesystem::path root = "/");

  // The answer for one of the four keys; empty for any other key.
  std::string answer(std::string_view key) const;

 private:
  std::string read(std::string_view key) const;

  const platform::UserDefaults* defaults_;
  const std::filesystem::path root_;
  mutable std::once_flag versionOnce_;
  mutable std::string osVersion_;
};

// "<token> (<Model>; <OSName> <OSVersion> <OSBuild>) <clientAgent>".
// Empty when `clientAgent` is an empty string; a missing client agent (nullopt) repeats the token.
std::optional<std::string> createUserAgentString(std::optional<std::string_view> clientAgent,
                                                 const DeviceInformation& device);

// The daemon's own user agent (its token as the client part, no default overrides), made once.
// Session files carry it as their version and the daemon's own feedback is filed under it.
const std::string& tavixdUserAgent();

// The first known client name that the lower-cased string contains, tried in the order
// brovane, seekara, vocly, lookup, messages, news, suggestions, flightinfo, tavixd; else empty.
std::optional<std::string> extractClientNameFromString(std::string_view userAgent);

// "brovane" or "seekara" when the lower-cased agent contains it (in that order), else "unknown".
std::string getClientFromUserAgent(std::optional<std::string_view> userAgent);

enum TVXClientType : int {
  TVXClientTypeBrovane = 0,
  TVXClientTypeSeekara = 1,
  TVXClientTypeUnknown = 2,
};

// Exact, case-sensitive: "brovane" → 0, "seekara" → 1, anything else → 2.
TVXClientType clientTypeFromString(std::string_view name);
// 0 → "brovane", 1 → "seekara", anything else → "unknown".
std::string stringFromClientType(int type);

}  // namespace tavix
