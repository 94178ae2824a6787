#include "query/client_state_manager.h"

#include "core/logging.h"
#include "platform/defaults.h"
#include "query/client_state.h"

namespace tavix {

namespace {

platform::Logger& sessionLog() { return TavixLogForCategory(TavixLoggingCategorySession); }

std::optional<std::string> stringEntry(const platform::Dictionary& dictionary, const char* key) {
  auto it = dictionary.find(key);
  if (it == dictionary.end() || !it->second.string()) return std::nullopt;
  return *it->second.string();
}

}  // namespace

ClientStateManager::ClientStateManager(platform::DispatchPool& pool, std::shared_ptr<platform::UserDefaults> defaults,
                                       MakeState makeState)
    : defaults_(std::move(defaults)),
      makeState_(std::move(makeState)),
      persistSessions_(defaults_->boolForKey("TVXPersistSessions")),
      stateCacheQueue_(pool, "com.norvel.tavixd.stateCache") {
  loadState();
}

std::shared_ptr<ClientState> ClientStateManager::stateForClientIdentifier(const std::string& identifier) {
  if (identifier.empty()) {
    sessionLog().fault("client session identifier cannot be nil or empty");
    return nullptr;
  }
  std::shared_ptr<ClientState> state;
  stateCacheQueue_.sync([&] {
    auto& slot = stateCache_[identifier];
    if (!slot) slot = makeState_(identifier);
    state = slot;
  });
  sessionLog().info("using client state: {}", identifier);
  return state;
}

void ClientStateManager::loadState() {
  if (!persistSessions_) return;
  auto value = defaults_->objectForKey("sessions");
  if (!value || !value->array()) return;
  for (const auto& element : *value->array()) {
    if (!element.dictionary()) continue;
    auto identifier = stringEntry(*element.dictionary(), "identifier");
    if (!identifier) continue;
    auto state = makeState_(*identifier);
    state->setUserAgent(stringEntry(*element.dictionary(), "agent"));
    stateCache_[*identifier] = std::move(state);
  }
}

platform::PropertyValue::Array ClientStateManager::sessionsOnQueue() {
  platform::PropertyValue::Array sessions;
  for (const auto& [identifier, state] : stateCache_) {
    auto agent = state->userAgent();
    if (!agent) continue;  // nothing to recreate a state from
    sessions.emplace_back(platform::Dictionary{{"identifier", identifier}, {"agent", *agent}});
  }
  return sessions;
}

platform::PropertyValue::Array ClientStateManager::sessions() {
  platform::PropertyValue::Array result;
  stateCacheQueue_.sync([&] { result = sessionsOnQueue(); });
  return result;
}

void ClientStateManager::saveState() {
  if (!persistSessions_) return;
  std::weak_ptr<ClientStateManager> weak = weak_from_this();
  stateCacheQueue_.async([weak] {
    auto self = weak.lock();
    if (!self) return;
    self->defaults_->setObject("sessions", self->sessionsOnQueue());
    self->defaults_->synchronize();
  });
}

}  // namespace tavix
