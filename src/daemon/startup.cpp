#include "daemon/startup.h"

#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <csignal>

#include "bag/tavix_bag_controller.h"
#include "bagview/tvx_bag.h"
#include "cache/engaged_completion_cache.h"
#include "context/app_whitelist_controller.h"
#include "context/desktop_entries.h"
#include "context/location.h"
#include "context/motion.h"
#include "context/subscription_manager.h"
#include "context/user_guid_controller.h"
#include "core/custom_feedback_dirs.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
#include "core/resource_versions.h"
#include "core/url_sessions.h"
#include "daemon/assembly.h"
#include "daemon/client_connection.h"
#include "daemon/tavix_service.h"
#include "delivery/custom_feedback_flusher.h"
#include "delivery/feedback_flusher.h"
#include "delivery/flusher_ipc.h"
#include "delivery/upload_manager.h"
#include "feedback/client_session_manager.h"
#include "feedback/persistent_storage.h"
#include "network/request_factory.h"
#include "network/tracing.h"
#include "platform/activity.h"
#include "platform/clock.h"
#include "platform/counters.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/ipc/launch_events.h"
#include "platform/ipc/server.h"
#include "platform/ipc/unix_socket.h"
#include "platform/json_value.h"
#include "platform/memory_pressure.h"
#include "platform/notification_center.h"
#include "platform/run_loop.h"
#include "platform/service_manager.h"
#include "platform/transactions.h"
#include "query/client_state.h"
#include "query/client_state_manager.h"
#include "resources/download_manager.h"
#include "resources/lookup.h"
#include "platform/transactions.h"

