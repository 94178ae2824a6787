// Decides when feedback sessions begin and end. Every feedback event passes through
// addTavixFeedback(): it is stamped with the current user GUID and joins the open session, opens
// a new one, or closes the old one first. Sessions end at the maximum time after the soft limit
// (reason 4), when idle past the soft limit (3), on a sentinel event past the soft limit (7), on
// a GUID change (5) or on request (2); closed sessions go to persistent storage.
//
// Threading: owns the serial queue "com.norvel.tavixd.clientSessionManagerQueue"; the state
// machine, its timers and closing run only there. Public calls hop onto it asynchronously,
// except the synchronous readers. Must be owned by a shared_ptr (timers hold it weakly).
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>

#include "core/names.h"
#include "feedback/client_session.h"
#include "platform/clock.h"
#include "platform/dispatch.h"

namespace tavix {

class TavixUserGUIDController;
class TVXInMemoryBagSource;

namespace platform {
class NotificationCenter;
class TransactionTracker;
}  // namespace platform


// One session per client user agent, opened and closed together (shared sessions).
// Owns the queue "com.norvel.tavixd.clientSessionSharedQueue", always entered after the
// manager's queue, never the reverse.
class ClientSessionShared {
 public:
  ClientSessionShared(FeedbackEnvironment env, FeedbackRef first, int previousSessionEndReason = 1);
  // Asynchronous. Events without a user agent are dropped.
  void addFeedback(const FeedbackRef& feedback);
  // Synchronous; the block sees each member session.
  void enumerateSessionsUsingBlock(const std::function<void(ClientSession&)>& block);
  const std::string& userGuid() const { return userGuid_; }

 private:
  FeedbackEnvironment env_;
  std::string userGuid_;
  int previousSessionEndReason_;
  std::map<std::string, std::shared_ptr<ClientSession>> sessionMap_;
  platform::SerialQueue queue_;
};

class ClientSessionManager : public std::enable_shared_from_this<ClientSessionManager> {
 public:
  enum State : unsigned { kActive = 0, kSoftLimitReached = 1, kNoSession = 2 };
  enum Event : unsigned {
    kFeedbackAdded = 0,
    kSoftLimitReachedEvent = 1,
    kMaxTimerExpired = 2,
    kExternalRequest = 3,
    kIdleAfterSoftLimit = 4,
    kGuidChanged = 5,
    kSentinelFeedback = 6,
  };

  // Reads "TVXSessionSoftLimitOverride" and "TVXSessionIdleTimeOverride" once. `bag` (the bag
  // controller) says whether a client's feedback is enabled; without one, all of it is.
  struct Environment {
    // The sessions it opens; its pool, clock and defaults are the manager's too.
    FeedbackEnvironment feedback;
    platform::TransactionTracker* transactions = nullptr;   // may be null
    std::shared_ptr<platform::NotificationCenter> center;   // null: limits are not announced
    bool sharedSession = false;  // all clients in one session
  };
  ClientSessionManager(Environment env, std::shared_ptr<TavixUserGUIDController> guidController,
                       std::shared_ptr<TVXInMemoryBagSource> bag, std::string identifier);
  ~ClientSessionManager();
  ClientSessionManager(const ClientSessionManager&) = delete;
  ClientSessionManager& operator=(const ClientSessionManager&) = delete;

  // Asynchronous; the whole path holds the "addFeedback" transaction. Dropped when a bag is
  // loaded and the sender's view of it has feedback disabled.
  void addTavixFeedback(FeedbackRef feedback);
  // As addTavixFeedback(), with the event made by `make` on the session queue, in turn with the
  // events added before it: a caller that answers a client first hands the making over too.
  void addTavixFeedbackMadeBy(std::function<FeedbackRef()> make);
  // Sees every event as it arrives, before any filtering, on the session queue in the order the
  // events were added (the flush command channel's live stream). Set once at start, before
  // feedback flows.
  void setFeedbackObserver(std::function<void(const proto::CTTavixFeedback&)> observer) {
    feedbackObserver_ = std::move(observer);
  }
  // Asynchronous: closes the open session with reason 2, then calls `done` (also with none open).
  void flushSession(std::function<void()> done = {});
  // A client's connection went away: with shared sessions a connection-invalidated event is added
  // and `callback(false)` runs at once; otherwise the session is flushed, then `callback(true)`.
  void flushSessionInvalidationWithAgent(const std::string& agent, std::function<void(bool)> callback);

  // The open session's events (all member sessions when shared), JSON with relative time stamps;
  // `done` runs on the session queue, with an empty list when no session is open.
  void currentSessionFeedbacks(std::function<void(std::vector<std::string>)> done);

  // Wraps an error as daemon feedback (query id 0, current GUID, tavixdUserAgent()) and adds it.
  void reportErrorAsTavixdFeedback(int code, const std::string& domain, const std::string& reason);

  // Synchronous readers (not from the manager's queue).
  unsigned currentState();
  bool hasSession();
  // How many of the manager's timers are still to fire.
  std::size_t pendingTimers();
  std::int64_t softLimitTime() const { return softLimitTime_; }
  std::int64_t idleTime() const { return idleTime_; }
  std::int64_t maxTime() const { return maxTime_; }
  const std::string& identifier() const { return identifier_; }
  platform::SerialQueue& sessionQueue() { return sessionQueue_; }

 private:
  // One added event, on the session queue.
  void accept(const FeedbackRef& feedback);
  void updateState(unsigned event, const FeedbackRef& feedback, std::function<void()> callback = {});
  void setNewSession(const FeedbackRef& feedback);
  void onSoftLimitReached();
  // Runs `task` on the session queue after `delay`, unless the manager is gone by then.
  void schedule(platform::Duration delay, std::function<void(ClientSessionManager&)> task);
  void flushSessionWithReason(int reason, std::function<void()> callback = {});
  std::string sessionGuid() const;
  // Whether the loaded bag, as the client with this user agent sees it, lets feedback through.
  bool feedbackEnabledFor(const std::string& userAgent) const;

  Environment env_;
  std::shared_ptr<TavixUserGUIDController> guidController_;
  std::shared_ptr<TVXInMemoryBagSource> bag_;
  std::string identifier_;
  std::shared_ptr<ClientSession> single_;         // open session (individual mode)
  std::shared_ptr<ClientSessionShared> shared_;   // open session (shared mode)
  unsigned currentState_ = kNoSession;
  std::uint64_t sessionCounter_ = 0;
  int flushReason_ = 0;
  std::int64_t softLimitTime_ = 600;
  std::int64_t idleTime_ = 180;
  std::int64_t maxTime_ = 300;
  platform::TimePoint expirationTime_{};
  std::map<std::uint64_t, platform::TimerHandle> timers_;  // the timers still to fire, by id
  std::uint64_t lastTimerId_ = 0;
  platform::SerialQueue sessionQueue_;
  std::function<void(const proto::CTTavixFeedback&)> feedbackObserver_;
};

}  // namespace tavix
