// The daemon-level services a unit test stands its objects on, made the way start-up makes them:
// a dispatch pool, a virtual clock, a temp home holding the daemon's defaults and caches folder,
// a notification centre and a transaction tracker. `assembly` holds what a test wires on them,
// under start-up's names, and the environment builders below hand it to the objects under test.
#pragma once

#include <memory>
#include <mutex>

#include "bag/tavix_bag_controller.h"
#include "context/user_guid_controller.h"
#include "core/names.h"
#include "core/url_sessions.h"
#include "feedback/client_session.h"
#include "feedback/client_session_manager.h"
#include "feedback/persistent_storage.h"
#include "network/request_factory.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "platform/notification_center.h"
#include "platform/transactions.h"
#include "support/temp_home.h"

namespace tavix {
namespace platform {
class ActivityScheduler;
}
class ClientStateManager;
class EngagedCompletionCache;
class ResourceVersionsProvider;
class TavixFlusherIPC;
class UploadManager;
}  // namespace tavix

namespace tavix::testing {

// The objects a test wires together, named as start-up names them; null until the test makes them.
struct TestWiring {
  platform::DispatchPool* dispatchPool = nullptr;
  platform::Clock* clock = nullptr;
  platform::TransactionTracker* transactions = nullptr;
  platform::ActivityScheduler* activityScheduler = nullptr;
  platform::Paths paths;
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
  std::shared_ptr<EngagedCompletionCache> engagedCompletionCache;
  std::shared_ptr<ResourceVersionsProvider> resourceVersions;

  // The query and bag sessions, configured as start-up configures them; made on first use. Query
  // completions run on the test's pool, so that draining it waits for the bookkeeping a search
  // does after it has answered.
  std::shared_ptr<platform::http::URLSession> urlSession() {
    std::call_once(queryOnce_, [&] {
      auto configuration = querySessionConfiguration(*userDefaults);
      configuration.delegatePool = dispatchPool;
      query_ = std::make_shared<platform::http::URLSession>(configuration);
    });
    return query_;
  }
  std::shared_ptr<platform::http::URLSession> bagSession() {
    std::call_once(bagOnce_, [&] { bag_ = std::make_shared<platform::http::URLSession>(bagSessionConfiguration()); });
    return bag_;
  }
  platform::fs::path cachesFolder() const { return paths.cachesFolder(kTavixdDomain); }

 private:
  std::once_flag queryOnce_, bagOnce_;
  std::shared_ptr<platform::http::URLSession> query_, bag_;
};

// What feedback sessions, session managers and bag controllers are made with, from the wiring as it
// is now.
inline FeedbackEnvironment feedbackEnvironment(const TestWiring& w) {
  return {w.dispatchPool, w.clock, w.userDefaults, w.persistentStorage, w.guidController, w.resourceVersions};
}
inline ClientSessionManager::Environment sessionManagerEnvironment(const TestWiring& w) {
  return {feedbackEnvironment(w), w.transactions, w.notificationCenter, w.sharedSession};
}
inline TavixBagController::Environment bagControllerEnvironment(TestWiring& w) {
  return {feedbackEnvironment(w), w.transactions, w.notificationCenter, w.requestFactory, w.bagSession(),
          w.paths.cacheHome, w.cachesFolder()};
}

class TestAssembly {
 public:
  // `threads` 0: a pool sized for the machine. `otherClock` null: `clock`, a virtual one. The
  // session limits are the daemon's registered ones; a test registers more on `defaults`.
  explicit TestAssembly(unsigned threads = 2, platform::Clock* otherClock = nullptr)
      : pool(threads),
        defaults(std::make_shared<platform::UserDefaults>(home.config(), kTavixdDomain)),
        center(std::make_shared<platform::NotificationCenter>()) {
    defaults->registerDefaults({{"TVXSessionSizeLimit", platform::PropertyValue(std::int64_t{2097152})},
                                {"TVXSessionMaxAge", platform::PropertyValue(std::int64_t{172800})}});
    assembly.dispatchPool = &pool;
    assembly.clock = otherClock ? otherClock : &clock;
    assembly.transactions = &transactions;
    assembly.paths = platform::Paths{home.cache(), home.config(), home.runtime()};
    assembly.userDefaults = defaults;
    assembly.notificationCenter = center;
  }
  TestAssembly(const TestAssembly&) = delete;
  TestAssembly& operator=(const TestAssembly&) = delete;

  // Moves the virtual clock and waits for what its timers queued.
  void advance(double seconds) {
    clock.advance(platform::seconds(seconds));
    pool.drain();
  }

  TavixPersistentStorage::Environment storageEnvironment() {
    return {assembly.cachesFolder(), &pool, assembly.clock, defaults.get(), &transactions};
  }
  // The session-file storage, also set as the assembly's.
  std::shared_ptr<TavixPersistentStorage> makeStorage(std::shared_ptr<SessionFileIO> io = nullptr) {
    assembly.persistentStorage = std::make_shared<TavixPersistentStorage>(storageEnvironment(), std::move(io));
    return assembly.persistentStorage;
  }
  TVXNetworkRequestFactory::Environment requestFactoryEnvironment() {
    return {&pool, assembly.clock, defaults, center, assembly.cachesFolder()};
  }
  // The request factory, also set as the assembly's.
  std::shared_ptr<TVXNetworkRequestFactory> makeRequestFactory(TVXRequestFactoryProviders providers = {}) {
    assembly.requestFactory = TVXNetworkRequestFactory::create(requestFactoryEnvironment(), std::move(providers));
    return assembly.requestFactory;
  }
  // A new GUID controller announcing on the assembly's centre.
  std::shared_ptr<TavixUserGUIDController> makeGUIDController() {
    return std::make_shared<TavixUserGUIDController>(pool, *assembly.clock, center);
  }

  TempHome home;
  // Before the pool and clock: transactions still held by pending timers end when those go.
  platform::TransactionTracker transactions;
  platform::DispatchPool pool;
  platform::VirtualClock clock;
  std::shared_ptr<platform::UserDefaults> defaults;
  std::shared_ptr<platform::NotificationCenter> center;
  TestWiring assembly;
};

}  // namespace tavix::testing
