// TavixFeedbackFlusher: moves finished sessions from disk to the server. One flusher serves one
// run: it reads each waiting session file, deletes it, turns the session into its upload record
// and hands that to the upload manager, one compressed upload per session. When the flush
// command channel exists, the compressed bodies also go to it.
//
// A run claims each file (a rename) before it reads it, so two runs never send one session, and
// deletes it only once its upload is in the upload journal; a session that could not be handed
// over this time is given back for a later run. A failed upload itself is not retried.
//
// Threading: owns the serial queue "com.norvel.tavixd.tavixDataBufferQueue" (`queueBuffer`),
// which guards the session buffer and the sending; a run reads and deletes files on a queue of
// its own. Must be owned by a shared_ptr (made by create()); a run keeps its flusher alive.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "feedback/client_session.h"
#include "platform/dispatch.h"

namespace tavix {

class TavixFlusherIPC;
class UploadManager;

namespace platform {
class Activity;
class TransactionTracker;
class UserDefaults;
}  // namespace platform

class TavixFeedbackFlusher : public std::enable_shared_from_this<TavixFeedbackFlusher> {
 public:
  struct Environment {
    // How sessions read back from disk are made; its pool runs the flusher's queues and its
    // storage holds the session files (null: nothing waits).
    FeedbackEnvironment feedback;
    std::shared_ptr<UploadManager> uploads;
    // Weak: the channel makes flushers of its own, and goes first at shutdown.
    std::weak_ptr<TavixFlusherIPC> channel;
    platform::TransactionTracker* transactions = nullptr;  // may be null
  };
  static std::shared_ptr<TavixFeedbackFlusher> create(Environment env);
  ~TavixFeedbackFlusher();
  TavixFeedbackFlusher(const TavixFeedbackFlusher&) = delete;
  TavixFeedbackFlusher& operator=(const TavixFeedbackFlusher&) = delete;

  // The periodic activity's handler: nothing at all while "TVXFeedbackFlushDisabled" is set;
  // otherwise a new flusher runs performPeriodicFlushActivity().
  static void handlePeriodicFlushActivity(const platform::UserDefaults& defaults, Environment env,
                                          const std::shared_ptr<platform::Activity>& activity);

  // Only from RUN: moves the activity to CONTINUE, flushes everything, then sets DONE.
  void performPeriodicFlushActivity(const std::shared_ptr<platform::Activity>& activity);

  // Flushes every waiting session file; `completion` runs (on the run's queue) once each is
  // journalled for upload, discarded, or given back. Holds the transaction
  // "com.norvel.tavixd.feedbackFlusherTx" until then. One run per flusher.
  void forceFlushWithCompletion(std::function<void()> completion);

  // Asynchronously on queueBuffer: appends the session, then calls `callback`.
  void flush(std::shared_ptr<ClientSession> session, std::function<void()> callback = {});
  // Asynchronously on queueBuffer (its order is what makes a following flushToWireSync see them).
  void flushSyncFromArray(std::vector<std::shared_ptr<ClientSession>> sessions);
  // Synchronously on queueBuffer: sends the buffer; when `returned` is given, the compressed
  // bodies are appended to it. Not from queueBuffer.
  void flushToWireSync(std::vector<std::string>* returned);
  // Asynchronously on queueBuffer: sends the buffer, and hands the bodies to `callback` if any.
  void flushToWireAsync(std::function<void(std::vector<std::string>)> callback = {});

  // Synchronous, not from queueBuffer.
  std::size_t countOfDatabuffer();
  std::vector<std::shared_ptr<ClientSession>> sessionBuffer();

  // The endpoint kind of the uploads (the feedback endpoint).
  int identifier() const { return identifier_; }

 private:
  explicit TavixFeedbackFlusher(Environment env);
  std::vector<std::string> flushToWireWithObjectsReturned(bool returnObjects);  // on queueBuffer_

  Environment env_;
  std::vector<std::shared_ptr<ClientSession>> sessionBuffer_;  // on queueBuffer_
  platform::SerialQueue queueBuffer_;
  // The run under way (forceFlushWithCompletion); its uploads enter it until resolved.
  std::shared_ptr<platform::DispatchGroup> runGroup_;
  // Kept for counting feedback per run; no flow uses it today.
  platform::SerialQueue feedbackCountQueue_;
  int identifier_ = 1;
};

}  // namespace tavix
