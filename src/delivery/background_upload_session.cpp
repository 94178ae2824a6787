#include "delivery/background_upload_session.h"

#include <algorithm>

#include "core/logging.h"
#include "platform/http/url_session.h"

namespace tavix {

namespace {

using platform::http::HTTPURLResponse;
using platform::http::URLError;
using platform::http::URLRequest;

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategoryUploadManager); }

constexpr const char* kNumberOfFeedbacksKey = "numberOfFeedbacks";

}  // namespace

std::shared_ptr<BackgroundUploadSession> BackgroundUploadSession::create(
    std::shared_ptr<platform::http::URLSession> transport, platform::fs::path journalDirectory,
    platform::DispatchPool& pool) {
  return std::shared_ptr<BackgroundUploadSession>(
      new BackgroundUploadSession(std::move(transport), std::move(journalDirectory), pool));
}

BackgroundUploadSession::BackgroundUploadSession(std::shared_ptr<platform::http::URLSession> transport,
                                                 platform::fs::path journal, platform::DispatchPool& pool)
    : transport_(std::move(transport)),
      journal_(std::move(journal), "upload", log()),
      queue_(pool, "com.norvel.tavixd.uploadsession") {}

BackgroundUploadSession::~BackgroundUploadSession() {
  // Transfers still running are cancelled; their journal entries stay for the next start.
  for (auto& [id, entry] : tasks_) {
    if (entry.task) entry.task->cancel();
  }
}

void BackgroundUploadSession::setDelegate(std::weak_ptr<Delegate> delegate) {
  queue_.async([self = shared_from_this(), delegate = std::move(delegate)] { self->delegate_ = delegate; });
}

void BackgroundUploadSession::resumePendingTasks() {
  queue_.async([self = shared_from_this()] {
    for (auto& record : self->journal_.load()) {
      const bool running = std::any_of(self->tasks_.begin(), self->tasks_.end(),
                                       [&](const auto& t) { return t.second.journalName == record.name; });
      if (running) continue;
      if (!record.body) {
        log().error("upload journal entry {} has no body, dropped", record.name);
        self->journal_.remove(record.name);
        continue;
      }
      std::optional<std::int64_t> count;
      if (auto it = record.values.find(kNumberOfFeedbacksKey); it != record.values.end()) {
        if (const auto* n = it->second.integer()) count = *n;
      }
      log().info("resuming upload {} to {}", record.name, record.request.url);
      self->start(record.name, std::move(record.request), std::move(*record.body), count);
    }
  });
}

void BackgroundUploadSession::getAllTasks(std::function<void(std::vector<TaskInfo>)> callback) {
  queue_.async([self = shared_from_this(), callback = std::move(callback)] {
    std::vector<TaskInfo> tasks;
    tasks.reserve(self->tasks_.size());
    for (const auto& [id, entry] : self->tasks_) tasks.push_back(entry.info);
    callback(std::move(tasks));
  });
}

std::optional<std::uint64_t> BackgroundUploadSession::uploadTask(URLRequest request,
                                                                 const platform::fs::path& bodyFile,
                                                                 std::optional<std::int64_t> numberOfFeedbacks) {
  std::string body;
  if (auto ec = platform::readFile(bodyFile, &body)) {
    log().error("cannot read upload body {}: {}", bodyFile.string(), ec.message());
    return std::nullopt;
  }
  std::optional<std::uint64_t> identifier;
  auto journalAndStart = [&] {
    platform::Dictionary values;
    if (numberOfFeedbacks) values[kNumberOfFeedbacksKey] = *numberOfFeedbacks;
    const auto name = journal_.add(request, values, body);
    if (!name) return;
    const std::size_t before = tasks_.size();
    start(*name, std::move(request), std::move(body), numberOfFeedbacks);
    if (tasks_.size() > before) identifier = std::prev(tasks_.end())->first;
  };
  if (queue_.isCurrent()) {
    journalAndStart();
  } else {
    queue_.sync(journalAndStart);
  }
  return identifier;
}

void BackgroundUploadSession::start(const std::string& journalName, URLRequest request, std::string body,
                                    std::optional<std::int64_t> numberOfFeedbacks) {
  queue_.assertCurrent("BackgroundUploadSession::start");
  request.body = std::move(body);
  request.reloadIgnoringLocalCacheData = true;
  const std::string url = request.url;
  const auto bodySize = static_cast<std::int64_t>(request.body.size());
  std::weak_ptr<BackgroundUploadSession> weak = weak_from_this();
  auto identifier = std::make_shared<std::uint64_t>(0);
  auto task = transport_->dataTask(std::move(request), [weak, identifier, bodySize](std::string, std::optional<HTTPURLResponse> response,
                                                                                    std::optional<URLError> error) {
    auto self = weak.lock();
    if (!self) return;
    self->queue_.async([self, identifier, bodySize, response = std::move(response), error = std::move(error)] {
      if (response) {
        auto it = self->tasks_.find(*identifier);
        if (auto delegate = self->delegate_.lock(); delegate && it != self->tasks_.end()) {
          delegate->taskDidSendBodyData(it->second.info, bodySize, bodySize);
        }
      }
      self->completed(*identifier, response, error);
    });
  });
  *identifier = task->taskIdentifier();
  Entry entry;
  entry.info = TaskInfo{task->taskIdentifier(), url, numberOfFeedbacks};
  entry.journalName = journalName;
  entry.task = task;
  tasks_.emplace(task->taskIdentifier(), std::move(entry));
  task->resume();
}

void BackgroundUploadSession::completed(std::uint64_t taskIdentifier, std::optional<HTTPURLResponse> response,
                                        std::optional<URLError> error) {
  auto it = tasks_.find(taskIdentifier);
  if (it == tasks_.end()) return;
  Entry entry = std::move(it->second);
  tasks_.erase(it);
  if (error && error->code == platform::http::URLErrorCancelled) return;  // kept for the next start
  journal_.remove(entry.journalName);
  if (auto delegate = delegate_.lock()) delegate->taskDidComplete(entry.info, response, error);
}

}  // namespace tavix
