#include "feedback/client_session_manager.h"

#include "bagview/tvx_bag.h"
#include "context/user_guid_controller.h"
#include "core/logging.h"
#include "bagview/user_agent.h"
#include "feedback/vocabulary.h"
#include "platform/defaults.h"
#include "platform/notification_center.h"
#include "platform/transactions.h"

namespace tavix {

namespace {

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategorySession); }

// The user GUID lives 900 s; a session must end before it rotates.
constexpr std::int64_t kGuidExpiration = 900;
constexpr std::int64_t kDefaultSoftLimit = 600;
constexpr std::int64_t kDefaultIdleTime = 180;

}  // namespace

// ---- ClientSessionShared --------------------------------------------------------------------

ClientSessionShared::ClientSessionShared(FeedbackEnvironment env, FeedbackRef first, int previousSessionEndReason)
    : env_(std::move(env)),
      previousSessionEndReason_(previousSessionEndReason),
      queue_(*env_.pool, "com.norvel.tavixd.clientSessionSharedQueue") {
  if (first && !first->user_guid().empty()) userGuid_ = first->user_guid();
  const std::string agent = first ? first->user_agent() : std::string();
  sessionMap_[agent] = ClientSession::open(env_, first, previousSessionEndReason);
}

void ClientSessionShared::addFeedback(const FeedbackRef& feedback) {
  queue_.async([this, feedback] {
    if (!feedback || feedback->user_agent().empty()) return;
    auto it = sessionMap_.find(feedback->user_agent());
    if (it != sessionMap_.end()) {
      it->second->addFeedback(feedback);
    } else {
      sessionMap_[feedback->user_agent()] = ClientSession::open(env_, feedback, previousSessionEndReason_);
    }
  });
}

void ClientSessionShared::enumerateSessionsUsingBlock(const std::function<void(ClientSession&)>& block) {
  if (!block) return;
  queue_.sync([&] {
    for (auto& [agent, session] : sessionMap_) block(*session);
  });
}

// ---- ClientSessionManager -------------------------------------------------------------------

ClientSessionManager::ClientSessionManager(Environment env, std::shared_ptr<TavixUserGUIDController> guidController,
                                           std::shared_ptr<TVXInMemoryBagSource> bag, std::string identifier)
    : env_(std::move(env)),
      guidController_(std::move(guidController)),
      bag_(std::move(bag)),
      identifier_(std::move(identifier)),
      sessionQueue_(*env_.feedback.pool, "com.norvel.tavixd.clientSessionManagerQueue") {
  const std::int64_t soft = env_.feedback.defaults->integerForKey("TVXSessionSoftLimitOverride");
  if (soft < 1) {
    log().error("Soft limit override value must be greater than 0 : {} defaulting to {}", soft, kDefaultSoftLimit);
    softLimitTime_ = kDefaultSoftLimit;
  } else if (soft >= kGuidExpiration) {
    log().error("Soft limit override value must be less than guid expiration {} : {} defaulting to {}",
                kGuidExpiration, soft, kDefaultSoftLimit);
    softLimitTime_ = kDefaultSoftLimit;
  } else {
    softLimitTime_ = soft;
  }
  const std::int64_t idle = env_.feedback.defaults->integerForKey("TVXSessionIdleTimeOverride");
  if (idle < 1) {
    log().error("Idle limit override value must be greater than 0 : {} defaulting to {}", idle, kDefaultIdleTime);
    idleTime_ = kDefaultIdleTime;
  } else {
    idleTime_ = idle;
  }
  maxTime_ = kGuidExpiration - softLimitTime_;
  if (env_.sharedSession) {
    log().info("Tavix is using shared session for all clients {}", identifier_);
  } else {
    log().info("Tavix is using individual session for clients {}", identifier_);
  }
  log().debug("Idle Time {} Soft Limit Time {} Max Time {}", idleTime_, softLimitTime_, maxTime_);
}

ClientSessionManager::~ClientSessionManager() {
  for (auto& [id, timer] : timers_) timer.cancel();
}

void ClientSessionManager::addTavixFeedback(FeedbackRef feedback) {
  if (!feedback) return;
  auto transaction = std::make_shared<platform::TransactionTracker::Transaction>();
  if (env_.transactions) *transaction = env_.transactions->begin("addFeedback");
  sessionQueue_.async([self = shared_from_this(), feedback = std::move(feedback), transaction] { self->accept(feedback); });
}

void ClientSessionManager::addTavixFeedbackMadeBy(std::function<FeedbackRef()> make) {
  auto transaction = std::make_shared<platform::TransactionTracker::Transaction>();
  if (env_.transactions) *transaction = env_.transactions->begin("addFeedback");
  sessionQueue_.async([self = shared_from_this(), make = std::move(make), transaction] {
    if (auto feedback = make()) self->accept(feedback);
  });
}

