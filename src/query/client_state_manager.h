// ClientStateManager: one ClientState per client identifier for the life of the process, so that
// every connection of a client (a reconnect too) shares its bag, caches and feedback session.
// With "TVXPersistSessions" set, the known clients (identifier and user agent) are kept under the
// defaults key "sessions" and their states are made again at the next start.
//
// Threading: the state table lives on the serial queue "com.norvel.tavixd.stateCache";
// stateForClientIdentifier() and sessions() enter it synchronously (never call them from it),
// saveState() asynchronously (only while the manager is held by a shared_ptr).
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/dispatch.h"
#include "platform/property_value.h"

namespace tavix {

class ClientState;
namespace platform {
class UserDefaults;
}

class ClientStateManager : public std::enable_shared_from_this<ClientStateManager> {
 public:
  // Makes the state of a client identifier. A function rather than the state's own peers: the
  // manager only keeps states and never looks inside one.
  using MakeState = std::function<std::shared_ptr<ClientState>(const std::string& identifier)>;

  // The pool must outlive it. Loads the persisted states.
  ClientStateManager(platform::DispatchPool& pool, std::shared_ptr<platform::UserDefaults> defaults,
                     MakeState makeState);
  ClientStateManager(const ClientStateManager&) = delete;
  ClientStateManager& operator=(const ClientStateManager&) = delete;

  // The state of `identifier`, made on first use; none (and a fault) for an empty identifier.
  std::shared_ptr<ClientState> stateForClientIdentifier(const std::string& identifier);

  // Every state with a user agent, as {"identifier", "agent"} dictionaries.
  platform::PropertyValue::Array sessions();

  void loadState();
  void saveState();

  bool persistSessions() const { return persistSessions_; }
  // Unused by design: kept as a field with its initial value of 10.
  int connectSemaphoreValue() const { return connectSemaphore_; }

 private:
  platform::PropertyValue::Array sessionsOnQueue();

  std::shared_ptr<platform::UserDefaults> defaults_;
  MakeState makeState_;
  const int connectSemaphore_ = 10;
  const bool persistSessions_;
  platform::SerialQueue stateCacheQueue_;
  std::map<std::string, std::shared_ptr<ClientState>> stateCache_;  // on stateCacheQueue_
};

}  // namespace tavix
