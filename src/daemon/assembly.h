// Start-up's own wiring: the long-lived objects runDaemon makes, in the order it makes them. Each
// object is handed what it uses when it is made; nothing but start-up holds the assembly.
//
// Set on the main thread before any client can connect, and only read afterwards: no locking.
#pragma once

#include <memory>

#include "feedback/client_session.h"
#include "feedback/client_session_manager.h"
#include "platform/files.h"
#include "core/names.h"
#include "platform/http/url_session.h"

namespace tavix {

namespace platform {
class ActivityScheduler;
class Clock;
class DispatchPool;
class NotificationCenter;
class TransactionTracker;
class UserDefaults;
}  // namespace platform

class TVXNetworkRequestFactory;
class TavixBagController;
class UploadManager;
class ClientStateManager;
class TavixUserGUIDController;
class TavixFlusherIPC;
class TavixPersistentStorage;
class EngagedCompletionCache;
class LocationManager;
class MotionManager;
class ResourceVersionsProvider;
class DownloadManager;
class AppWhitelistController;
class TavixSubscriptionManager;
class Lookup;

struct Assembly {
  Assembly() = default;
  // The sessions are shut first, while everything below is alive: what they still had on the wire
  // completes as cancelled into services that exist. Their other holders keep a shut session.
  ~Assembly() {
    for (auto* session : {&querySession, &bagSession, &downloadSession, &uploadSession}) {
      if (*session) (*session)->invalidateAndCancel();
    }
  }
  Assembly(const Assembly&) = delete;
  Assembly& operator=(const Assembly&) = delete;

  // Not owned: they outlive the assembly.
  platform::DispatchPool* dispatchPool = nullptr;
  platform::Clock* clock = nullptr;
  platform::TransactionTracker* transactions = nullptr;
  platform::ActivityScheduler* activityScheduler = nullptr;
  platform::Paths paths;
  std::shared_ptr<platform::UserDefaults> userDefaults;

  std::shared_ptr<platform::NotificationCenter> notificationCenter;
  std::shared_ptr<LocationManager> locationManager;
  std::shared_ptr<MotionManager> motionManager;
  std::shared_ptr<TVXNetworkRequestFactory> requestFactory;
  std::shared_ptr<EngagedCompletionCache> engagedCompletionCache;
  std::shared_ptr<UploadManager> uploadManager;
  std::shared_ptr<TavixPersistentStorage> persistentStorage;
  std::shared_ptr<TavixUserGUIDController> guidController;
  // Made before every object that opens feedback sessions: each keeps the resource-versions
  // provider it was made with (the session manager and bag controller through `feedback`).
  std::shared_ptr<DownloadManager> downloadManager;
  std::shared_ptr<ResourceVersionsProvider> resourceVersions;
  // What requests and the look-up panel learn from downloaded resources and the user's providers.
  std::shared_ptr<AppWhitelistController> appWhitelistController;
  std::shared_ptr<TavixSubscriptionManager> subscriptionManager;
  std::shared_ptr<Lookup> lookup;
  // What feedback sessions are opened with, once the storage, GUID controller and resource versions
  // exist.
  FeedbackEnvironment feedback;
  std::shared_ptr<TavixBagController> bagController;
  // What session managers are made with; sharedSession from "TVXSharedSession".
  ClientSessionManager::Environment sessions;
  std::shared_ptr<ClientSessionManager> clientSessionManager;
  std::shared_ptr<ClientStateManager> clientStateManager;
  std::shared_ptr<TavixFlusherIPC> flusherIPCListener;

  // The four URL sessions, each made just before its first user.
  std::shared_ptr<platform::http::URLSession> uploadSession;
  std::shared_ptr<platform::http::URLSession> bagSession;
  std::shared_ptr<platform::http::URLSession> querySession;
  std::shared_ptr<platform::http::URLSession> downloadSession;

  // The daemon's folder in the user's caches directory: "<caches>/com.norvel.tavixd".
  platform::fs::path cachesFolder() const { return paths.cachesFolder(kTavixdDomain); }
};

}  // namespace tavix
