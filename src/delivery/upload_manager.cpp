#include "delivery/upload_manager.h"

#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <random>
#include <nlohmann/json.hpp>

#include "bagview/tvx_bag.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
#include "delivery/output_stream.h"
#include "network/request_factory.h"
#include "platform/http/url_session.h"
#include "platform/http/url.h"

namespace tavix {

namespace {

using platform::http::HTTPURLResponse;
using platform::http::URLError;
using platform::http::URLRequest;

platform::Logger& uploadLog() { return TavixLogForCategory(TavixLoggingCategoryUploadManager); }

constexpr double kUploadTimeoutSeconds = 300;
constexpr std::size_t kCopyChunkSize = 8192;
constexpr std::size_t kMaximumTempPathLength = 1024;

// `url` with "name=value" appended after its query items. A URL that cannot be parsed is kept as
// it stands: the request made from it is refused, and the upload waits for a better bag.
std::string appendingQueryItem(std::string_view url, std::string_view name, std::string_view value) {
  auto parsed = platform::http::URL::parse(url);
  if (!parsed) return std::string(url);
  parsed->appendQueryItem(name, value);
  return parsed->string();
}

}  // namespace

// ---- TempFile

TempFile::~TempFile() {
  if (fd_ >= 0) ::close(fd_);
  if (!path_.empty()) ::unlink(path_.c_str());
}

std::optional<std::string> TempFile::readContents() const {
  std::string out;
  char buffer[kCopyChunkSize];
  off_t offset = 0;
  for (;;) {
    const ssize_t n = ::pread(fd_, buffer, sizeof buffer, offset);
    if (n < 0) {
      if (errno == EINTR) continue;
      return std::nullopt;
    }
    if (n == 0) return out;
    out.append(buffer, static_cast<std::size_t>(n));
    offset += n;
  }
}

// ---- UploadManager

std::shared_ptr<UploadManager> UploadManager::create(platform::DispatchPool& pool, platform::NotificationCenter& center,
                                                     std::shared_ptr<TVXNetworkRequestFactory> requestFactory,
                                                     std::shared_ptr<BackgroundUploadSession> session) {
  auto manager = std::shared_ptr<UploadManager>(new UploadManager(pool, std::move(requestFactory), session));
  session->setDelegate(manager);
  std::weak_ptr<UploadManager> weak = manager;
  manager->bagObserver_ = center.addObserver(kTVXBagChangeNotification, nullptr, nullptr,
                                             [weak](const platform::Notification& notification) {
                                               if (auto self = weak.lock()) self->bagDidChange(notification);
                                             });
  session->resumePendingTasks();
  return manager;
}

UploadManager::UploadManager(platform::DispatchPool& pool, std::shared_ptr<TVXNetworkRequestFactory> requestFactory,
                             std::shared_ptr<BackgroundUploadSession> session)
    : requestFactory_(std::move(requestFactory)),
      session_(std::move(session)),
      queue_(pool, "com.norvel.tavixd.uploadmanager") {}

UploadManager::~UploadManager() = default;

std::optional<std::string> UploadManager::feedbackEndpointFromBag(const TVXBag* bag) {
  if (!bag || !bag->feedbackEnabled()) return std::nullopt;
  auto url = bag->feedbackURL();
  if (!url) return std::nullopt;
  return appendingQueryItem(*url, "v", "2");
}

std::optional<std::string> UploadManager::crowdsourcingEndpointFromBag(const TVXBag* bag) {
  if (!bag || !bag->feedbackEnabled()) return std::nullopt;
  return bag->crowdsourcingURL();
}

void UploadManager::takeEndpointsFromBag(const TVXBag* bag) {
  setFeedbackEndpoint(feedbackEndpointFromBag(bag));
  setCrowdsourcingEndpoint(crowdsourcingEndpointFromBag(bag));
  if (bag) queue_.async([self = shared_from_this()] { self->endpointsFromBag_ = true; });
}

UploadOutcome UploadManager::outcomeWithoutEndpoint() {
  bool fromBag = false;
  queue_.sync([&] { fromBag = endpointsFromBag_; });
  return fromBag ? UploadOutcome::kNoEndpoint : UploadOutcome::kNotNow;
}

void UploadManager::bagDidChange(const platform::Notification& notification) {
  TavixLogForCategory(TavixLoggingCategoryFlusher).notice("bag change notification received");
  if (auto bag = bagOfNotification(notification)) takeEndpointsFromBag(bag.get());
}

std::optional<std::string> UploadManager::feedbackEndpoint() {
  std::optional<std::string> url;
  queue_.sync([&] { url = feedbackEndpoint_; });
  return url;
}

void UploadManager::setFeedbackEndpoint(std::optional<std::string> url) {
  queue_.async([self = shared_from_this(), url = std::move(url)] { self->feedbackEndpoint_ = url; });
}

std::optional<std::string> UploadManager::crowdsourcingEndpoint() {
  std::optional<std::string> url;
  queue_.sync([&] { url = crowdsourcingEndpoint_; });
  return url;
}

void UploadManager::setCrowdsourcingEndpoint(std::optional<std::string> url) {
  queue_.async([self = shared_from_this(), url = std::move(url)] { self->crowdsourcingEndpoint_ = url; });
}

std::optional<std::string> UploadManager::urlForEndpoint(int endpoint, const std::string& type) {
  auto url = endpoint == kCrowdsourcingEndpoint ? crowdsourcingEndpoint() : feedbackEndpoint();
  if (!url) return std::nullopt;
  if (!type.empty()) return appendingQueryItem(*url, "type", type);
  return url;
}

std::shared_ptr<TempFile> UploadManager::makeTempFileWithAnnotation(const std::optional<std::string>& annotation) {
  std::error_code ec;
  const auto dir = platform::fs::temp_directory_path(ec);
  if (ec) return nullptr;
  const std::string templ = (dir / ("com.norvel.tavixd.upload_" + annotation.value_or("") + "_XXXXX")).string();
  if (templ.size() >= kMaximumTempPathLength) return nullptr;
  // glibc's mkstemp insists on six X; the name keeps its five, filled the way mkstemp would:
  // random letters and digits, created exclusively, retried on a clash.
  static constexpr char kLetters[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
  thread_local std::mt19937_64 random{std::random_device{}()};
  for (int attempt = 0; attempt < 100; ++attempt) {
    std::string path = templ;
    for (std::size_t i = path.size() - 5; i < path.size(); ++i) path[i] = kLetters[random() % (sizeof kLetters - 1)];
    const int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    if (fd >= 0) return std::make_shared<TempFile>(fd, path);
    if (errno != EEXIST) return nullptr;
  }
  return nullptr;
}

std::shared_ptr<TempFile> UploadManager::uploadJSONFeedback(std::string_view json, int endpoint, UploadCompletion done) {
  auto finish = [&done](UploadOutcome outcome) {
    if (done) done(outcome);
    return nullptr;
  };
  auto file = makeTempFileWithAnnotation("tavix");
  if (!file) {
    uploadLog().error("Error getting temp file.");
    return finish(UploadOutcome::kNotNow);
  }
  uploadLog().debug("Compressing data for upload to {}", file->path().string());

  const auto parsed = nlohmann::json::parse(json, nullptr, false);
  if (parsed.is_discarded()) {
    TavixLogForCategory(TavixLoggingCategorySession).error("Invalid JSON Object {} error {}", json, "not JSON");
    return finish(UploadOutcome::kInvalid);
  }
  const std::int64_t count = parsed.is_object() || parsed.is_array() ? static_cast<std::int64_t>(parsed.size()) : 0;

  CompressedOutputStream stream(std::make_shared<FileOutputStream>(file->path()), file->path());
  stream.open();
  // Written as the serializer would stream it: in pieces, never as one extra whole copy.
  for (std::size_t offset = 0; offset < json.size(); offset += kCopyChunkSize) {
    if (stream.write(json.substr(offset, kCopyChunkSize)) < 0) break;
  }
  stream.close();
  if (stream.status() != 1) {
    TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.feedbacknotsent");
    uploadLog().error("Compression for upload failed");
    return finish(UploadOutcome::kNotNow);
  }
  std::error_code ec;
  if (!platform::fs::exists(file->path(), ec)) {
    uploadLog().error("Couldn't find file {} after compression.", file->path().string());
    return finish(UploadOutcome::kNotNow);
  }
  const auto url = urlForEndpoint(endpoint, "");
  if (!url) {
    finish(outcomeWithoutEndpoint());
    return file;
  }
  auto request = requestFactory_->flusherUploadRequest(*url, kUploadTimeoutSeconds, stream.dataDigestForStream());
  if (!request) {
    finish(UploadOutcome::kNotNow);
    return file;
  }
  enqueueRequest(std::move(*request), file, count, std::move(done));
  return file;
}

void UploadManager::uploadFeedback(const platform::fs::path& source, const std::string& type, int endpoint,
                                   UploadCompletion done) {
  auto finish = [&done](UploadOutcome outcome) {
    if (done) done(outcome);
  };
  const auto url = urlForEndpoint(endpoint, type);
  if (!url) {
    uploadLog().error("Server feedback endpoint not set, data can't be sent to server");
    return finish(outcomeWithoutEndpoint());
  }
  uploadLog().debug("uploadFile: {}", source.string());
  const int in = ::open(source.c_str(), O_RDONLY | O_CLOEXEC);
  auto file = makeTempFileWithAnnotation(type);
  if (!file) {
    uploadLog().error("Error getting temp file.");
    if (in >= 0) ::close(in);
    return finish(UploadOutcome::kNotNow);
  }
  uploadLog().debug("Compressing data for upload to {}", file->path().string());
  CompressedOutputStream stream(std::make_shared<FileOutputStream>(file->path()), file->path());
  stream.open();
  ssize_t lastRead = -1;
  bool changed = false;
  if (in >= 0) {
    struct stat before {};
    ::fstat(in, &before);
    std::uint64_t copied = 0;
    std::uint8_t chunk[kCopyChunkSize];
    for (;;) {
      lastRead = ::read(in, chunk, sizeof chunk);
      if (lastRead < 0 && errno == EINTR) continue;
      if (lastRead <= 0) break;
      stream.write(chunk, static_cast<std::size_t>(lastRead));
      copied += static_cast<std::uint64_t>(lastRead);
    }
    // A writer still at work shows in the size or the modification time: such a file is not
    // sent half-written.
    struct stat after {};
    ::fstat(in, &after);
    changed = copied != static_cast<std::uint64_t>(before.st_size) || after.st_size != before.st_size ||
              after.st_mtim.tv_sec != before.st_mtim.tv_sec || after.st_mtim.tv_nsec != before.st_mtim.tv_nsec;
    ::close(in);
  }
  stream.close();
  if (changed && lastRead != -1) {
    uploadLog().notice("{} changed while it was read; left for later", source.string());
    return finish(UploadOutcome::kSourceChanged);
  }
  std::error_code ec;
  if (lastRead != -1 && stream.status() == 1 && platform::fs::exists(file->path(), ec)) {
    auto request = requestFactory_->flusherUploadRequest(*url, kUploadTimeoutSeconds, stream.dataDigestForStream());
    if (request) {
      enqueueRequest(std::move(*request), file, 0, std::move(done));
      return;
    }
  }
  uploadLog().error("Compression for upload failed");
  finish(in < 0 ? UploadOutcome::kInvalid : UploadOutcome::kNotNow);
}

void UploadManager::enqueueRequest(URLRequest request, std::shared_ptr<TempFile> file,
                                   std::optional<std::int64_t> numberOfFeedbacks, UploadCompletion done) {
  std::weak_ptr<UploadManager> weak = weak_from_this();
  // The closure holds the temporary file: it goes once the journal has its copy, or not.
  session_->getAllTasks([weak, request = std::move(request), file = std::move(file), numberOfFeedbacks,
                         done = std::move(done)](std::vector<BackgroundUploadSession::TaskInfo> tasks) mutable {
    auto self = weak.lock();
    UploadOutcome outcome = UploadOutcome::kNotNow;
    if (self && tasks.size() < kMaximumPendingUploads) {
      uploadLog().debug("Enqueuing for upload: {}, headers {}", file->path().string(), request.headers.description());
      if (self->session_->uploadTask(std::move(request), file->path(), numberOfFeedbacks)) {
        outcome = UploadOutcome::kJournaled;
      }
    } else if (self) {
      uploadLog().error("too many uploads pending: {}", tasks.size());
    }
    if (done) done(outcome);
  });
}

void UploadManager::taskDidComplete(const BackgroundUploadSession::TaskInfo& task,
                                         const std::optional<HTTPURLResponse>& response,
                                         const std::optional<URLError>& error) {
  if (error && error->domain == platform::http::kURLErrorDomain && error->code == platform::http::URLErrorTimedOut) {
    TavixDiagnosticDataReporter::addValue(1, "com.norvel.tavixd.fbrequesttimedout");
  }
  // File uploads carry 0 and count as one.
  const std::int64_t count = task.numberOfFeedbacks.value_or(0) > 0 ? *task.numberOfFeedbacks : 1;
  const long status = response ? response->statusCode : 0;
  if (status != 200) {
    uploadLog().fault("response error {}", response ? "status " + std::to_string(status) + " from " + response->url
                                                    : "none: " + (error ? error->description : std::string("?")));
    TavixDiagnosticDataReporter::addValue(count, "com.norvel.tavixd.feedbacknotsent");
  } else {
    TavixDiagnosticDataReporter::addValue(count, "com.norvel.tavixd.feedbacksent");
  }
  uploadLog().debug("taskDidComplete: id={}, error={}, statusCode={}", task.taskIdentifier,
                    error ? error->description : std::string("(null)"), status);
}

void UploadManager::taskDidSendBodyData(const BackgroundUploadSession::TaskInfo& task, std::int64_t totalBytesSent,
                                    std::int64_t totalBytesExpectedToSend) {
  const double fraction =
      totalBytesExpectedToSend > 0 ? double(totalBytesSent) / double(totalBytesExpectedToSend) : 1.0;
  uploadLog().debug("task {}, transfer {:f} complete", task.taskIdentifier, fraction);
}

}  // namespace tavix
