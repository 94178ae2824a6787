// The background download session: downloads that wait for their earliest begin date and
// outlive the process.
//
// Each task is written to a transfer journal (transfer_journal.h) before it is scheduled, with
// its earliest begin date, and leaves it when the server has answered, the transfer has failed or
// its owner cancelled it. A task still waiting or on its way when the process stopped is found by
// resumePendingTasks() at the next start and scheduled again for the same date. When a task that
// had a begin date starts, the delegate may replace its request (what it carries, a location say,
// may have changed while it waited).
//
// The body is held in memory (bounded by the transport's maximum) and handed to the delegate
// whole, which puts it in place; nothing half-received ever reaches the file system.
//
// Threading: every public method is safe from any thread; the task table is under a lock that is
// never held while calling out. Delegate calls run on delegateQueue(), one at a time, and
// nothing else runs there, so a delegate may wait on its own queue from them. Must be owned by a
// shared_ptr.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/http/transfer_journal.h"
#include "platform/http/url_request.h"

namespace tavix::platform {
class Logger;
}

namespace tavix::platform::http {

class URLSession;
class URLSessionDataTask;

class BackgroundDownloadSession : public std::enable_shared_from_this<BackgroundDownloadSession> {
 public:
  struct TaskInfo {
    std::uint64_t taskIdentifier = 0;
    URLRequest originalRequest;  // as it went (or will go) on the wire
    std::optional<TimePoint> earliestBeginDate;
    bool started = false;  // on the wire
    std::string currentURL;  // where the answer came from, after redirects; empty until then
    std::int64_t bytesReceived = 0;
    std::int64_t bytesExpected = -1;  // -1 while unknown
  };

  enum class DelayedRequestDisposition { ContinueLoading = 0, UseNewRequest = 1 };
  struct DelayedRequestDecision {
    DelayedRequestDisposition disposition = DelayedRequestDisposition::ContinueLoading;
    std::optional<URLRequest> newRequest;  // with UseNewRequest
  };

  class Delegate {
   public:
    virtual ~Delegate() = default;
    // A task that waited for its begin date is about to start.
    virtual DelayedRequestDecision taskWillBeginDelayedRequest(const TaskInfo& task) = 0;
    // A response came back whole (any status), with its body.
    virtual void downloadTaskDidFinish(const TaskInfo& task, const HTTPURLResponse& response,
                                       const std::string& body) = 0;
    // The task ended: after downloadTaskDidFinish, or with the transport's error, or cancelled
    // (URLErrorCancelled) by cancel().
    virtual void taskDidComplete(const TaskInfo& task, const std::optional<HTTPURLResponse>& response,
                                 const std::optional<URLError>& error) = 0;
  };

  // `transport` moves the bytes; `journalDirectory` is created (0700) when missing. The pool,
  // clock and logger must outlive the session.
  static std::shared_ptr<BackgroundDownloadSession> create(std::shared_ptr<URLSession> transport,
                                                           fs::path journalDirectory, DispatchPool& pool, Clock& clock,
                                                           Logger& logger);
  // Transfers and timers still open are stopped; their journal entries stay for the next start.
  ~BackgroundDownloadSession();
  BackgroundDownloadSession(const BackgroundDownloadSession&) = delete;
  BackgroundDownloadSession& operator=(const BackgroundDownloadSession&) = delete;

  // Held weakly; set before tasks are made.
  void setDelegate(std::weak_ptr<Delegate> delegate);

  // Schedules again every task the journal holds from an earlier process. Call once.
  void resumePendingTasks();

  // Journals `request` and starts it at `earliestBeginDate` (at once when none or past). The
  // task's identifier, or none when it could not be journalled (logged).
  std::optional<std::uint64_t> downloadTask(URLRequest request, std::optional<TimePoint> earliestBeginDate);

  // The tasks not yet completed, in creation order, with their progress.
  std::vector<TaskInfo> allTasks() const;

  // Ends the task with URLErrorCancelled (the delegate hears it) and forgets its journal entry.
  // Unknown or completed tasks are ignored.
  void cancel(std::uint64_t taskIdentifier);

  SerialQueue& delegateQueue() { return delegateQueue_; }

 private:
  struct Entry {
    TaskInfo info;
    std::string journalName;
    TimerHandle timer;
    std::shared_ptr<URLSessionDataTask> task;
  };

  BackgroundDownloadSession(std::shared_ptr<URLSession> transport, fs::path journal, DispatchPool& pool, Clock& clock,
                            Logger& logger);
  // Under lock_: adds the entry and arms its timer.
  std::uint64_t schedule(URLRequest request, std::optional<TimePoint> earliestBeginDate, std::string journalName);
  void begin(std::uint64_t taskIdentifier);  // on delegateQueue_
  void completed(std::uint64_t taskIdentifier, std::string body, std::optional<HTTPURLResponse> response,
                 std::optional<URLError> error);  // on delegateQueue_
  TaskInfo snapshot(const Entry& entry) const;
  std::shared_ptr<Delegate> delegate() const;

  std::shared_ptr<URLSession> transport_;
  Clock& clock_;
  Logger& logger_;
  SerialQueue delegateQueue_;

  mutable std::mutex lock_;  // guards the fields below
  TransferJournal journal_;
  std::weak_ptr<Delegate> delegate_;
  std::map<std::uint64_t, Entry> tasks_;
  std::uint64_t nextIdentifier_ = 1;
};

}  // namespace tavix::platform::http