namespace tavix {

using platform::PropertyValue;

namespace {

// How often the background activities fall due.
constexpr double kFlusherIntervalSeconds = 3600;
constexpr double kCustomFeedbackIntervalSeconds = 4 * 3600;
// Counters are saved this often (when changed) and at exit.
constexpr double kCounterSaveIntervalSeconds = 300;

std::string describe(const platform::fs::path& path, const std::error_code& ec) {
  return path.string() + ": " + ec.message();
}

// The listening socket the service manager handed over: the one named after the IPC service
// (FileDescriptorName= of the socket unit), or a lone unnamed one. Other descriptors are closed.
// -1 when there is none to serve on, or when --socket names a path of its own.
int adoptActivatedSocket(const DaemonOptions& options, platform::Logger& log) {
  int chosen = -1;
  const auto sockets = platform::activatedSockets();
  for (const auto& socket : sockets) {
    const bool ours = socket.name == kTavixdDomain || (sockets.size() == 1 && socket.name == "unknown");
    if (chosen < 0 && ours && options.socketPath.empty() && platform::isListeningUnixStreamSocket(socket.fd)) {
      chosen = socket.fd;
      continue;
    }
    log.error("ignoring the activated socket {} ({})", socket.fd, socket.name);
    ::close(socket.fd);
  }
  return chosen;
}

}  // namespace

platform::Dictionary tavixdRegisteredDefaults() {
  return {
      {"TVXSharedSession", PropertyValue(true)},
      {"TVXSessionSizeLimit", PropertyValue(std::int64_t{2097152})},
      {"TVXSessionMaxAge", PropertyValue(std::int64_t{172800})},
      {"TVXUseMarvola", PropertyValue(true)},
      {"TVXSessionSoftLimitOverride", PropertyValue(std::int64_t{600})},
      {"TVXSessionIdleTimeOverride", PropertyValue(std::int64_t{180})},
  };
}

void createCustomFeedbackDirectories(const platform::Paths& paths) {
  auto& log = TavixLogForCategory(TavixLoggingCategoryDefault);
  if (auto ec = platform::createDirectory(paths.cacheHome, true, 0700)) {
    log.error("failed getting a caches dir: {}", describe(paths.cacheHome, ec));
    return;
  }
  const auto root = paths.cachesFolder(kTavixdDomain) / kTVXCustomFeedbackDir;
  if (auto ec = platform::createDirectory(root, true, 0700)) {
    log.error("failed creating CustomFeedback dir:{}", describe(root, ec));
    return;
  }
  for (int type = kTVXFirstCustomFeedbackType; type <= kTVXLastCustomFeedbackType; ++type) {
    auto name = customFeedbackDirectoryForType(type);
    if (!name) continue;
    const auto dir = root / *name;
    auto ec = platform::createDirectory(dir, false, 0700);
    if (ec && ec != std::errc::file_exists) log.error("failed creating a CustomFeedback subdir:{}", describe(dir, ec));
  }
}

namespace {

// The installed-app signature, made before the request factory that sends it.
std::shared_ptr<AppWhitelistController> makeAppWhitelistController(const Assembly& assembly) {
  return AppWhitelistController::create({assembly.dispatchPool, assembly.clock, assembly.transactions,
                                         assembly.notificationCenter, assembly.userDefaults, assembly.cachesFolder(),
                                         applicationFoldersFromEnvironment()});
}

// Subscriptions (after the request factory, their delegate) and look-up hints (after the download
// manager, whose versions they compare); both before the first bag change and the start-up
// notification they follow.
void assembleResourceConsumers(Assembly& assembly) {
  const auto defaults = assembly.userDefaults;
  const std::string userAgent = assembly.requestFactory->userAgent().value_or("");
  assembly.subscriptionManager = TavixSubscriptionManager::create(
      {assembly.dispatchPool, assembly.clock, assembly.notificationCenter,
       [userAgent](const platform::Notification& n) -> std::optional<SubscriptionBagSettings> {
         auto bag = bagOfNotification(n, userAgent);
         if (!bag) return std::nullopt;
         return SubscriptionBagSettings{bag->subscriptionProviderDomainWhitelist(),
                                        bag->subscriptionProviderBundleIdentifierWhitelist(), bag->subscriptionTTL()};
       },
       std::make_shared<DefaultsVideoSubscriptionProvider>(*defaults),
       std::make_shared<DefaultsMusicSubscriptionProvider>(*defaults),
       std::make_shared<DefaultsStorefrontProvider>(*defaults), defaults},
      assembly.requestFactory);
  assembly.lookup = Lookup::create(
      {assembly.dispatchPool, assembly.transactions, assembly.notificationCenter, defaults, assembly.resourceVersions,
       std::make_shared<FileLookupHintsStore>(assembly.cachesFolder() / kLookupHintsStoreFolder),
       assembly.cachesFolder()});
}

// The services, made and wired in the order start-up needs: each is handed the ones it uses.
// Uploads left unsent by the last run resume with the upload manager; endpoints come with the bag.
void assembleServices(Assembly& assembly, platform::DispatchPool& pool, platform::Clock& clock) {
  auto& defaults = *assembly.userDefaults;
  assembly.notificationCenter = std::make_shared<platform::NotificationCenter>();
  assembly.locationManager = std::make_shared<DefaultsLocationManager>(defaults, clock, pool);
  assembly.motionManager = std::make_shared<DefaultsMotionManager>(defaults, pool);
  TVXRequestFactoryProviders providers;
  providers.locationManager = assembly.locationManager;
  providers.motionManager = assembly.motionManager;
  assembly.appWhitelistController = makeAppWhitelistController(assembly);
  providers.appWhitelistSignature = [signatures = assembly.appWhitelistController] {
    return signatures->whitelistSignature();
  };
  assembly.requestFactory = TVXNetworkRequestFactory::create(
      {&pool, &clock, assembly.userDefaults, assembly.notificationCenter, assembly.cachesFolder()}, std::move(providers));
  assembly.engagedCompletionCache =
      EngagedCompletionCache::create({assembly.cachesFolder(), &clock, &pool, assembly.userDefaults.get()});
  // The download manager's.
  assembly.downloadSession = std::make_shared<platform::http::URLSession>(downloadSessionConfiguration());
  assembly.uploadSession = std::make_shared<platform::http::URLSession>(uploadSessionConfiguration());
  auto uploads = BackgroundUploadSession::create(assembly.uploadSession, assembly.cachesFolder() / "UploadJournal", pool);
  assembly.uploadManager =
      UploadManager::create(pool, *assembly.notificationCenter, assembly.requestFactory, std::move(uploads));
  assembly.persistentStorage = std::make_shared<TavixPersistentStorage>(TavixPersistentStorage::Environment{
      assembly.cachesFolder(), &pool, &clock, assembly.userDefaults.get(), assembly.transactions});
  // Before the bag controller and the session manager, which stamp their feedback with its GUID.
  assembly.guidController = std::make_shared<TavixUserGUIDController>(pool, clock, assembly.notificationCenter);
}

// The bag controller and its session; fetch records go to sessions of their own.
void assembleBagController(Assembly& assembly) {
  assembly.bagSession = std::make_shared<platform::http::URLSession>(bagSessionConfiguration());
  assembly.bagController = TavixBagController::create({assembly.feedback, assembly.transactions, assembly.notificationCenter,
                                                       assembly.requestFactory, assembly.bagSession,
                                                       assembly.paths.cacheHome, assembly.cachesFolder()});
}

// Reads "TVXSharedSession" and makes the feedback session manager that clients share when it is
// set. After the GUID controller and the bag controller, which the manager uses.
void assembleFeedbackServices(Assembly& assembly) {
  assembly.sessions = {assembly.feedback, assembly.transactions, assembly.notificationCenter,
                       assembly.userDefaults->boolForKey("TVXSharedSession")};
  assembly.clientSessionManager =
      std::make_shared<ClientSessionManager>(assembly.sessions, assembly.guidController, assembly.bagController, "tavix");
}

// Before the bag controller and the session manager, which take the resource versions with the
// feedback environment made here. Downloads an earlier run left in the journal resume here.
void assembleDownloadManager(Assembly& assembly, platform::DispatchPool& pool, platform::Clock& clock) {
  DownloadManager::Environment env;
  env.pool = &pool;
  env.clock = &clock;
  env.center = assembly.notificationCenter;
  env.defaults = assembly.userDefaults;
  env.cachesFolder = assembly.cachesFolder();
  env.session = platform::http::BackgroundDownloadSession::create(
      assembly.downloadSession, assembly.cachesFolder() / "DownloadJournal", pool, clock,
      TavixLogForCategory(TavixLoggingCategoryDownloadManager));
  env.fileDownloadRequest = [factory = assembly.requestFactory](const std::string& url,
                                                                std::optional<std::string> version, bool latLong) {
    return factory->fileDownloadRequest(url, std::move(version), latLong);
  };
  // Read fresh each time: the look-up panel's settings switch it while we run.
  env.lookupEnabled = [defaults = assembly.userDefaults] { return lookupEnabled(*defaults); };
  env.reportError = [&assembly](int code, const std::string& domain, const std::string& reason) {
    if (assembly.clientSessionManager) assembly.clientSessionManager->reportErrorAsTavixdFeedback(code, domain, reason);
  };
  assembly.downloadManager = DownloadManager::create(std::move(env));
  assembly.resourceVersions = assembly.downloadManager;
  assembly.feedback = {&pool, &clock, assembly.userDefaults, assembly.persistentStorage, assembly.guidController,
                       assembly.resourceVersions};
}

// Topic weights a person or another program left for us; any property-list value, sent as JSON.
void applySilhouette(const platform::UserDefaults& defaults, TVXNetworkRequestFactory& requestFactory) {
  if (auto silhouette = defaults.objectForKey("silhouette")) {
    requestFactory.setSilhouetteTopics(silhouette->string() ? *silhouette->string() : platform::toJson(*silhouette));
  }
}

// Built at each run: the flush channel is made after the first flushers are wired.
TavixFeedbackFlusher::Environment feedbackFlusherEnvironment(const Assembly& assembly) {
  return {assembly.feedback, assembly.uploadManager, assembly.flusherIPCListener, assembly.transactions};
}

TavixCustomFeedbackFlusher::Environment customFeedbackFlusherEnvironment(const Assembly& assembly) {
  return {assembly.paths.cacheHome, assembly.cachesFolder(), assembly.feedback, assembly.bagController,
          assembly.uploadManager};
}

// The flush command channel: it flushes each connected client's session, and hears every
// feedback event of the daemon's own session manager.
std::shared_ptr<TavixFlusherIPC> makeFlusherChannel(Assembly& assembly, TavixService& service) {
  TavixFlusherIPC::Environment env;
  env.pool = assembly.dispatchPool;
  env.defaults = assembly.userDefaults;
  env.sharedSession = assembly.sessions.sharedSession;
  env.flushFeedback = [&assembly](std::function<void()> done) {
    TavixFeedbackFlusher::create(feedbackFlusherEnvironment(assembly))->forceFlushWithCompletion(std::move(done));
  };
  env.getClientConnections = [&service, &assembly] {
    std::vector<TavixFlusherIPC::ClientConnectionHandle> handles;
    for (const auto& client : service.getClientConnections()) {
      TavixFlusherIPC::ClientConnectionHandle handle;
      // The user agent and the bound state belong to the connection's queue.
      std::shared_ptr<ClientSessionManager> manager = assembly.clientSessionManager;
      client->connection()->queue().sync([&] {
        handle.userAgent = client->userAgent();
        if (client->state() && client->state()->sessionManager()) manager = client->state()->sessionManager();
      });
      handle.flushSession = [manager](std::function<void()> done) {
        if (manager) {
          manager->flushSession(std::move(done));
        } else if (done) {
          done();
        }
      };
      handles.push_back(std::move(handle));
    }
    return handles;
  };
  auto channel = TavixFlusherIPC::create(std::move(env));
  std::weak_ptr<TavixFlusherIPC> weak = channel;
  assembly.clientSessionManager->setFeedbackObserver([weak](const proto::CTTavixFeedback& feedback) {
    if (auto c = weak.lock()) c->sendDataToReceivingStreamListener(feedback);
  });
  return channel;
}

// The client states, their query session and their one shared environment. After the feedback
// services: a client state may share their GUID controller and session manager.
void assembleClientStates(Assembly& assembly) {
  // Query completions run on the daemon's pool: what a search posts once answered (its end record)
  // then follows on the same thread instead of waking a second pool. Nothing on the pool waits
  // for a query's answer, so the pool cannot starve its own completions. The bag session keeps
  // a thread of its own: searches do wait for the first bag.
  auto queryConfiguration = querySessionConfiguration(*assembly.userDefaults);
  queryConfiguration.delegatePool = assembly.dispatchPool;
  assembly.querySession = std::make_shared<platform::http::URLSession>(queryConfiguration);
  auto env = std::make_shared<ClientState::Environment>();
  env->pool = assembly.dispatchPool;
  env->clock = assembly.clock;
  env->defaults = assembly.userDefaults;
  env->center = assembly.notificationCenter;
  env->requestFactory = assembly.requestFactory;
  env->bagController = assembly.bagController;
  env->engagedCompletionCache = assembly.engagedCompletionCache;
  env->locationManager = assembly.locationManager;
  env->session = assembly.querySession;
  env->guidController = assembly.guidController;
  env->sessionManager = assembly.clientSessionManager;
  env->sessions = assembly.sessions;
  assembly.clientStateManager = std::make_shared<ClientStateManager>(
      *assembly.dispatchPool, assembly.userDefaults,
      [env = std::shared_ptr<const ClientState::Environment>(std::move(env))](const std::string& identifier) {
        return ClientState::create(env, identifier);
      });
}

// Every client connection's services. The service binds connections with it from the first
// accepted client on, so it is completed (the flush channel, made after the service) before the
// listener resumes.
void fillConnectionEnvironment(ClientConnection::Environment& env, const Assembly& assembly,
                               platform::ipc::LaunchEventRegistry& launchEvents) {
  env.pool = assembly.dispatchPool;
  env.clock = assembly.clock;
  env.transactions = assembly.transactions;
  env.activities = assembly.activityScheduler;
  env.launchEvents = &launchEvents;
  env.defaults = assembly.userDefaults;
  env.center = assembly.notificationCenter;
  env.requestFactory = assembly.requestFactory;
  env.clientStates = assembly.clientStateManager;
  env.sessionManager = assembly.clientSessionManager;
  env.engagedCompletions = assembly.engagedCompletionCache;
  env.feedback = assembly.feedback;
  env.cachesFolder = assembly.cachesFolder();
  env.flusher = assembly.flusherIPCListener;
  env.downloads = assembly.downloadManager;
}

// Socket activation hands the listening socket over; otherwise we make our own at `socketPath`.
std::unique_ptr<platform::ipc::IpcListener> openListener(int activated, const std::string& socketPath,
                                                         platform::DispatchPool& pool, platform::Logger& log) {
  auto& connectionLog = TavixLogForCategory(TavixLoggingCategoryConnection);
  std::error_code error;
  auto listener = activated >= 0 ? platform::ipc::IpcListener::adopt(pool, activated, connectionLog, &error)
                                 : platform::ipc::IpcListener::listen(pool, socketPath, connectionLog, &error);
  if (!listener) log.fault("cannot listen on {}: {}", activated < 0 ? socketPath : "the activated socket", error.message());
  return listener;
}

void registerLaunchEvents(platform::ipc::LaunchEventRegistry& launchEvents, Assembly& assembly) {
  auto& launchLog = TavixLogForCategory(TavixLoggingCategoryDefault);
  launchEvents.setHandler("com.norvel.tavixd.urlsession",
                          [&launchLog](const std::string& session) { launchLog.info("launch event for {}", session); });
  launchEvents.setHandler("com.norvel.notify.matching", [&launchLog, &assembly](const std::string& name) {
    launchLog.info("launch event for {}", name);
    // The system search asks for its completion history to be forgotten.
    if (name == "com.norvel.predictions.queries.clearData") {
      assembly.engagedCompletionCache->clearAllCompletionsForClient(kEngagedCompletionClientSeekara);
    }
  });
}

void checkInActivities(platform::ActivityScheduler& activities, Assembly& assembly, platform::Logger& log) {
  activities.checkIn(kFlusherActivity, platform::seconds(kFlusherIntervalSeconds), [&assembly](const auto& activity) {
    TavixFeedbackFlusher::handlePeriodicFlushActivity(*assembly.userDefaults, feedbackFlusherEnvironment(assembly),
                                                      activity);
  });
  activities.checkIn(kCustomFeedbackActivity, platform::seconds(kCustomFeedbackIntervalSeconds),
                     [&assembly, &log](const std::shared_ptr<platform::Activity>& activity) {
                       if (activity->state() != platform::ActivityState::Run) return;
                       log.debug("Flushing custom feedback.");
                       if (!activity->setState(platform::ActivityState::Continue)) {
                         log.fault("Couldn't transition flusher activity to continue state.");
                       }
                       TavixCustomFeedbackFlusher(customFeedbackFlusherEnvironment(assembly)).flushCustomFeedbackWithCompletionHandler([activity, &log] {
                         if (!activity->setState(platform::ActivityState::Done)) {
                           log.fault("Couldn't transition flusher activity to done state.");
                         }
                       });
                     });
}

// The chores on a queue of their own: counters saved, the idle exit, the service manager's
// watchdog and the memory-pressure monitor. None keeps a timer while it has nothing to do.
class Housekeeping {
 public:
  Housekeeping(platform::DispatchPool& pool, platform::Clock& clock)
      : clock_(clock), queue_(pool, "com.norvel.tavixd.housekeeping"), watchdog_(clock, queue_),
        memoryPressure_(clock, queue_) {}

