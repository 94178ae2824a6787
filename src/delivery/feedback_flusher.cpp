#include "delivery/feedback_flusher.h"

#include "core/diagnostics.h"
#include "core/logging.h"
#include "delivery/flusher_ipc.h"
#include "delivery/upload_manager.h"
#include "feedback/client_session.h"
#include "feedback/persistent_storage.h"
#include "platform/activity.h"
#include "platform/defaults.h"
#include "platform/transactions.h"
#include "tavix_proto/feedback_session.pb.h"

namespace tavix {

namespace {

platform::Logger& defaultLog() { return TavixLogForCategory(TavixLoggingCategoryDefault); }
platform::Logger& flusherLog() { return TavixLogForCategory(TavixLoggingCategoryFlusher); }

}  // namespace

std::shared_ptr<TavixFeedbackFlusher> TavixFeedbackFlusher::create(Environment env) {
  return std::shared_ptr<TavixFeedbackFlusher>(new TavixFeedbackFlusher(std::move(env)));
}

TavixFeedbackFlusher::TavixFeedbackFlusher(Environment env)
    : env_(std::move(env)),
      queueBuffer_(*env_.feedback.pool, "com.norvel.tavixd.tavixDataBufferQueue"),
      feedbackCountQueue_(*env_.feedback.pool, "com.norvel.tavixd.feedbackCountQueue") {}

TavixFeedbackFlusher::~TavixFeedbackFlusher() = default;

void TavixFeedbackFlusher::handlePeriodicFlushActivity(const platform::UserDefaults& defaults, Environment env,
                                                       const std::shared_ptr<platform::Activity>& activity) {
  if (defaults.boolForKey("TVXFeedbackFlushDisabled")) {
    defaultLog().debug(
        "Flusher bailing because periodic flush is disabled. Dump feedback with tavix_tool to re-enable.");
    return;
  }
  defaultLog().debug("Flushing Tavix feedback.");
  create(std::move(env))->performPeriodicFlushActivity(activity);
}

void TavixFeedbackFlusher::performPeriodicFlushActivity(const std::shared_ptr<platform::Activity>& activity) {
  if (activity->state() != platform::ActivityState::Run) {
    defaultLog().fault("Bailing on periodic flush because background activity state != RUN");
    return;
  }
  if (!activity->setState(platform::ActivityState::Continue)) {
    defaultLog().fault("Error transitioning ACTIVITY_STATE_CONTINUE");
  }
  forceFlushWithCompletion([activity] {
    if (!activity->setState(platform::ActivityState::Done)) {
      defaultLog().fault("Error transitioning ACTIVITY_STATE_DONE");
    }
    defaultLog().notice("All periodic flush tasks completed.");
  });
}

void TavixFeedbackFlusher::forceFlushWithCompletion(std::function<void()> completion) {
  auto transaction = std::make_shared<platform::TransactionTracker::Transaction>();
  if (env_.transactions) *transaction = env_.transactions->begin("com.norvel.tavixd.feedbackFlusherTx");
  // One queue per run: files are read and deleted one at a time, in list order.
  auto runQueue = std::make_shared<platform::SerialQueue>(*env_.feedback.pool, "com.norvel.tavixd.feedbackFlusherQueue");
  // The run is over once every session it took is either on its way or given back.
  runGroup_ = std::make_shared<platform::DispatchGroup>(*runQueue, [runQueue, transaction, completion = std::move(completion)] {
    if (completion) completion();
    transaction->reset();
  });
  auto channel = env_.channel.lock();
  auto storage = env_.feedback.storage;
  const auto files = storage ? storage->getAvailableSessionHandles() : std::vector<std::shared_ptr<FileContainer>>{};
  auto self = shared_from_this();
  for (const auto& file : files) {
    runQueue->async([self, file, storage, channel] {
      // Taken by rename, so that a dump and a periodic run never send one session twice.
      auto claimed = storage->claimSessionWithFileContainer(file);
      if (!claimed) return;
      std::shared_ptr<ClientSession> session;
      if (auto record = claimed->readRecord()) session = ClientSession::fromRecord(self->env_.feedback, std::move(*record));
      if (!session) {
        // Unreadable files (too large, another version, empty, corrupt) go: they never would be.
        storage->deleteSessionWithFileContainer(claimed);
        return;
      }
      session->setStorageHandle(claimed);
      self->flushSyncFromArray({session});
      std::vector<std::string> bodies;
      self->flushToWireSync(channel ? &bodies : nullptr);
      if (channel && !bodies.empty()) channel->sendDataToSendingStreamListener(std::move(bodies));
    });
  }
  runQueue->async([group = runGroup_] { group->leave(); });
}

void TavixFeedbackFlusher::flush(std::shared_ptr<ClientSession> session, std::function<void()> callback) {
  queueBuffer_.async([self = shared_from_this(), session = std::move(session), callback = std::move(callback)] {
    self->sessionBuffer_.push_back(session);
    if (callback) callback();
  });
}

void TavixFeedbackFlusher::flushSyncFromArray(std::vector<std::shared_ptr<ClientSession>> sessions) {
  queueBuffer_.async([self = shared_from_this(), sessions = std::move(sessions)] {
    self->sessionBuffer_.insert(self->sessionBuffer_.end(), sessions.begin(), sessions.end());
  });
}

void TavixFeedbackFlusher::flushToWireSync(std::vector<std::string>* returned) {
  queueBuffer_.sync([&] {
    auto bodies = flushToWireWithObjectsReturned(returned != nullptr);
    if (returned) returned->insert(returned->end(), std::make_move_iterator(bodies.begin()), std::make_move_iterator(bodies.end()));
  });
}

void TavixFeedbackFlusher::flushToWireAsync(std::function<void(std::vector<std::string>)> callback) {
  queueBuffer_.async([self = shared_from_this(), callback = std::move(callback)] {
    auto bodies = self->flushToWireWithObjectsReturned(static_cast<bool>(callback));
    // The key is the connection counter's; kept as the counter has always been fed.
    TavixDiagnosticDataReporter::addValue(static_cast<std::int64_t>(bodies.size()), "com.norvel.tavixd.clientconnection");
    if (callback) callback(std::move(bodies));
  });
}

std::vector<std::string> TavixFeedbackFlusher::flushToWireWithObjectsReturned(bool returnObjects) {
  queueBuffer_.assertCurrent("TavixFeedbackFlusher::flushToWireWithObjectsReturned");
  flusherLog().debug("Sessions Flushed {}", sessionBuffer_.size());
  std::vector<std::string> bodies;
  auto uploads = env_.uploads;
  auto storage = env_.feedback.storage;
  for (const auto& session : sessionBuffer_) {
    // A session read from a claimed file: the file goes once the upload is journalled (or can
    // never be sent), and is given back when the upload could not be taken this time. Either
    // way no crash loses it: a claimed file waits again at the next start.
    auto handle = session->storageHandle();
    auto group = runGroup_;
    if (group) group->enter();
    auto resolve = [storage, handle, group](UploadOutcome outcome) {
      if (storage && handle) {
        if (outcome == UploadOutcome::kNotNow) {
          storage->unclaimSessionWithFileContainer(handle);
        } else {
          storage->deleteSessionWithFileContainer(handle);
        }
      }
      if (group) group->leave();
    };
    auto file = uploads->uploadJSONFeedback(session->getFeedbacksToSend(), identifier_, std::move(resolve));
    if (!returnObjects || !file) continue;
    if (auto contents = file->readContents()) {
      bodies.push_back(std::move(*contents));
    } else {
      TavixLogForCategory(TavixLoggingCategorySession).error("error mapping tmp file {}", file->path().string());
    }
  }
  sessionBuffer_.clear();
  return bodies;
}

std::size_t TavixFeedbackFlusher::countOfDatabuffer() {
  std::size_t count = 0;
  queueBuffer_.sync([&] { count = sessionBuffer_.size(); });
  return count;
}

std::vector<std::shared_ptr<ClientSession>> TavixFeedbackFlusher::sessionBuffer() {
  std::vector<std::shared_ptr<ClientSession>> copy;
  queueBuffer_.sync([&] { copy = sessionBuffer_; });
  return copy;
}

}  // namespace tavix
