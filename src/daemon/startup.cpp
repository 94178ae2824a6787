#include "daemon/startup.h"

#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <csignal>

#include "bag/tavix_bag_controller.h"
#include "cache/engaged_completion_cache.h"
#include "context/location.h"
#include "context/motion.h"
#include "core/assembly.h"
#include "core/custom_feedback_dirs.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
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
#include "query/client_state.h"
#include "query/client_state_manager.h"
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
  assembly.notificationCenter = std::make_shared<platform::NotificationCenter>();
  assembly.locationManager = std::make_shared<DefaultsLocationManager>(*defaults, clock, pool);
  assembly.motionManager = std::make_shared<DefaultsMotionManager>(*defaults, pool);
  assembly.requestFactory = TVXNetworkRequestFactory::create(assembly);
  assembly.engagedCompletionCache =
      EngagedCompletionCache::create({assembly.cachesFolder(), &clock, &pool, defaults.get()});

  // Uploads left unsent by the last run resume here; endpoints come with the bag.
  assembly.uploadManager = UploadManager::create(assembly);
  assembly.persistentStorage = std::make_shared<TavixPersistentStorage>(assembly);

  const auto countersFile = assembly.cachesFolder() / "counters.plist";
  auto& counters = TavixDiagnosticDataReporter::store();
  if (auto ec = counters.load(countersFile)) log.error("cannot read counters {}", describe(countersFile, ec));
  TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.launch");
  assembly.bagController = TavixBagController::create(assembly);

  // Topic weights a person or another program left for us; any property-list value, sent as JSON.
  if (auto silhouette = defaults->objectForKey("silhouette")) {
    assembly.requestFactory->setSilhouetteTopics(silhouette->string() ? *silhouette->string()
                                                                     : platform::toJson(*silhouette));
  }

  platform::SerialQueue ipcEventQueue(pool, "com.norvel.tavixd.ipc_event");
  platform::ipc::LaunchEventRegistry launchEvents(ipcEventQueue);
  TavixService service(assembly, &launchEvents);
  // After the service: a client state shares the service's GUID controller and session manager.
  assembly.clientStateManager = std::make_shared<ClientStateManager>(assembly);
  assembly.flusherIPCListener = TavixFlusherIPC::create(assembly, [&service, &assembly] {
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
  });
  if (assembly.clientSessionManager) {
    std::weak_ptr<TavixFlusherIPC> channel = assembly.flusherIPCListener;
    assembly.clientSessionManager->setFeedbackObserver([channel](const proto::CTTavixFeedback& feedback) {
      if (auto c = channel.lock()) c->sendDataToReceivingStreamListener(feedback);
    });
  }

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

  // Socket activation hands the listening socket over; otherwise we make our own.
  auto& connectionLog = TavixLogForCategory(TavixLoggingCategoryConnection);
  std::error_code listenError;
  std::unique_ptr<platform::ipc::IpcListener> listener;
  const std::string socketPath =
      options.socketPath.empty() ? (paths.runtimeFolder(kTavixdDomain) / "socket").string() : options.socketPath;
  if (activated >= 0) {
    listener = platform::ipc::IpcListener::adopt(pool, activated, connectionLog, &listenError);
  } else {
    listener = platform::ipc::IpcListener::listen(pool, socketPath, connectionLog, &listenError);
  }
  if (!listener) {
    log.fault("cannot listen on {}: {}", activated < 0 ? socketPath : "the activated socket", listenError.message());
    shutDown();
    return 1;
  }

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

  activities.checkIn(kFlusherActivity, platform::seconds(kFlusherIntervalSeconds), [&assembly](const auto& activity) {
    TavixFeedbackFlusher::handlePeriodicFlushActivity(assembly, activity);
  });
  activities.checkIn(kCustomFeedbackActivity, platform::seconds(kCustomFeedbackIntervalSeconds),
                     [&assembly, &log](const std::shared_ptr<platform::Activity>& activity) {
                       if (activity->state() != platform::ActivityState::Run) return;
                       log.debug("Flushing custom feedback.");
                       if (!activity->setState(platform::ActivityState::Continue)) {
                         log.fault("Couldn't transition flusher activity to continue state.");
                       }
                       TavixCustomFeedbackFlusher(assembly).flushCustomFeedbackWithCompletionHandler([activity, &log] {
                         if (!activity->setState(platform::ActivityState::Done)) {
                           log.fault("Couldn't transition flusher activity to done state.");
                         }
                       });
                     });

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

  platform::SerialQueue housekeeping(pool, "com.norvel.tavixd.housekeeping");
  platform::RepeatingTimer saveCounters(clock, housekeeping);
  platform::RepeatingTimer idleCheck(clock, housekeeping);
  platform::RepeatingTimer watchdog(clock, housekeeping);
  platform::PressureStallMonitor memoryPressure(clock, housekeeping);
  housekeeping.sync([&] {
    if (!memoryPressure.start()) log.info("no memory pressure information; caches shrink only when told");
    // Pings from a pool queue: a pool wedged for the whole interval gets the daemon restarted.
    if (const auto interval = platform::watchdogInterval(); interval > platform::Duration::zero()) {
      watchdog.start(interval / 3, [] { platform::notifyServiceManager("WATCHDOG=1"); });
    }
    saveCounters.start(platform::seconds(kCounterSaveIntervalSeconds), [&] {
      if (!counters.dirty()) return;
      if (auto ec = counters.save(countersFile)) log.error("cannot save counters {}", describe(countersFile, ec));
    });
    if (options.exitWhenIdle > 0) {
      // Idle means: no open transaction and no client connected.
      auto idleSince = std::make_shared<platform::TimePoint>(clock.now());
      const double step = std::min(1.0, options.exitWhenIdle);
      idleCheck.start(platform::seconds(step), [&, idleSince] {
        if (transactions.openCount() > 0 || !service.getClientConnections().empty()) {
          *idleSince = clock.now();
        } else if (clock.now() - *idleSince >= platform::seconds(options.exitWhenIdle)) {
          log.info("idle for {} s, exiting", options.exitWhenIdle);
          runLoop.stop();
        }
      });
    }
  });

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
  housekeeping.sync([&] {
    saveCounters.stop();
    idleCheck.stop();
    watchdog.stop();
    memoryPressure.stop();
  });
  shutDown();
  return 0;
}

}  // namespace tavix
