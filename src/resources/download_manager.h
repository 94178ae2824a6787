// DownloadManager: keeps the resource files the bag names in the caches folder, up to date.
//
// The bag's "download_resources_list" names resources by bag key (the identifier); the bag maps
// each key to the file's URL. Each bag change cancels every download in flight and re-plans:
// resources the bag dropped lose their file ("TVXFileDeletedNotification"), new or changed URLs
// are fetched with reason "update", a vanished file with reason "missing" (and no version, so the
// server cannot answer 304), and the look-up hints resources on every bag with reason "lookup".
// Downloads go through the background download session, begin no earlier than 60 s after they
// are asked for, and survive a restart. A 200 or 206 answer replaces the file atomically and posts
// "TVXFileDownloadCompletedNotification" {"identifier", "url"}; failures are reported as
// feedback errors (code 500) and never retried here: the next bag re-plans.
//
// What was fetched from where is kept in the defaults under "download_resources". Identifiers
// come from the server, so one that could not be a plain file name in the caches folder is
// refused with a log line and never becomes a path.
//
// Threading: owns the serial queue "com.norvel.tavix.DownloadManager"; the resource table lives
// there. Public methods are safe from any thread; those that answer something hop onto the queue
// synchronously (never call them from it). Session delegate calls hop onto it synchronously too.
// "TVXFileDeletedNotification" is posted from the queue, so its observers must not call back
// synchronously; "TVXFileDownloadCompletedNotification" is posted off it.
// Must be owned by a shared_ptr (use create()).
#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "core/requests.h"
#include "core/resource_versions.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/http/background_download_session.h"
#include "platform/ipc/unix_socket.h"
#include "platform/notification_center.h"
#include "platform/property_value.h"

