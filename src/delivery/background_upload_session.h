// The background upload session: uploads from files that outlive the daemon.
//
// Each task is written to a transfer journal (a folder under the caches folder, see
// transfer_journal.h) with a copy of its body before it reaches the transport, and is removed from
// it once the server has answered or the transfer has failed. A task that was still on its way
// when the process stopped is found in the journal by resumePendingTasks() at the next start and
// sent again. Failures are final: the delegate hears of them and the entry is forgotten; only a
// transfer cancelled because the transport went away stays for the next start.
//
// Threading: owns the serial queue "com.norvel.tavixd.uploadsession"; the task table lives there.
// Every public method is safe from any thread. Delegate calls and getAllTasks() callbacks run on
// that queue. Must be owned by a shared_ptr.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/http/transfer_journal.h"
#include "platform/http/url_request.h"

namespace tavix::platform::http {
class URLSession;
class URLSessionDataTask;
}  // namespace tavix::platform::http

namespace tavix {

class BackgroundUploadSession : public std::enable_shared_from_this<BackgroundUploadSession> {
 public:
  struct TaskInfo {
    std::uint64_t taskIdentifier = 0;
    std::string url;
    // Attached by the creator and handed back at completion; none when it attached nothing.
    std::optional<std::int64_t> numberOfFeedbacks;
  };

  class Delegate {
   public:
    virtual ~Delegate() = default;
    // The server answered (`response`) or the transfer failed (`error`).
    virtual void taskDidComplete(const TaskInfo& task, const std::optional<platform::http::HTTPURLResponse>& response,
                                      const std::optional<platform::http::URLError>& error) = 0;
    // The whole body went out (this transport reports no finer progress).
    virtual void taskDidSendBodyData(const TaskInfo& task, std::int64_t totalBytesSent,
                                 std::int64_t totalBytesExpectedToSend) = 0;
  };

  // `transport` moves the bytes; `journalDirectory` is created (0700) when missing.
  static std::shared_ptr<BackgroundUploadSession> create(std::shared_ptr<platform::http::URLSession> transport,
                                                         platform::fs::path journalDirectory,
                                                         platform::DispatchPool& pool);
  ~BackgroundUploadSession();
  BackgroundUploadSession(const BackgroundUploadSession&) = delete;
  BackgroundUploadSession& operator=(const BackgroundUploadSession&) = delete;

  // Held weakly; set before tasks are made.
  void setDelegate(std::weak_ptr<Delegate> delegate);

  // Sends again, asynchronously, every task the journal still holds from an earlier process.
  void resumePendingTasks();

  // Asynchronously: the tasks not yet completed, in creation order.
  void getAllTasks(std::function<void(std::vector<TaskInfo>)> callback);

  // Journals the request with a copy of `bodyFile` and starts it. Synchronous on the queue (runs
  // in place when called from it, e.g. from a getAllTasks() callback); the task's identifier, or
  // none when the body cannot be read or journalled.
  std::optional<std::uint64_t> uploadTask(platform::http::URLRequest request, const platform::fs::path& bodyFile,
                                          std::optional<std::int64_t> numberOfFeedbacks);

  const platform::fs::path& journalDirectory() const { return journal_.directory(); }
  platform::SerialQueue& queue() { return queue_; }

 private:
  struct Entry {
    TaskInfo info;
    std::string journalName;
    std::shared_ptr<platform::http::URLSessionDataTask> task;
  };

  BackgroundUploadSession(std::shared_ptr<platform::http::URLSession> transport, platform::fs::path journal,
                          platform::DispatchPool& pool);
  // On queue_: starts the transfer of a journalled request.
  void start(const std::string& journalName, platform::http::URLRequest request, std::string body,
             std::optional<std::int64_t> numberOfFeedbacks);
  void completed(std::uint64_t taskIdentifier, std::optional<platform::http::HTTPURLResponse> response,
                 std::optional<platform::http::URLError> error);  // on queue_

  std::shared_ptr<platform::http::URLSession> transport_;
  platform::http::TransferJournal journal_;  // on queue_
  platform::SerialQueue queue_;
  std::weak_ptr<Delegate> delegate_;          // on queue_
  std::map<std::uint64_t, Entry> tasks_;      // on queue_, by task identifier
};

}  // namespace tavix