  // `isBusy` says whether a transaction is open or a client connected; `exit` ends the run loop.
  void start(platform::CounterStore& counters, const platform::fs::path& countersFile, double exitWhenIdle,
             platform::TransactionTracker& transactions, std::function<bool()> isBusy, std::function<void()> exit,
             platform::Logger& log) {
    queue_.sync([&] {
      log_ = &log;
      if (!memoryPressure_.start(&log)) log.info("no memory pressure information; caches shrink only when told");
      // Pings from a pool queue: a pool wedged for the whole interval gets the daemon restarted.
      if (const auto interval = platform::watchdogInterval(); interval > platform::Duration::zero()) {
        watchdog_.start(interval / 3, [] { platform::notifyServiceManager("WATCHDOG=1"); });
      }
      // Saved a while after the first change, not on a timer that runs while nothing changes.
      counters_ = &counters;
      countersFile_ = countersFile;
      counters.setDirtyHandler([this] { queue_.async([this] { saveCountersLater(); }); });
      if (counters.dirty()) saveCountersLater();
      if (exitWhenIdle > 0) {
        transactions_ = &transactions;
        exitWhenIdle_ = exitWhenIdle;
        isBusy_ = std::move(isBusy);
        exit_ = std::move(exit);
        idleSince_ = clock_.now();
        // The last transaction's end restarts the count; no timer runs while one is open.
        transactions.setIdleHandler([this] {
          queue_.async([this] {
            idleSince_ = clock_.now();
            checkIdleAfter(platform::seconds(exitWhenIdle_));
          });
        });
        checkIdleAfter(platform::seconds(exitWhenIdle_));
      }
    });
  }

