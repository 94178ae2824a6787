// The daemon's one container of long-lived service objects, filled by start-up. Persistent
// storage, the GUID controller, the query cache, the request factory, the upload manager, the
// client state manager and the flush command channel are handed what they use when they are
// made; the bag controller, feedback sessions and their manager, the flushers, client states,
// client connections and the service still find their peers through it.
//
// Fields are set during start-up on the main thread, in the order of start-up, before any client
// can connect, and only read afterwards: no locking. An object may use, in its constructor, only
// the fields set before it; anything later it fetches lazily.
#pragma once

#include <memory>

#include "platform/files.h"

namespace tavix {

namespace platform {
class ActivityScheduler;
class Clock;
class DispatchPool;
class NotificationCenter;
class TransactionTracker;
class UserDefaults;
namespace http {
class URLSession;
}
}  // namespace platform

class TVXNetworkRequestFactory;
class TavixBagController;
class UploadManager;
class ClientStateManager;
class TavixUserGUIDController;
class ClientSessionManager;
class TavixFlusherIPC;
class TavixPersistentStorage;
class EngagedCompletionCache;
class LocationManager;
class MotionManager;
class ResourceVersionsProvider;
class DownloadManager;

class Assembly {
 public:
  Assembly();
  ~Assembly();
  Assembly(const Assembly&) = delete;
  Assembly& operator=(const Assembly&) = delete;

  // The platform services every object may use. Not owned: they outlive the assembly. The pool and
  // the clock are always set; objects use them without checking.
  platform::DispatchPool* dispatchPool = nullptr;
  platform::Clock* clock = nullptr;
  platform::TransactionTracker* transactions = nullptr;
  platform::ActivityScheduler* activityScheduler = nullptr;
  platform::Paths paths;

  // Whether all clients share one feedback session; set at start from "TVXSharedSession".
  bool sharedSession = false;

  std::shared_ptr<platform::UserDefaults> userDefaults;
  std::shared_ptr<platform::NotificationCenter> notificationCenter;

  std::shared_ptr<TVXNetworkRequestFactory> requestFactory;
  std::shared_ptr<TavixBagController> bagController;
  std::shared_ptr<UploadManager> uploadManager;
  std::shared_ptr<ClientStateManager> clientStateManager;
  std::shared_ptr<TavixUserGUIDController> guidController;
  std::shared_ptr<ClientSessionManager> clientSessionManager;
  std::shared_ptr<TavixFlusherIPC> flusherIPCListener;
  std::shared_ptr<TavixPersistentStorage> persistentStorage;
  // The completions people engaged with, kept across clients and connections.
  std::shared_ptr<EngagedCompletionCache> engagedCompletionCache;
  std::shared_ptr<LocationManager> locationManager;
  std::shared_ptr<MotionManager> motionManager;
  // The resource files the bag names; made before the bag controller and the session manager.
  std::shared_ptr<DownloadManager> downloadManager;
  // The resource versions each new feedback session records: the download manager's.
  std::shared_ptr<ResourceVersionsProvider> resourceVersions;

  // The assembly's four URL sessions (queries, bag, resource downloads, feedback uploads). Each is
  // made on the first call of its accessor and the same session is returned ever after; safe from
  // any thread. urlSession reads "TVXNoParallax" from userDefaults once, when it is made.
  std::shared_ptr<platform::http::URLSession> urlSession() const;
  std::shared_ptr<platform::http::URLSession> bagSession() const;
  std::shared_ptr<platform::http::URLSession> downloadURLSession() const;
  std::shared_ptr<platform::http::URLSession> uploadURLSession() const;

  // The daemon's folder in the user's caches directory: "<caches>/com.norvel.tavixd".
  platform::fs::path cachesFolder() const;

 private:
  struct Sessions;
  // Declared last: the sessions go first when the assembly goes, cancelling what is still in
  // flight while the services those completions reach are alive.
  std::unique_ptr<Sessions> sessions_;
};

// The application domain of the daemon's defaults and its folder names.
inline constexpr const char* kTavixdDomain = "com.norvel.tavixd";

}  // namespace tavix