namespace tavix {

namespace platform {
class Clock;
class UserDefaults;
}  // namespace platform

// One resource: its bag key, the URL its file was last fetched from and, when the server
// redirected, the URL that finally served it (both with the "key" query item left out).
struct DownloadResource {
  std::string identifier;
  std::optional<std::string> url;
  std::optional<std::string> redirectUrl;
};

// A resource as `tavix_tool resources` shows it.
struct DownloadResourceStatus {
  std::string identifier;
  std::string url;  // empty until fetched once
  std::string version;
  std::optional<std::int64_t> fileSize;  // none: no file
  std::optional<platform::TimePoint> fileModificationDate;
  bool downloading = false;
  bool downloadStarted = false;  // false while it waits for its begin date
  std::optional<platform::TimePoint> downloadBeginDate;
  std::int64_t bytesReceived = 0;
  std::int64_t bytesExpected = -1;
};

inline constexpr const char* kDownloadResourcesDefaultsKey = "download_resources";
inline constexpr const char* kTVXDownloadIdentifierHeader = "X-Norvel-Download-Identifier";
inline constexpr const char* kTVXDownloadReasonHeader = "X-Norvel-Download-Reason";
inline constexpr const char* kResourceFilesFetchedCounterKey = "com.norvel.tavixd.bag.resourcefilesfetched";
// Keys of the attributes that come with a resource's file handle.
inline constexpr const char* kResourceFileSizeKey = "fileSize";
inline constexpr const char* kResourceFileModificationDateKey = "fileModificationDate";

class DownloadManager : public ResourceVersionsProvider,
                        public platform::http::BackgroundDownloadSession::Delegate,
                        public std::enable_shared_from_this<DownloadManager> {
 public:
  struct Environment {
    platform::DispatchPool* pool = nullptr;  // outlives the manager
    platform::Clock* clock = nullptr;        // outlives the manager
    std::shared_ptr<platform::NotificationCenter> center;
    std::shared_ptr<platform::UserDefaults> defaults;
    platform::fs::path cachesFolder;  // "<caches>/com.norvel.tavixd", made when missing
    std::shared_ptr<platform::http::BackgroundDownloadSession> session;
    // The download request for a resource URL (the request factory's): with "If-None-Match" for a
    // version, and the coarse location when asked. None when the URL does not parse.
    std::function<std::optional<platform::http::URLRequest>(const std::string& url, std::optional<std::string> version,
                                                            bool includeLatLong)>
        fileDownloadRequest;
    // Whether look-up is enabled (the look-up hints are fetched only then). Empty: enabled.
    std::function<bool()> lookupEnabled;
    // Reports an error as the daemon's feedback (code, domain, reason). Empty: not reported.
    std::function<void(int code, const std::string& domain, const std::string& reason)> reportError;
  };

  // Observes "TVXBagChangeNotification", becomes the session's delegate and resumes the
  // downloads an earlier run left in the session's journal.
  static std::shared_ptr<DownloadManager> create(Environment env);
  ~DownloadManager() override;
  DownloadManager(const DownloadManager&) = delete;
  DownloadManager& operator=(const DownloadManager&) = delete;

  // Identifier → version, for every resource that has one. Synchronous on the queue.
  std::map<std::string, std::string> resourceVersions() const override;

  // A copy of the resource, or none. Synchronous on the queue.
  std::optional<DownloadResource> resourceForKey(const std::string& identifier) const;

  // A read-only descriptor of the resource's file and its attributes (kResourceFileSizeKey,
  // kResourceFileModificationDateKey), or an invalid one and `error`: code 404 in kTVXErrorDomain
  // for a missing file or a refused identifier, 500 for other failures. Safe from any thread.
  platform::ipc::UniqueFd fileHandleForResource(const std::string& identifier, platform::Dictionary* attributes,
                                                TVXError* error) const;

  // Every known resource and every resource being downloaded, by identifier, with progress.
  std::vector<DownloadResourceStatus> resourceStatuses() const;

  // Applies a bag: what bagChangeNotification does with the bag's raw dictionary.
  void downloadBagResources(std::shared_ptr<const platform::Dictionary> rawBag);

  platform::SerialQueue& queue() const { return queue_; }

  // Session delegate calls.
  platform::http::BackgroundDownloadSession::DelayedRequestDecision taskWillBeginDelayedRequest(
      const platform::http::BackgroundDownloadSession::TaskInfo& task) override;
  void downloadTaskDidFinish(const platform::http::BackgroundDownloadSession::TaskInfo& task,
                             const platform::http::HTTPURLResponse& response, const std::string& body) override;
  void taskDidComplete(const platform::http::BackgroundDownloadSession::TaskInfo& task,
                       const std::optional<platform::http::HTTPURLResponse>& response,
                       const std::optional<platform::http::URLError>& error) override;

 private:
  explicit DownloadManager(Environment env);

  void bagChangeNotification(const platform::Notification& notification);
  void start();
  // The rest run on the queue.
  void addResource(const std::string& identifier, const std::optional<std::string>& url);
  std::optional<platform::http::URLRequest> createDownloadRequest(const std::string& identifier,
                                                                  const std::string& url, const std::string& reason);
  void downloadResource(const std::string& identifier, const std::string& url, const std::string& reason,
                        double delay);
  void loadResources();
  void saveResources();
  void deleteResource(const std::string& identifier, bool removeFile);
  bool resourceDownloadAllowed(const std::string& identifier) const;
  std::optional<std::string> resourceVersion(const std::string& identifier) const;
  // "<caches folder>/<identifier>", or none (logged) for an identifier that may not be a file name.
  std::optional<platform::fs::path> pathToResource(const std::string& identifier) const;
  void report(const std::string& reason) const;

  Environment env_;
  mutable platform::SerialQueue queue_;
  std::atomic<bool> hasStarted_{false};
  std::map<std::string, DownloadResource> resources_;  // on queue_
  platform::NotificationCenter::Registration bagObserver_;
};

}  // namespace tavix