void ClientSessionManager::accept(const FeedbackRef& feedback) {
  sessionQueue_.assertCurrent("ClientSessionManager::accept");
  if (feedbackObserver_) feedbackObserver_(*feedback);
  if (!feedbackEnabledFor(feedback->user_agent())) return;
  const platform::TimePoint now = env_.feedback.clock->now();
  feedback->set_user_guid(guidController_ ? guidController_->currentUserGUID() : std::string());
  if (currentState_ != kNoSession && sessionGuid() != feedback->user_guid()) {
    updateState(kGuidChanged, feedback);
  } else if (currentState_ != kActive && currentState_ != kNoSession) {
    const int type = feedbackType(*feedback);
    if (type == kFeedbackTypeVisibleResults || type == kFeedbackTypeCardEngagement) {
      updateState(kSentinelFeedback, feedback);
    } else if (expirationTime_ <= now) {
      updateState(kIdleAfterSoftLimit, feedback);
    } else {
      updateState(kFeedbackAdded, feedback);
    }
  } else {
    updateState(kFeedbackAdded, feedback);
  }
  expirationTime_ = now + platform::seconds(static_cast<double>(idleTime_));
}

void ClientSessionManager::flushSession(std::function<void()> done) {
  sessionQueue_.async([self = shared_from_this(), done = std::move(done)] {
    self->updateState(kExternalRequest, nullptr, done);
  });
}

void ClientSessionManager::flushSessionInvalidationWithAgent(const std::string& agent,
                                                             std::function<void(bool)> callback) {
  if (env_.sharedSession) {
    proto::CTConnectionInvalidatedFeedback invalidated;
    invalidated.set_timestamp(hostTicksNow(env_.feedback.clock));
    addTavixFeedback(makeTavixFeedbackWithCodable(invalidated, 0, "", agent));
    if (callback) callback(false);
    return;
  }
  flushSession([callback = std::move(callback)] {
    if (callback) callback(true);
  });
}

void ClientSessionManager::reportErrorAsTavixdFeedback(int code, const std::string& domain, const std::string& reason) {
  addTavixFeedback(makeDaemonErrorFeedback(code, domain, reason, env_.feedback));
}

bool ClientSessionManager::feedbackEnabledFor(const std::string& userAgent) const {
  // Without a bag nothing says no: feedback is kept until the first bag arrives.
  if (!bag_) return true;
  auto bag = bag_->inMemoryBag();
  if (!bag) return true;
  return TVXBag(bag->sharedRawBag(), userAgent).feedbackEnabled();
}

unsigned ClientSessionManager::currentState() {
  unsigned state = 0;
  sessionQueue_.sync([&] { state = currentState_; });
  return state;
}

bool ClientSessionManager::hasSession() {
  bool open = false;
  sessionQueue_.sync([&] { open = single_ || shared_; });
  return open;
}

std::size_t ClientSessionManager::pendingTimers() {
  std::size_t count = 0;
  sessionQueue_.sync([&] { count = timers_.size(); });
  return count;
}

std::string ClientSessionManager::sessionGuid() const {
  if (shared_) return shared_->userGuid();
  return single_ ? single_->userGuid() : std::string();
}

void ClientSessionManager::updateState(unsigned event, const FeedbackRef& feedback, std::function<void()> callback) {
  sessionQueue_.assertCurrent("ClientSessionManager::updateState");
  auto addToSession = [this](const FeedbackRef& f) {
    if (shared_) shared_->addFeedback(f);
    if (single_) single_->addFeedback(f);
  };
  switch (event) {
    case kFeedbackAdded:
      if (currentState_ == kActive || currentState_ == kSoftLimitReached) {
        addToSession(feedback);
      } else if (currentState_ == kNoSession) {
        setNewSession(feedback);
        currentState_ = kActive;
      } else {
        log().debug("Avoided adding feedback in state {}", currentState_);
      }
      break;
    case kSoftLimitReachedEvent:
      if (currentState_ == kActive) currentState_ = kSoftLimitReached;
      break;
    case kMaxTimerExpired:
      if (currentState_ == kSoftLimitReached) {
        flushSessionWithReason(4, [this] { log().notice("session flushed because max timer expired {}", identifier_); });
        currentState_ = kNoSession;
      }
      break;
    case kExternalRequest:
      if (currentState_ <= kNoSession) {
        flushSessionWithReason(2, std::move(callback));
        currentState_ = kNoSession;
        return;
      }
      break;
    case kIdleAfterSoftLimit:
      if (currentState_ == kSoftLimitReached) {
        flushSessionWithReason(3);
        log().notice("session flushed because soft limit reached and idle time was beyond {} {}", idleTime_, identifier_);
        if (guidController_) {
          guidController_->reset();
          feedback->set_user_guid(guidController_->currentUserGUID());
        }
        setNewSession(feedback);
        currentState_ = kActive;
      }
      break;
    case kGuidChanged:
      if (currentState_ == kActive || currentState_ == kSoftLimitReached) {
        flushSessionWithReason(5);
        log().notice("session flushed because guid changed {}", identifier_);
        setNewSession(feedback);
        currentState_ = kActive;
      }
      break;
    case kSentinelFeedback:
      if (currentState_ == kSoftLimitReached) {
        addToSession(feedback);
        flushSessionWithReason(7);
        log().notice("session flushed because soft limit reached and sentinel feedback received");
        if (guidController_) guidController_->reset();
        currentState_ = kNoSession;
      }
      break;
    default:
      log().debug("External event received {}", event);
      break;
  }
  if (callback) callback();
}

