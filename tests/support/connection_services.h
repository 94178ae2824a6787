// What client connections stand on, made on a test assembly the way start-up makes it: request
// factory, GUID controller, the daemon's session manager, bag controller, engaged completions and
// client states. The bag server is a loopback port that refuses every connection (bound, never
// listening), so a client waits for its bag until the wait is over.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "bag/tavix_bag_controller.h"
#include "cache/engaged_completion_cache.h"
#include "daemon/client_connection.h"
#include "platform/ipc/unix_socket.h"
#include "support/client_states.h"

namespace tavix::testing {

class ConnectionServices {
 public:
  // `activities` and `launchEvents` may be null (no activities, no launch events).
  ConnectionServices(TestAssembly& t, platform::ActivityScheduler* activities,
                     platform::ipc::LaunchEventRegistry* launchEvents)
      : t_(t) {
    refused_.reset(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    EXPECT_EQ(::bind(refused_.get(), reinterpret_cast<sockaddr*>(&address), length), 0);
    EXPECT_EQ(::getsockname(refused_.get(), reinterpret_cast<sockaddr*>(&address), &length), 0);
    t.defaults->setObject("TVXBagURL", "http://127.0.0.1:" + std::to_string(ntohs(address.sin_port)) + "/bag");

    auto& a = t.assembly;
    t.makeRequestFactory();
    a.guidController = t.makeGUIDController();
    a.sharedSession = t.defaults->boolForKey("TVXSharedSession");
    a.clientSessionManager =
        std::make_shared<ClientSessionManager>(sessionManagerEnvironment(a), a.guidController, nullptr, "tavix");
    a.bagController = TavixBagController::create(bagControllerEnvironment(a));
    a.engagedCompletionCache = EngagedCompletionCache::create({a.cachesFolder(), a.clock, &t.pool, nullptr});
    a.clientStateManager = makeClientStateManager(t);

    env = std::make_shared<ClientConnection::Environment>();
    env->pool = &t.pool;
    env->clock = a.clock;
    env->transactions = &t.transactions;
    env->activities = activities;
    env->launchEvents = launchEvents;
    env->defaults = t.defaults;
    env->center = t.center;
    env->requestFactory = a.requestFactory;
    env->clientStates = a.clientStateManager;
    env->sessionManager = a.clientSessionManager;
    env->engagedCompletions = a.engagedCompletionCache;
    env->feedback = feedbackEnvironment(a);
    env->cachesFolder = a.cachesFolder();
  }
  ~ConnectionServices() { t_.assembly.bagController->invalidate(); }
  ConnectionServices(const ConnectionServices&) = delete;
  ConnectionServices& operator=(const ConnectionServices&) = delete;

  std::shared_ptr<ClientConnection::Environment> env;

 private:
  TestAssembly& t_;
  platform::ipc::UniqueFd refused_;
};

}  // namespace tavix::testing
