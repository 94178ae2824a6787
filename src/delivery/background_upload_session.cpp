#include "delivery/background_upload_session.h"

#include <algorithm>
#include <nlohmann/json.hpp>

#include "core/logging.h"
#include "platform/http/url_session.h"

namespace tavix {

namespace {

using json = nlohmann::json;
using platform::http::HTTPURLResponse;
using platform::http::URLError;
using platform::http::URLRequest;

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategoryUploadManager); }

constexpr const char* kTaskSuffix = ".task";
constexpr const char* kBodySuffix = ".body";

json encodeRequest(const URLRequest& request, std::optional<std::int64_t> numberOfFeedbacks) {
  json headers = json::array();
  for (const auto& [name, value] : request.headers.all()) headers.push_back({name, value});
  json out = {{"url", request.url},
              {"method", request.method},
              {"headers", headers},
              {"timeout", request.timeoutInterval}};
  if (numberOfFeedbacks) out["numberOfFeedbacks"] = *numberOfFeedbacks;
  return out;
}

bool decodeRequest(const std::string& text, URLRequest* request, std::optional<std::int64_t>* numberOfFeedbacks) {
  const json in = json::parse(text, nullptr, false);
  if (!in.is_object() || !in.contains("url") || !in["url"].is_string()) return false;
  request->url = in["url"].get<std::string>();
  request->method = in.value("method", std::string("POST"));
  request->timeoutInterval = in.value("timeout", 300.0);
  request->reloadIgnoringLocalCacheData = true;
  if (in.contains("headers") && in["headers"].is_array()) {
    for (const auto& field : in["headers"]) {
      if (field.is_array() && field.size() == 2 && field[0].is_string() && field[1].is_string()) {
        request->headers.add(field[0].get<std::string>(), field[1].get<std::string>());
      }
    }
  }
  if (in.contains("numberOfFeedbacks") && in["numberOfFeedbacks"].is_number_integer()) {
    *numberOfFeedbacks = in["numberOfFeedbacks"].get<std::int64_t>();
  }
  return true;
}

// "upload.12" -> 12; 0 for names of another form.
std::uint64_t journalNumber(const std::string& name) {
  constexpr std::string_view prefix = "upload.";
  if (name.rfind(prefix, 0) != 0) return 0;
  try {
    return std::stoull(name.substr(prefix.size()));
  } catch (...) {
    return 0;
  }
}

}  // namespace

std::shared_ptr<BackgroundUploadSession> BackgroundUploadSession::create(
    std::shared_ptr<platform::http::URLSession> transport, platform::fs::path journalDirectory,
    platform::DispatchPool& pool) {
  return std::shared_ptr<BackgroundUploadSession>(
      new BackgroundUploadSession(std::move(transport), std::move(journalDirectory), pool));
}

BackgroundUploadSession::BackgroundUploadSession(std::shared_ptr<platform::http::URLSession> transport,
                                                 platform::fs::path journal, platform::DispatchPool& pool)
    : transport_(std::move(transport)), journal_(std::move(journal)), queue_(pool, "com.norvel.tavixd.uploadsession") {
  if (auto ec = platform::createDirectory(journal_, true, 0700)) {
    log().error("cannot create the upload journal {}: {}", journal_.string(), ec.message());
  }
  // What a crash left half-written: a body whose task never followed, the temporary file of an
  // atomic write. Neither would ever be sent or removed.
  std::error_code ec;
  std::vector<platform::fs::path> orphans;
  for (const auto& item : platform::fs::directory_iterator(journal_, ec)) {
    const auto& path = item.path();
    const bool temporary = path.filename().string().rfind('.', 0) == 0;
    const bool lonelyBody = path.extension() == kBodySuffix &&
                            !platform::fs::exists(journal_ / (path.stem().string() + kTaskSuffix));
    if (temporary || lonelyBody) {
      orphans.push_back(path);
      continue;
    }
    nextJournalNumber_ = std::max(nextJournalNumber_, journalNumber(path.stem().string()) + 1);
  }
  for (const auto& orphan : orphans) {
    log().notice("removing orphan upload journal file {}", orphan.filename().string());
    platform::fs::remove(orphan, ec);
  }
}

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
    std::error_code ec;
    std::vector<std::string> names;
    for (const auto& item : platform::fs::directory_iterator(self->journal_, ec)) {
      if (item.path().extension() == kTaskSuffix) names.push_back(item.path().stem().string());
    }
    std::sort(names.begin(), names.end(),
              [](const std::string& a, const std::string& b) { return journalNumber(a) < journalNumber(b); });
    for (const auto& name : names) {
      const bool running = std::any_of(self->tasks_.begin(), self->tasks_.end(),
                                       [&](const auto& t) { return t.second.journalName == name; });
      if (running) continue;
      std::string text, body;
      URLRequest request;
      std::optional<std::int64_t> count;
      if (platform::readFile(self->journal_ / (name + kTaskSuffix), &text) ||
          platform::readFile(self->journal_ / (name + kBodySuffix), &body) || !decodeRequest(text, &request, &count)) {
        log().error("unreadable upload journal entry {}, dropped", name);
        self->forget(name);
        continue;
      }
      log().info("resuming upload {} to {}", name, request.url);
      self->start(name, std::move(request), std::move(body), count);
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
    const std::string name = "upload." + std::to_string(nextJournalNumber_++);
    // The body first: a task file is only ever found beside a complete body.
    std::error_code ec = platform::writeFileAtomically(journal_ / (name + kBodySuffix), body, 0600);
    if (!ec) {
      ec = platform::writeFileAtomically(journal_ / (name + kTaskSuffix),
                                         encodeRequest(request, numberOfFeedbacks).dump(), 0600);
    }
    if (ec) {
      log().error("cannot journal upload {}: {}", name, ec.message());
      forget(name);
      return;
    }
    const std::size_t before = tasks_.size();
    start(name, std::move(request), std::move(body), numberOfFeedbacks);
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
  forget(entry.journalName);
  if (auto delegate = delegate_.lock()) delegate->taskDidComplete(entry.info, response, error);
}

void BackgroundUploadSession::forget(const std::string& journalName) {
  std::error_code ec;
  platform::fs::remove(journal_ / (journalName + kTaskSuffix), ec);
  platform::fs::remove(journal_ / (journalName + kBodySuffix), ec);
}

}  // namespace tavix