void ClientSessionManager::setNewSession(const FeedbackRef& feedback) {
  ++sessionCounter_;
  if (env_.sharedSession) {
    shared_ = std::make_shared<ClientSessionShared>(env_.feedback, feedback, flushReason_);
  } else {
    single_ = ClientSession::open(env_.feedback, feedback, flushReason_);
  }
  log().notice("new session id {} {}", sessionCounter_, identifier_);
  // Fixed at 600 s whatever the soft-limit override: the override only moves maxTime.
  const std::uint64_t expected = sessionCounter_;
  schedule(platform::seconds(600), [expected](ClientSessionManager& self) {
    log().notice("soft limit reached expected {} current {} {}", expected, self.sessionCounter_, self.identifier_);
    if (expected == self.sessionCounter_) self.onSoftLimitReached();
  });
}

void ClientSessionManager::schedule(platform::Duration delay, std::function<void(ClientSessionManager&)> task) {
  sessionQueue_.assertCurrent("ClientSessionManager::schedule");
  // A fired timer forgets its handle: the table holds only the timers still to come.
  const std::uint64_t id = ++lastTimerId_;
  std::weak_ptr<ClientSessionManager> weak = weak_from_this();
  timers_[id] = env_.feedback.clock->after(delay, sessionQueue_, [weak, id, task = std::move(task)] {
    auto self = weak.lock();
    if (!self) return;
    self->timers_.erase(id);
    task(*self);
  });
}

void ClientSessionManager::onSoftLimitReached() {
  if (!single_ && !shared_) return;
  updateState(kSoftLimitReachedEvent, nullptr);
  log().notice("soft limit reached, maxtimer session id {} {}", sessionCounter_, identifier_);
  if (auto center = env_.center) {
    sessionQueue_.async([center] { center->post(kTVXSessionSoftLimitNotification); });
  }
  const std::uint64_t expected = sessionCounter_;
  schedule(platform::seconds(static_cast<double>(maxTime_)), [expected](ClientSessionManager& self) {
    log().notice("max timer expired expected {} current {}", expected, self.sessionCounter_);
    if (expected == self.sessionCounter_) {
      // Its own session already ended: nothing to close and nothing to announce.
      if (!self.single_ && !self.shared_) return;
      self.updateState(kMaxTimerExpired, nullptr);
    }
    // Posted also for an earlier session's timer: listeners clear their caches at this point.
    if (auto center = self.env_.center) center->post(kTVXSessionMaxLimitNotification);
  });
}

void ClientSessionManager::flushSessionWithReason(int reason, std::function<void()> callback) {
  if (single_ || shared_) {
    flushReason_ = reason;
    auto close = [this, reason](ClientSession& session) {
      if (reason != 0) {
        proto::CTSessionEndFeedback end;
        end.set_timestamp(hostTicksNow(env_.feedback.clock));
        end.set_reason(static_cast<proto::SessionEndReason::Value>(reason));
        session.addFeedback(makeTavixFeedbackWithCodable(end, 0, session.userGuid(), session.agent()));
      }
      session.sessionComplete();
    };
    if (shared_) shared_->enumerateSessionsUsingBlock(close);
    if (single_) close(*single_);
    single_.reset();
    shared_.reset();
  }
  if (callback) callback();
}

void ClientSessionManager::currentSessionFeedbacks(std::function<void(std::vector<std::string>)> done) {
  auto self = shared_from_this();
  sessionQueue_.async([self, done = std::move(done)] {
    std::vector<std::string> all;
    auto gather = [&all](ClientSession& session) {
      auto some = session.feedbacksWithRelativeTimestamp();
      all.insert(all.end(), std::make_move_iterator(some.begin()), std::make_move_iterator(some.end()));
    };
    if (self->shared_) self->shared_->enumerateSessionsUsingBlock(gather);
    if (self->single_) gather(*self->single_);
    done(std::move(all));
  });
}

}  // namespace tavix