  // Before the objects the handlers reach go; a handler already called still finds them alive,
  // since they outlive the pool's shutdown.
  void stop() {
    if (counters_) counters_->setDirtyHandler(nullptr);
    if (transactions_) transactions_->setIdleHandler(nullptr);
    queue_.sync([&] {
      saveCounters_.cancel();
      idleCheck_.cancel();
      watchdog_.stop();
      memoryPressure_.stop();
    });
  }

 private:
  void saveCountersLater() {
    if (saveArmed_) return;
    saveArmed_ = true;
    saveCounters_ = clock_.after(platform::seconds(kCounterSaveIntervalSeconds), queue_, [this] {
      saveArmed_ = false;
      if (!counters_->dirty()) return;
      if (auto ec = counters_->save(countersFile_)) log_->error("cannot save counters {}", describe(countersFile_, ec));
    });
  }

  void checkIdleAfter(platform::Duration delay) {
    idleCheck_.cancel();
    idleCheck_ = clock_.after(delay, queue_, [this] {
      if (transactions_->openCount() > 0) return;  // the end of the last one checks again
      const auto now = clock_.now();
      if (isBusy_()) {
        // A client connected without a transaction: only looking tells when it goes.
        idleSince_ = now;
        checkIdleAfter(platform::seconds(std::min(1.0, exitWhenIdle_)));
      } else if (now - idleSince_ >= platform::seconds(exitWhenIdle_)) {
        log_->info("idle for {} s, exiting", exitWhenIdle_);
        exit_();
      } else {
        checkIdleAfter(idleSince_ + platform::seconds(exitWhenIdle_) - now);
      }
    });
  }

