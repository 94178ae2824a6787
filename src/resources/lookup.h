// Look-up: keeps the hints store fed with the two downloaded hints files (weekly and monthly),
// says whether look-up is enabled, and gives the download manager the version of a hints file.
//
// The hints go to a LookupHintsStore (hints_store.h), Linux's stand-in for a text scanner.
//
// Lookup owns the serial queue "com.norvel.tavix.Lookup"; the hints handling runs there, each piece
// inside a keep-alive transaction. Logs under "Tavix_LookUp".
#pragma once

#include <map>
#include <memory>
#include <string>
#include <string_view>

#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/notification_center.h"
#include "resources/hints_store.h"

namespace tavix {

namespace platform {
class TransactionTracker;
class UserDefaults;
}  // namespace platform

class ResourceVersionsProvider;

// The defaults suite shared with the look-up panel, and its switch.
inline constexpr const char* kLookupSharedSuite = "com.norvel.lookup.shared";
inline constexpr const char* kLookupSuggestionsDisabledKey = "LookupSuggestionsDisabled";

// True unless the look-up panel's suite (in the folder of `defaults`) disables suggestions, read
// from disk on every call: the panel's settings switch it while we run. Safe from any thread.
bool lookupEnabled(const platform::UserDefaults& defaults);

class Lookup : public std::enable_shared_from_this<Lookup> {
 public:
  // Everything must outlive the Lookup except what is shared. `resourceVersions` may be null (no
  // download manager): every version is then unknown.
  struct Environment {
    platform::DispatchPool* pool = nullptr;
    platform::TransactionTracker* transactions = nullptr;
    std::shared_ptr<platform::NotificationCenter> center;
    std::shared_ptr<const platform::UserDefaults> defaults;  // its folder also holds the shared suite
    std::shared_ptr<const ResourceVersionsProvider> resourceVersions;
    std::shared_ptr<LookupHintsStore> store;
    platform::fs::path cachesFolder;  // where the download manager puts resource files
  };

  // Observes "TVXFileDownloadCompletedNotification" and "TVXFileDeletedNotification" (for the two
  // hints resources) and "TVXStartup" (to push again any hints whose stored signature is stale).
  static std::shared_ptr<Lookup> create(Environment env);
  ~Lookup();
  Lookup(const Lookup&) = delete;
  Lookup& operator=(const Lookup&) = delete;

  // lookupEnabled() of the daemon's defaults.
  bool lookupEnabled() const;

  // The version of a hints file served from `url` (see signatureFromURL in lookup_hints.h).
  static std::string signatureFromURL(std::string_view url);

  // Waits until the work queued so far on the queue has run. Not from the queue.
  void drainQueue();

 private:
  explicit Lookup(Environment env);
  void start();
  void handleHintsFile(const platform::Notification& notification);
  void handleHintsFile(const std::string& identifier, const std::string& location, int sourceKind);
  bool pushHintsSourceFile(int fd, int sourceKind, const std::string& signature);
  void reprocessHintsFiles();
  void reprocessHintsFile(int sourceKind, const std::map<std::string, std::string>& versions);
  std::map<std::string, std::string> versions() const;

  Environment env_;
  platform::SerialQueue queue_;
  platform::NotificationCenter::Registration downloaded_;
  platform::NotificationCenter::Registration deleted_;
  platform::NotificationCenter::Registration startup_;
};

}  // namespace tavix
