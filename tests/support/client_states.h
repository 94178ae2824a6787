// Client states on a test assembly, with the environment start-up would give them.
#pragma once

#include <memory>
#include <string>

#include "context/location.h"
#include "feedback/client_session_manager.h"
#include "query/client_state.h"
#include "query/client_state_manager.h"
#include "support/test_assembly.h"

namespace tavix::testing {

// The assembly's services as they are now, with a location manager on the defaults.
inline std::shared_ptr<const ClientState::Environment> clientStateEnvironment(TestAssembly& t) {
  auto& a = t.assembly;
  auto env = std::make_shared<ClientState::Environment>();
  env->pool = &t.pool;
  env->clock = a.clock;
  env->defaults = t.defaults;
  env->center = t.center;
  env->requestFactory = a.requestFactory;
  env->bagController = a.bagController;
  env->engagedCompletionCache = a.engagedCompletionCache;
  env->locationManager = std::make_shared<DefaultsLocationManager>(*t.defaults, *a.clock, t.pool);
  env->session = a.urlSession();
  env->guidController = a.guidController;
  env->sessionManager = a.clientSessionManager;
  env->sessions = sessionManagerEnvironment(a);
  return env;
}

// A client state manager whose states share one environment, taken now.
inline std::shared_ptr<ClientStateManager> makeClientStateManager(TestAssembly& t) {
  return std::make_shared<ClientStateManager>(
      t.pool, t.defaults, [env = clientStateEnvironment(t)](const std::string& identifier) {
        return ClientState::create(env, identifier);
      });
}

}  // namespace tavix::testing
