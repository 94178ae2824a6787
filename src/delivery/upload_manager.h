// UploadManager: sends feedback to the server. A JSON record (a session's upload record) or a
// file of custom feedback is compressed with raw DEFLATE into a temporary file while its SHA-512
// digest is computed, and the file goes to the background upload session with a request that
// carries the digest ("X-Norvel-Digest") and "Content-Encoding: deflate". The feedback and
// crowdsourcing endpoints follow the bag ("TVXBagChangeNotification"). Nothing is retried: a
// failed upload is counted ("com.norvel.tavixd.feedbacknotsent") and forgotten.
//
// Threading: owns the serial queue "com.norvel.tavixd.uploadmanager", which guards the endpoints
// (setters asynchronous, getters synchronous, not from that queue). Compression runs on the
// caller's thread. Completions arrive on the upload session's queue. Must be owned by a
// shared_ptr (made by create()).
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "delivery/background_upload_session.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/notification_center.h"

namespace tavix {

class TVXBag;
class TVXNetworkRequestFactory;

// A temporary file, removed (and its descriptor closed) when the last holder lets it go: by then
// its contents are in the upload journal, or the upload was given up.
class TempFile {
 public:
  TempFile(int fd, platform::fs::path path) : fd_(fd), path_(std::move(path)) {}
  ~TempFile();
  TempFile(const TempFile&) = delete;
  TempFile& operator=(const TempFile&) = delete;
  int fileDescriptor() const { return fd_; }
  const platform::fs::path& path() const { return path_; }
  // The whole file as it is now, read through the descriptor; none on a read error.
  std::optional<std::string> readContents() const;

 private:
  int fd_;
  platform::fs::path path_;
};

// Endpoint kinds: 0 is the crowdsourcing endpoint, anything else the feedback endpoint.
inline constexpr int kCrowdsourcingEndpoint = 0;
inline constexpr int kFeedbackEndpoint = 1;

// What became of an upload, for the caller who must decide whether its source may go.
enum class UploadOutcome {
  kJournaled,      // in the upload journal: it will be sent, across restarts too
  kNoEndpoint,     // the bag names no endpoint for it (feedback is off): it never will be
  kInvalid,        // the source cannot be encoded: it never will be
  kSourceChanged,  // the file grew or changed while it was read: it is still being written
  kNotNow,         // not taken this time (no bag yet, too many uploads pending, disk trouble)
};
using UploadCompletion = std::function<void(UploadOutcome)>;

class UploadManager : public std::enable_shared_from_this<UploadManager>, public BackgroundUploadSession::Delegate {
 public:
  // Uploads pending in the session beyond which new ones are dropped.
  static constexpr std::size_t kMaximumPendingUploads = 100;

  // Takes both endpoints from each bag posted on `center` (there is none until the first). The
  // pool and centre must outlive it; `requestFactory` makes the upload requests. The pending
  // uploads `session` kept from an earlier run are resumed.
  static std::shared_ptr<UploadManager> create(platform::DispatchPool& pool, platform::NotificationCenter& center,
                                               std::shared_ptr<TVXNetworkRequestFactory> requestFactory,
                                               std::shared_ptr<BackgroundUploadSession> session);
  ~UploadManager() override;
  UploadManager(const UploadManager&) = delete;
  UploadManager& operator=(const UploadManager&) = delete;

  // Compresses `json` (JSON text) and enqueues it for the endpoint `endpoint`; the upload reports
  // the record's element count (keys of an object) as its number of feedbacks. Returns the
  // temporary file holding exactly the compressed body, or null when it stopped early (invalid
  // JSON, no temporary file, no endpoint). `done` hears the outcome once: on the caller's thread
  // when it stopped early, else on the upload session's queue.
  std::shared_ptr<TempFile> uploadJSONFeedback(std::string_view json, int endpoint, UploadCompletion done = {});

  // Compresses the file's contents in 8192-byte chunks and enqueues them for `endpoint`, with
  // "type" = `type` appended to the URL when not empty. A file that changes while it is read is
  // not sent (kSourceChanged). `done` as above.
  void uploadFeedback(const platform::fs::path& file, const std::string& type, int endpoint,
                      UploadCompletion done = {});

  // A new "com.norvel.tavixd.upload_<annotation>_XXXXX" file in the temporary folder (mkstemp),
  // or null.
  static std::shared_ptr<TempFile> makeTempFileWithAnnotation(const std::optional<std::string>& annotation);

  // Endpoint URLs, as the bag gives them ("v=2" added to the feedback URL).
  std::optional<std::string> feedbackEndpoint();
  void setFeedbackEndpoint(std::optional<std::string> url);
  std::optional<std::string> crowdsourcingEndpoint();
  void setCrowdsourcingEndpoint(std::optional<std::string> url);
  platform::SerialQueue& queue() { return queue_; }
  const std::shared_ptr<BackgroundUploadSession>& uploadSession() const { return session_; }

  // Both endpoints from `bag` (none when feedback is disabled).
  static std::optional<std::string> feedbackEndpointFromBag(const TVXBag* bag);
  static std::optional<std::string> crowdsourcingEndpointFromBag(const TVXBag* bag);

  // BackgroundUploadSession::Delegate.
  void taskDidComplete(const BackgroundUploadSession::TaskInfo& task,
                            const std::optional<platform::http::HTTPURLResponse>& response,
                            const std::optional<platform::http::URLError>& error) override;
  void taskDidSendBodyData(const BackgroundUploadSession::TaskInfo& task, std::int64_t totalBytesSent,
                       std::int64_t totalBytesExpectedToSend) override;

 private:
  UploadManager(platform::DispatchPool& pool, std::shared_ptr<TVXNetworkRequestFactory> requestFactory,
                std::shared_ptr<BackgroundUploadSession> session);
  void bagDidChange(const platform::Notification& notification);
  void takeEndpointsFromBag(const TVXBag* bag);
  std::optional<std::string> urlForEndpoint(int endpoint, const std::string& type);
  // Without an endpoint: whether that is the bag's word (no feedback) or there is no bag yet.
  UploadOutcome outcomeWithoutEndpoint();
  void enqueueRequest(platform::http::URLRequest request, std::shared_ptr<TempFile> file,
                      std::optional<std::int64_t> numberOfFeedbacks, UploadCompletion done);

  std::shared_ptr<TVXNetworkRequestFactory> requestFactory_;
  std::shared_ptr<BackgroundUploadSession> session_;
  platform::SerialQueue queue_;
  std::optional<std::string> feedbackEndpoint_;       // on queue_
  std::optional<std::string> crowdsourcingEndpoint_;  // on queue_
  bool endpointsFromBag_ = false;                     // on queue_: set once a bag gave them
  platform::NotificationCenter::Registration bagObserver_;
};

}  // namespace tavix
