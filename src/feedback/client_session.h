// One feedback session of one client: a header (who, first use of the day, resource versions,
// why the previous session ended) and its events, appended to the session's file as they come.
// When sent, it yields the upload record: events oldest first, relative time stamps, session-local
// identifiers, objects missing in full at the head, wrapped in seven keys.
//
// Threading: owns the serial queue "com.norvel.tavixd.clientSessionQueue". addFeedback() runs on
// the caller's queue (the session manager's) and relies on the file container for ordering;
// sessionComplete() and getSessionFeedbacks() hop onto the session queue synchronously.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "feedback/tavix_feedback.h"
#include "platform/clock.h"
#include "platform/dispatch.h"

namespace tavix {

class FileContainer;
class ResourceVersionsProvider;
class TavixPersistentStorage;
class TavixUserGUIDController;
namespace platform {
class UserDefaults;
}

// What a feedback session works with. The pool and clock must outlive every session.
struct FeedbackEnvironment {
  platform::DispatchPool* pool = nullptr;
  platform::Clock* clock = nullptr;
  std::shared_ptr<platform::UserDefaults> defaults;  // first-use dates
  // Where sessions are written. Null: a session is kept in memory only (read-back and tests).
  std::shared_ptr<TavixPersistentStorage> storage;
  // Stamps the daemon's own error events; null: they carry no GUID.
  std::shared_ptr<TavixUserGUIDController> guid;
  // The versions each new session records; null until a download manager provides them.
  std::shared_ptr<ResourceVersionsProvider> resourceVersions;
};

// "TavixFirstUseOfTheDay_<client>" for the first of brovane, seekara, lookup, messages, news,
// vocly that the lower-cased agent contains; none otherwise.
std::optional<std::string> firstUseKeyForAgent(std::string_view agent);

// An error event of the daemon itself: query id 0, the current GUID, the daemon's user agent,
// stamped now.
FeedbackRef makeDaemonErrorFeedback(proto::CTErrorFeedback error, const FeedbackEnvironment& env);
FeedbackRef makeDaemonErrorFeedback(std::int64_t code, const std::string& domain, const std::string& reason,
                                    const FeedbackEnvironment& env);

class ClientSession {
 public:
  // A bare session: sessionStart = now, version = tavixdSessionFileVersion(). Used for read-back.
  explicit ClientSession(FeedbackEnvironment env);
  ClientSession(const ClientSession&) = delete;
  ClientSession& operator=(const ClientSession&) = delete;

  // Opens a session: header from the first event, first-use bookkeeping, a new session file
  // with the header written, then the first event (when given) added.
  static std::shared_ptr<ClientSession> open(const FeedbackEnvironment& env, FeedbackRef first, int previousSessionEndReason = 1);
  // A session of its own whose first event is an error (query id 0, the current GUID, the
  // daemon's user agent), completed at once: how a failure that belongs to no client's session
  // is reported.
  static void createFeedbackSessionFromError(std::int64_t code, const std::string& domain, const std::string& reason,
                                             const FeedbackEnvironment& env);
  static void createFeedbackSessionFromError(proto::CTErrorFeedback error, const FeedbackEnvironment& env);
  // A session read back from a file.
  static std::shared_ptr<ClientSession> fromRecord(const FeedbackEnvironment& env, proto::CTClientSession record);

  // Appends to the session file; an event whose GUID differs from the session's is followed by
  // a "different guid in session" error event (code 500).
  void addFeedback(const FeedbackRef& feedback);
  // Hands the file to persistent storage as a waiting session.
  void sessionComplete();

  // The record's events, oldest first.
  std::vector<FeedbackRef> getSessionFeedbacks();
  // The upload record as JSON text: "fb", "agent", "user_guid", "resource_versions",
  // "first_use", "base_time", "previous_session_end_reason".
  std::string getFeedbacksToSend();
  // The dictionary forms (JSON texts) after privacy filtering of `events`, missing suggestions and
  // missing results first.
  std::vector<std::string> privacyFilteredFeedbacksWithRelativeTimestamp(const std::vector<FeedbackRef>& events);
  // The dictionary (JSON) forms of the session's events with their relative time stamps, as the
  // client's feedback call shows them; events that do not serialise are left out.
  std::vector<std::string> feedbacksWithRelativeTimestamp();

  std::string agent() const;
  const std::string& userGuid() const { return userGuid_; }  // empty unless the stored string is a valid UUID
  bool firstUseOfTheDay() const;
  int previousSessionEndReason() const;
  const proto::CTClientSession& backingStore() const { return backingStore_; }
  std::shared_ptr<FileContainer> storageHandle() const { return std::atomic_load(&storageHandle_); }
  // The file a session read back for sending came from.
  void setStorageHandle(std::shared_ptr<FileContainer> handle) { std::atomic_store(&storageHandle_, std::move(handle)); }

 private:
  void recordFirstUse(platform::TimePoint time);
  void takeUserGuid();

  FeedbackEnvironment env_;
  proto::CTClientSession backingStore_;
  std::string userGuid_;
  std::shared_ptr<FileContainer> storageHandle_;
  platform::SerialQueue sessionQueue_;
};

}  // namespace tavix
