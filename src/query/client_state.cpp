// The client state's creation, its bag and its bookkeeping. The query paths live in
// client_state_search.cpp and client_state_queries.cpp.
#include "query/client_state.h"

#include <algorithm>
#include <chrono>

#include "bag/tavix_bag_controller.h"
#include "bagview/tvx_bag.h"
#include "cache/query_cache.h"
#include "context/user_guid_controller.h"
#include "core/logging.h"
#include "core/names.h"
#include "feedback/client_session_manager.h"
#include "bagview/user_agent.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"

namespace tavix {

namespace {

platform::Logger& cachingLog() { return TavixLogForCategory(TavixLoggingCategoryCaching); }
platform::Logger& sessionLog() { return TavixLogForCategory(TavixLoggingCategorySession); }

std::shared_ptr<const TVXBag> labelled(const TVXBag& bag, const std::string& userAgent) {
  return std::make_shared<const TVXBag>(bag.sharedRawBag(), userAgent);
}

}  // namespace

std::shared_ptr<ClientState> ClientState::create(std::shared_ptr<const Environment> env, std::string identifier) {
  return std::shared_ptr<ClientState>(new ClientState(std::move(env), std::move(identifier)));
}

ClientState::ClientState(std::shared_ptr<const Environment> env, std::string identifier)
    : env_(std::move(env)),
      identifier_(std::move(identifier)),
      clientShortName_(extractClientNameFromString(identifier_)),
      waitQueue_(std::make_unique<platform::SerialQueue>(*env_->pool, "com.norvel.tavixd.clientState")),
      retryQueue_(std::make_unique<platform::SerialQueue>(*env_->pool, "com.norvel.tavixd.clientState.retry")) {
  if (!env_->defaults->boolForKey("TVXNoQueryCache")) {
    queryCache_ = QueryCache::create(*env_->pool, *env_->clock, *env_->center);
    cachingLog().debug("query cache ON for {}", identifier_);
  } else {
    cachingLog().debug("query cache OFF for {}", identifier_);
  }
  if (env_->sessions.sharedSession) {
    sessionLog().debug("Tavix is using shared instance of guid controller");
    guidController_ = env_->guidController;
    sessionManager_ = env_->sessionManager;
  } else {
    guidController_ = std::make_shared<TavixUserGUIDController>(*env_->pool, *env_->clock, env_->center);
    sessionLog().debug("Tavix is using individual instance of guid controller {}",
                       static_cast<const void*>(guidController_.get()));
    sessionManager_ =
        std::make_shared<ClientSessionManager>(env_->sessions, guidController_, env_->bagController, identifier_);
  }
}

ClientState::~ClientState() { bagObserver_.reset(); }

std::optional<std::string> ClientState::userAgent() const {
  std::lock_guard lock(mutex_);
  return userAgent_;
}

void ClientState::setUserAgent(std::optional<std::string> userAgent) {
  std::lock_guard lock(mutex_);
  userAgent_ = std::move(userAgent);
  relabelBagLocked();
}

std::optional<TVXSessionConfiguration> ClientState::configuration() const {
  std::lock_guard lock(mutex_);
  return configuration_;
}

void ClientState::setConfiguration(TVXSessionConfiguration configuration) {
  std::lock_guard lock(mutex_);
  configuration_ = std::move(configuration);
}

std::shared_ptr<const TVXBag> ClientState::currentBag() const {
  std::lock_guard lock(mutex_);
  return bag_;
}

std::optional<platform::TimePoint> ClientState::lastNetworkRequest() const {
  std::lock_guard lock(mutex_);
  return lastNetworkRequest_;
}

void ClientState::markNetworkRequest() {
  const auto now = env_->clock->now();
  std::lock_guard lock(mutex_);
  lastNetworkRequest_ = now;
}

bool ClientState::isProbablyFirstLaunchEver() const {
  return !env_->defaults->objectForKey("download_resources");
}

void ClientState::relabelBagLocked() {
  if (bag_ && userAgent_) bag_ = labelled(*bag_, *userAgent_);
}

std::optional<TVXError> ClientState::adoptUserAgentLocked(const std::string& userAgent, bool* relabelled) {
  *relabelled = false;
  if (!userAgent.empty() && userAgent_ != userAgent) {
    userAgent_ = userAgent;
    relabelBagLocked();
    *relabelled = true;
  }
  if (!userAgent_) return TVXError{kTVXErrorDomain, 1, "no UserAgent"};
  return std::nullopt;
}

void ClientState::bag(const std::string& userAgent, BagReply reply) {
  bool relabelled = false;
  std::optional<TVXError> noAgent;
  std::string agent;
  {
    std::lock_guard lock(mutex_);
    noAgent = adoptUserAgentLocked(userAgent, &relabelled);
    if (!noAgent) agent = *userAgent_;
  }
  if (relabelled && queryCache_) queryCache_->removeAllObjects();
  if (noAgent) {
    reply(nullptr, noAgent);
    return;
  }
  if (auto held = currentBag()) {
    reply(held, std::nullopt);
    return;
  }
  {
    std::lock_guard lock(mutex_);
    observeBagChangesLocked();
  }
  cachingLog().info("Warming bag cache for agent: {}", agent);
  if (auto current = env_->bagController->currentBag()) {
    std::shared_ptr<const TVXBag> bag;
    {
      std::lock_guard lock(mutex_);
      if (!bag_) bag_ = labelled(*current, userAgent_.value_or(agent));
      bag = bag_;
    }
    reply(bag, std::nullopt);
    return;
  }
  markNetworkRequest();
  auto waiter = std::make_shared<BagReply>(std::move(reply));
  std::shared_ptr<const TVXBag> arrived;
  {
    std::lock_guard lock(mutex_);
    // A bag that came since the look-up above found no waiter to hand itself to.
    arrived = bag_;
    if (!arrived) bagWaiters_.push_back(waiter);
  }
  if (arrived) {
    (*waiter)(arrived, std::nullopt);
    return;
  }
  // The waiter is answered once: by the bag's arrival or by this timer, whichever takes it first.
  std::weak_ptr<ClientState> weak = weak_from_this();
  env_->clock->after(platform::seconds(bagWaitMilliseconds() / 1000.0), *waitQueue_, [weak, waiter] {
    auto self = weak.lock();
    if (!self) return;
    {
      std::lock_guard lock(self->mutex_);
      auto& waiters = self->bagWaiters_;
      auto it = std::find(waiters.begin(), waiters.end(), waiter);
      if (it == waiters.end()) return;
      waiters.erase(it);
    }
    TavixLogForCategory(TavixLoggingCategoryDefault).notice("client {} finished waiting for bag", self->identifier_);
    auto bag = self->currentBag();
    (*waiter)(bag, bag ? std::nullopt : std::optional<TVXError>(TVXError{kTVXErrorDomain, 1, "timeout"}));
  });
}

int ClientState::bagWaitMilliseconds() const {
  return isProbablyFirstLaunchEver() ? kTVXFirstLaunchBagSemaphoreWait : kTVXDefaultBagSemaphoreWait;
}

void ClientState::observeBagChangesLocked() {
  if (bagObserver_) return;
  std::weak_ptr<ClientState> weak = weak_from_this();
  bagObserver_ = env_->center->addObserver(
      kTVXBagChangeNotification, nullptr, nullptr, [weak](const platform::Notification& notification) {
        if (auto self = weak.lock()) self->bagChangeNotification(notification);
      });
}

bool ClientState::ensureBag() {
  std::string agent;
  {
    std::lock_guard lock(mutex_);
    if (!userAgent_) return false;
    if (bag_) return true;
    agent = *userAgent_;
    observeBagChangesLocked();
  }
  cachingLog().info("Warming bag cache for agent: {}", agent);
  if (auto current = env_->bagController->currentBag()) {
    std::lock_guard lock(mutex_);
    if (!bag_) bag_ = labelled(*current, userAgent_.value_or(agent));
    return true;
  }
  // currentBag() has started a fetch: wait a little for it, so that a query without a bag fails
  // fast rather than hanging.
  markNetworkRequest();
  const int waitMs = bagWaitMilliseconds();
  std::unique_lock lock(mutex_);
  if (env_->clock->waitFor(lock, bagSignal_, platform::seconds(waitMs / 1000.0), [this] { return bagSignals_ > 0; })) {
    --bagSignals_;
  }
  TavixLogForCategory(TavixLoggingCategoryDefault).notice("client {} finished waiting for bag", identifier_);
  return bag_ != nullptr;
}

void ClientState::bagChangeNotification(const platform::Notification& notification) {
  auto bag = bagOfNotification(notification, userAgent().value_or(""));
  std::vector<std::shared_ptr<BagReply>> waiters;
  std::shared_ptr<const TVXBag> held;
  {
    std::lock_guard lock(mutex_);
    if (bag) bag_ = userAgent_ && *userAgent_ != bag->userAgent() ? labelled(*bag, *userAgent_) : bag;
    ++bagSignals_;
    held = bag_;
    if (held) waiters.swap(bagWaiters_);
  }
  bagSignal_.notify_one();
  // Off the poster's thread: the waiters' replies may do anything.
  for (auto& waiter : waiters) {
    waitQueue_->async([waiter, held] { (*waiter)(held, std::nullopt); });
  }
}

void ClientState::updateClient(const std::string& userAgent) {
  // An empty agent is no agent: the state then answers "no UserAgent" and is not persisted.
  std::optional<std::string> agent;
  if (!userAgent.empty()) agent = userAgent;
  std::lock_guard lock(mutex_);
  if (userAgent_ == agent) return;
  userAgent_ = std::move(agent);
  relabelBagLocked();
  sessionLog().notice("userAgent changed to {}", userAgent_.value_or("(null)"));
}

}  // namespace tavix
