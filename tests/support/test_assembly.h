// The daemon-level services a unit test stands its objects on, made the way start-up makes them:
// a dispatch pool, a virtual clock, a temp home holding the daemon's defaults and caches folder,
// a notification centre and a transaction tracker. `assembly` is wired to them for the objects
// that still find their peers through one.
#pragma once

#include <memory>

#include "context/user_guid_controller.h"
#include "core/assembly.h"
#include "feedback/persistent_storage.h"
#include "network/request_factory.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/notification_center.h"
#include "platform/transactions.h"
#include "support/temp_home.h"

namespace tavix::testing {

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
  Assembly assembly;
};

}  // namespace tavix::testing