  platform::Clock& clock_;
  platform::SerialQueue queue_;
  platform::RepeatingTimer watchdog_;
  platform::PressureStallMonitor memoryPressure_;
  platform::Logger* log_ = nullptr;
  // On queue_ once started.
  platform::CounterStore* counters_ = nullptr;
  platform::fs::path countersFile_;
  platform::TimerHandle saveCounters_;
  bool saveArmed_ = false;
  platform::TransactionTracker* transactions_ = nullptr;
  double exitWhenIdle_ = 0;
  std::function<bool()> isBusy_;
  std::function<void()> exit_;
  platform::TimePoint idleSince_;
  platform::TimerHandle idleCheck_;
};

}  // namespace

int runDaemon(const DaemonOptions& options, const platform::Paths& paths) {
  platform::setLogLevel(options.logLevel);
  auto& log = TavixLogForCategory(TavixLoggingCategoryDefault);
  // Before any thread: taking the sockets changes the environment.
  const int activated = adoptActivatedSocket(options, log);

  // Before the pool: tasks dropped when the pool goes still end their transactions.
  platform::TransactionTracker transactions;
  platform::DispatchPool pool;
  platform::SystemClock clock(pool);
  platform::SerialQueue activityQueue(pool, "com.norvel.tavixd.activities");
  platform::ActivityScheduler activities(clock, activityQueue, transactions);
  platform::RunLoop runLoop;

  auto defaults = std::make_shared<platform::UserDefaults>(paths.configFolder(kTavixdDomain), kTavixdDomain, &log);
  defaults->watch(pool);
  TVXTracingSetup(*defaults);
  defaults->registerDefaults(tavixdRegisteredDefaults());
  createCustomFeedbackDirectories(paths);

  Assembly assembly;
  assembly.dispatchPool = &pool;
  assembly.clock = &clock;
  assembly.transactions = &transactions;
  assembly.activityScheduler = &activities;
  assembly.paths = paths;
  assembly.userDefaults = defaults;
  assembleServices(assembly, pool, clock);
  assembleDownloadManager(assembly, pool, clock);
  assembleResourceConsumers(assembly);

  const auto countersFile = assembly.cachesFolder() / "counters.plist";
  auto& counters = TavixDiagnosticDataReporter::store();
  if (auto ec = counters.load(countersFile)) log.error("cannot read counters {}", describe(countersFile, ec));
  TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.launch");
  assembleBagController(assembly);
  applySilhouette(*defaults, *assembly.requestFactory);

  assembleFeedbackServices(assembly);

  platform::SerialQueue ipcEventQueue(pool, "com.norvel.tavixd.ipc_event");
  platform::ipc::LaunchEventRegistry launchEvents(ipcEventQueue);
  auto connections = std::make_shared<ClientConnection::Environment>();
  assembleClientStates(assembly);
  TavixService service({&pool, assembly.querySession,
                        [connections](const std::shared_ptr<platform::ipc::IpcConnection>& connection) {
                          return std::make_shared<ClientConnection>(connections, connection);
                        }});
  assembly.flusherIPCListener = makeFlusherChannel(assembly, service);
  fillConnectionEnvironment(*connections, assembly, launchEvents);

  // The orderly end, on every way out once the services exist.
  auto shutDown = [&] {
    assembly.flusherIPCListener.reset();  // its dumps reach the service, which goes next
    pool.drain();  // let queued work finish while everything it may touch is still alive
    // A bag fetch may still be on the wire; its completion must not reach the services going next.
    assembly.bagController->invalidate();
    // Work that arrived since (a last feedback event, a closing connection) must not run while the
    // assembly's objects are being destroyed: stop the workers first.
    pool.shutdown();
    if (auto ec = counters.save(countersFile)) log.error("cannot save counters {}", describe(countersFile, ec));
    log.info("tavixd stopped");
  };

  const std::string socketPath =
      options.socketPath.empty() ? (paths.runtimeFolder(kTavixdDomain) / "socket").string() : options.socketPath;
  auto listener = openListener(activated, socketPath, pool, log);
  if (!listener) {
    shutDown();
    return 1;
  }
  registerLaunchEvents(launchEvents, assembly);
  checkInActivities(activities, assembly, log);

  // Warm the bag: a valid disk bag is already in memory; otherwise this starts the first fetch.
  pool.post([bagController = assembly.bagController] { bagController->currentBag(); });
  pool.post([center = assembly.notificationCenter] { center->post(kTVXStartupNotification); });

  platform::SignalSource sigint(pool, SIGINT, [&] {
    log.debug("SIGINT");
    runLoop.stop();
  });
  platform::SignalSource sigterm(pool, SIGTERM, [&] {
    log.debug("SIGTERM");
    runLoop.stop();
  });

  Housekeeping housekeeping(pool, clock);
  housekeeping.start(
      counters, countersFile, options.exitWhenIdle, transactions,
      [&] { return transactions.openCount() > 0 || !service.getClientConnections().empty(); },
      [&] { runLoop.stop(); }, log);

  // Clients that connect early wait in the socket's backlog until every handler they may reach
  // (launch events, activities) is in place: none of their messages finds a handler missing.
  listener->resume([&service](const auto& connection) { service.shouldAcceptConnection(connection); },
                   "com.norvel.tavixd.connection");
  log.info("listening on {}", activated < 0 ? socketPath : "the socket handed over by systemd");
  log.info("tavixd started (pid {}), caches in {}", getpid(), assembly.cachesFolder().string());
  platform::notifyServiceManager("READY=1\nSTATUS=Serving clients");
  runLoop.run();
  platform::notifyServiceManager("STOPPING=1\nSTATUS=Stopping");

  listener.reset();  // no new clients while shutting down
  housekeeping.stop();
  shutDown();
  return 0;
}

}  // namespace tavix
