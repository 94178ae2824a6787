// AppWhitelistController: keeps the installed-app signature ("X-Norvel-Whitelisted-App-Signature")
// current. It regenerates the signature when a new whitelist resource arrives and once a burst of
// app installs and removals has settled, and keeps the last one in the default
// "TVXAppWhitelistSignature" so that requests carry it from the start.
//
// Generation runs on the background queue "com.norvel.tavixd.AppWhitelist", inside the keep-alive
// transaction "appWhitelist"; requests made before a queued generation starts are folded into it
// (it reads the newest files). whitelistSignature() never waits for it.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "context/app_signature.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/notification_center.h"

namespace tavix {

namespace platform {
class TransactionTracker;
class UserDefaults;
}  // namespace platform

class DesktopEntryWatcher;

inline constexpr const char* kTVXAppWhitelistSignatureKey = "TVXAppWhitelistSignature";

class AppWhitelistController : public std::enable_shared_from_this<AppWhitelistController> {
 public:
  // The pool, clock and transaction tracker must outlive the controller.
  struct Environment {
    platform::DispatchPool* pool = nullptr;
    platform::Clock* clock = nullptr;
    platform::TransactionTracker* transactions = nullptr;
    std::shared_ptr<platform::NotificationCenter> center;  // download-completed notifications
    std::shared_ptr<platform::UserDefaults> defaults;      // keeps the last signature
    platform::fs::path cachesFolder;                        // where the whitelist resource is kept
    std::vector<platform::fs::path> applicationFolders;     // the XDG "applications" folders
    platform::Duration debounce = platform::seconds(60);    // quiet time after app changes
  };

  // Reads the stored signature, starts watching the application folders and the downloads, and
  // generates at once (in the background) when no signature is stored yet.
  static std::shared_ptr<AppWhitelistController> create(Environment env);
  ~AppWhitelistController();
  AppWhitelistController(const AppWhitelistController&) = delete;
  AppWhitelistController& operator=(const AppWhitelistController&) = delete;

  // The current signature; empty when there is none. Safe from any thread; never blocks on
  // generation.
  std::optional<std::string> whitelistSignature() const;

  // Generates in the background (no-op while a generation runs). Safe from any thread.
  void generateWhitelistSignature();

  // Waits until the background work queued so far has run. Not from the background queue.
  void drainQueue();

 private:
  explicit AppWhitelistController(Environment env);
  void start();
  void generate();
  void setWhitelistSignature(std::optional<std::string> signature);

  Environment env_;
  platform::SerialQueue backgroundQueue_;
  std::atomic<bool> generating_{false};
  mutable std::mutex lock_;
  std::optional<std::string> whitelistSignature_;  // guarded by lock_
  std::unique_ptr<DesktopEntryWatcher> watcher_;
  platform::NotificationCenter::Registration downloaded_;
};

}  // namespace tavix
