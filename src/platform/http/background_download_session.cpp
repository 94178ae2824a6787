#include "platform/http/background_download_session.h"

#include "platform/http/url_session.h"
#include "platform/log.h"

namespace tavix::platform::http {

namespace {

constexpr const char* kEarliestBeginDateKey = "earliestBeginDate";

Dictionary journalValues(const std::optional<TimePoint>& earliestBeginDate) {
  Dictionary values;
  if (earliestBeginDate) values[kEarliestBeginDateKey] = toUnixSeconds(*earliestBeginDate);
  return values;
}

}  // namespace

std::shared_ptr<BackgroundDownloadSession> BackgroundDownloadSession::create(std::shared_ptr<URLSession> transport,
                                                                             fs::path journalDirectory,
                                                                             DispatchPool& pool, Clock& clock,
                                                                             Logger& logger) {
  return std::shared_ptr<BackgroundDownloadSession>(
      new BackgroundDownloadSession(std::move(transport), std::move(journalDirectory), pool, clock, logger));
}

BackgroundDownloadSession::BackgroundDownloadSession(std::shared_ptr<URLSession> transport, fs::path journal,
                                                     DispatchPool& pool, Clock& clock, Logger& logger)
    : transport_(std::move(transport)),
      clock_(clock),
      logger_(logger),
      delegateQueue_(pool, "com.norvel.tavixd.downloadsession"),
      journal_(std::move(journal), "download", logger) {}

BackgroundDownloadSession::~BackgroundDownloadSession() {
  std::lock_guard guard(lock_);
  for (auto& [id, entry] : tasks_) {
    entry.timer.cancel();
    if (entry.task) entry.task->cancel();
  }
}

void BackgroundDownloadSession::setDelegate(std::weak_ptr<Delegate> delegate) {
  std::lock_guard guard(lock_);
  delegate_ = std::move(delegate);
}

std::shared_ptr<BackgroundDownloadSession::Delegate> BackgroundDownloadSession::delegate() const {
  std::lock_guard guard(lock_);
  return delegate_.lock();
}

void BackgroundDownloadSession::resumePendingTasks() {
  std::lock_guard guard(lock_);
  for (auto& record : journal_.load()) {
    std::optional<TimePoint> earliestBeginDate;
    if (auto it = record.values.find(kEarliestBeginDateKey); it != record.values.end() && it->second.asReal()) {
      earliestBeginDate = fromUnixSeconds(*it->second.asReal());
    }
    logger_.info("resuming download {} of {}", record.name, record.request.url);
    schedule(std::move(record.request), earliestBeginDate, record.name);
  }
}

std::optional<std::uint64_t> BackgroundDownloadSession::downloadTask(URLRequest request,
                                                                    std::optional<TimePoint> earliestBeginDate) {
  std::lock_guard guard(lock_);
  auto name = journal_.add(request, journalValues(earliestBeginDate));
  if (!name) return std::nullopt;
  return schedule(std::move(request), earliestBeginDate, *name);
}

std::uint64_t BackgroundDownloadSession::schedule(URLRequest request, std::optional<TimePoint> earliestBeginDate,
                                                  std::string journalName) {
  const std::uint64_t identifier = nextIdentifier_++;
  Entry entry;
  entry.info.taskIdentifier = identifier;
  entry.info.originalRequest = std::move(request);
  entry.info.earliestBeginDate = earliestBeginDate;
  entry.journalName = std::move(journalName);
  const Duration delay = earliestBeginDate ? *earliestBeginDate - clock_.now() : Duration::zero();
  std::weak_ptr<BackgroundDownloadSession> weak = weak_from_this();
  entry.timer = clock_.after(delay, delegateQueue_, [weak, identifier] {
    if (auto self = weak.lock()) self->begin(identifier);
  });
  tasks_.emplace(identifier, std::move(entry));
  return identifier;
}

void BackgroundDownloadSession::begin(std::uint64_t taskIdentifier) {
  TaskInfo info;
  {
    std::lock_guard guard(lock_);
    auto it = tasks_.find(taskIdentifier);
    if (it == tasks_.end()) return;
    info = it->second.info;
  }
  URLRequest request = info.originalRequest;
  if (info.earliestBeginDate) {
    if (auto d = delegate()) {
      auto decision = d->taskWillBeginDelayedRequest(info);
      if (decision.disposition == DelayedRequestDisposition::UseNewRequest && decision.newRequest) {
        request = std::move(*decision.newRequest);
      }
    }
  }
  std::weak_ptr<BackgroundDownloadSession> weak = weak_from_this();
  auto task = transport_->dataTask(
      request,
      [weak, taskIdentifier](std::string body, std::optional<HTTPURLResponse> response, std::optional<URLError> error) {
        if (auto self = weak.lock()) self->completed(taskIdentifier, std::move(body), std::move(response), std::move(error));
      },
      &delegateQueue_);
  {
    std::lock_guard guard(lock_);
    auto it = tasks_.find(taskIdentifier);
    if (it == tasks_.end()) return;  // cancelled while the delegate decided
    Entry& entry = it->second;
    if (request.url != entry.info.originalRequest.url || request.headers.all() != entry.info.originalRequest.headers.all()) {
      entry.info.originalRequest = request;
      journal_.update(entry.journalName, request, journalValues(entry.info.earliestBeginDate));
    }
    entry.info.started = true;
    entry.task = task;
  }
  task->resume();
}

void BackgroundDownloadSession::completed(std::uint64_t taskIdentifier, std::string body,
                                          std::optional<HTTPURLResponse> response, std::optional<URLError> error) {
  TaskInfo info;
  {
    std::lock_guard guard(lock_);
    auto it = tasks_.find(taskIdentifier);
    if (it == tasks_.end()) return;  // cancelled: the delegate has heard already
    // Cancelled by the transport going away (the process is stopping): kept for the next start.
    if (error && error->code == URLErrorCancelled) return;
    info = snapshot(it->second);
    journal_.remove(it->second.journalName);
    tasks_.erase(it);
  }
  auto d = delegate();
  if (!d) return;
  if (response) {
    info.currentURL = response->url;
    if (!error) d->downloadTaskDidFinish(info, *response, body);
  }
  d->taskDidComplete(info, response, error);
}

void BackgroundDownloadSession::cancel(std::uint64_t taskIdentifier) {
  TaskInfo info;
  std::shared_ptr<URLSessionDataTask> task;
  {
    std::lock_guard guard(lock_);
    auto it = tasks_.find(taskIdentifier);
    if (it == tasks_.end()) return;
    it->second.timer.cancel();
    task = std::move(it->second.task);
    info = snapshot(it->second);
    journal_.remove(it->second.journalName);
    tasks_.erase(it);
  }
  if (task) task->cancel();
  std::weak_ptr<BackgroundDownloadSession> weak = weak_from_this();
  delegateQueue_.async([weak, info = std::move(info)] {
    auto self = weak.lock();
    auto d = self ? self->delegate() : nullptr;
    if (d) d->taskDidComplete(info, std::nullopt, URLError{kURLErrorDomain, URLErrorCancelled, "cancelled"});
  });
}

std::vector<BackgroundDownloadSession::TaskInfo> BackgroundDownloadSession::allTasks() const {
  std::lock_guard guard(lock_);
  std::vector<TaskInfo> out;
  out.reserve(tasks_.size());
  for (const auto& [id, entry] : tasks_) out.push_back(snapshot(entry));
  return out;
}

BackgroundDownloadSession::TaskInfo BackgroundDownloadSession::snapshot(const Entry& entry) const {
  TaskInfo info = entry.info;
  if (entry.task) {
    info.bytesReceived = entry.task->countOfBytesReceived();
    info.bytesExpected = entry.task->countOfBytesExpectedToReceive();
  }
  return info;
}

}  // namespace tavix::platform::http
