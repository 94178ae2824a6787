#include "resources/download_manager.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <set>

#include "bagview/tvx_bag.h"
#include "core/diagnostics.h"
#include "core/logging.h"
#include "core/names.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "resources/lookup_hints.h"
#include "resources/resource_identifier.h"

namespace tavix {

namespace {

using platform::Dictionary;
using platform::PropertyValue;
using platform::http::BackgroundDownloadSession;
using platform::http::HTTPURLResponse;
using platform::http::URLError;
using platform::http::URLRequest;

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategoryDownloadManager); }

constexpr const char* kReasonUpdate = "update";
constexpr const char* kReasonMissing = "missing";
constexpr const char* kReasonLookup = "lookup";

// Downloads wait this long after they are asked for, whatever delay the caller gave: the server
// sees bag changes spread out, not every device at once.
constexpr double kEarliestBeginSeconds = 60;

std::string headerOf(const BackgroundDownloadSession::TaskInfo& task, const char* name) {
  return task.originalRequest.headers.get(name).value_or("");
}

std::string join(const std::set<std::string>& items) {
  std::string out = "(";
  for (const auto& item : items) out += (out.size() > 1 ? ", " : "") + item;
  return out + ")";
}

}  // namespace

std::shared_ptr<DownloadManager> DownloadManager::create(Environment env) {
  auto manager = std::shared_ptr<DownloadManager>(new DownloadManager(std::move(env)));
  std::weak_ptr<DownloadManager> weak = manager;
  manager->bagObserver_ = manager->env_.center->addObserver(
      kTVXBagChangeNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        if (auto self = weak.lock()) self->bagChangeNotification(n);
      });
  if (manager->env_.session) {
    manager->env_.session->setDelegate(manager);
    manager->env_.session->resumePendingTasks();
  }
  return manager;
}

DownloadManager::DownloadManager(Environment env)
    : env_(std::move(env)), queue_(*env_.pool, "com.norvel.tavix.DownloadManager") {}

DownloadManager::~DownloadManager() = default;

void DownloadManager::bagChangeNotification(const platform::Notification& notification) {
  auto bag = bagOfNotification(notification);
  log().info("bag change: {}", bag ? bag->version().value_or("(no version)") : "(none)");
  if (!bag) return;
  start();
  downloadBagResources(bag->sharedRawBag());
}

void DownloadManager::start() {
  if (hasStarted_.exchange(true)) return;
  log().notice("started");
  queue_.async([weak = weak_from_this()] {
    if (auto self = weak.lock()) self->loadResources();
  });
}

void DownloadManager::downloadBagResources(std::shared_ptr<const Dictionary> rawBag) {
  for (const auto& task : env_.session->allTasks()) {
    log().notice("canceling {}", task.originalRequest.url);
    env_.session->cancel(task.taskIdentifier);
  }
  queue_.async([weak = weak_from_this(), rawBag = std::move(rawBag)] {
    auto self = weak.lock();
    if (!self) return;
    std::set<std::string> wanted;
    if (auto it = rawBag->find("download_resources_list"); it != rawBag->end() && it->second.array()) {
      for (const auto& item : *it->second.array()) {
        if (item.string()) wanted.insert(*item.string());
      }
    }
    log().notice("resource files to be downloaded: {}", join(wanted));
    std::vector<std::string> dropped;
    for (const auto& [identifier, resource] : self->resources_) {
      if (!wanted.contains(identifier)) dropped.push_back(identifier);
    }
    for (const auto& identifier : dropped) self->deleteResource(identifier, true);
    for (const auto& identifier : wanted) {
      std::string why;
      if (!isValidResourceIdentifier(identifier, &why)) {
        log().error("refusing resource identifier \"{}\": {}", identifier, why);
        continue;
      }
      if (!self->resourceDownloadAllowed(identifier)) {
        log().info("{} is disabled, not downloading", identifier);
        continue;
      }
      std::optional<std::string> url;
      if (auto it = rawBag->find(identifier); it != rawBag->end() && it->second.string()) url = *it->second.string();
      log().notice("downloading file: {} at url: {}", identifier, url.value_or("(null)"));
      self->addResource(identifier, url);
    }
    self->saveResources();
  });
}

void DownloadManager::addResource(const std::string& identifier, const std::optional<std::string>& url) {
  queue_.assertCurrent("DownloadManager::addResource");
  if (!url) {
    deleteResource(identifier, true);
    return;
  }
  auto& resource = resources_[identifier];
  resource.identifier = identifier;
  std::string reason;
  const auto compared = urlForCompare(*url);
  if (!resource.url || !compared || differsInPathOrQuery(*resource.url, *compared)) {
    reason = kReasonUpdate;
  } else if (auto path = pathToResource(identifier); path && !platform::fs::exists(*path)) {
    reason = kReasonMissing;
  } else if (isLookupResource(identifier)) {
    reason = kReasonLookup;
  } else {
    return;
  }
  downloadResource(identifier, *url, reason, isLookupResource(identifier) ? kEarliestBeginSeconds : 0);
}

std::optional<URLRequest> DownloadManager::createDownloadRequest(const std::string& identifier, const std::string& url,
                                                                 const std::string& reason) {
  const auto version = reason == kReasonMissing ? std::nullopt : resourceVersion(identifier);
  auto request = env_.fileDownloadRequest ? env_.fileDownloadRequest(url, version, isLookupResource(identifier))
                                          : std::nullopt;
  if (!request) return std::nullopt;
  request->headers.set(kTVXDownloadIdentifierHeader, identifier);
  if (!reason.empty()) request->headers.set(kTVXDownloadReasonHeader, reason);
  return request;
}

void DownloadManager::downloadResource(const std::string& identifier, const std::string& url,
                                       const std::string& reason, double delay) {
  auto request = createDownloadRequest(identifier, url, reason);
  if (!request) {
    log().error("no download request for {} at url: {}", identifier, url);
    return;
  }
  log().info("starting download of {} reason: {} delay: {:f} headers: {}", identifier, reason, delay,
             request->headers.description());
  env_.session->downloadTask(std::move(*request),
                             platform::addSeconds(env_.clock->now(), kEarliestBeginSeconds));
}

BackgroundDownloadSession::DelayedRequestDecision DownloadManager::taskWillBeginDelayedRequest(
    const BackgroundDownloadSession::TaskInfo& task) {
  const std::string identifier = headerOf(task, kTVXDownloadIdentifierHeader);
  const std::string reason = headerOf(task, kTVXDownloadReasonHeader);
  log().notice("will begin {} url {}", identifier, task.originalRequest.url);
  if (!isLookupResource(identifier)) return {};
  // The location and the version may have changed while the task waited.
  std::optional<URLRequest> rebuilt;
  queue_.sync([&] { rebuilt = createDownloadRequest(identifier, task.originalRequest.url, reason); });
  if (!rebuilt) return {};
  log().notice("orig lookup headers: {}", task.originalRequest.headers.description());
  log().notice("new lookup headers: {}", rebuilt->headers.description());
  log().notice("new url: {} reason: {}", rebuilt->url, reason);
  return {BackgroundDownloadSession::DelayedRequestDisposition::UseNewRequest, std::move(rebuilt)};
}

void DownloadManager::downloadTaskDidFinish(const BackgroundDownloadSession::TaskInfo& task,
                                            const HTTPURLResponse& response, const std::string& body) {
  const std::string identifier = headerOf(task, kTVXDownloadIdentifierHeader);
  if (response.statusCode < 200 || response.statusCode >= 400) {
    log().error("download of {} got a {} response", identifier, response.statusCode);
    return;
  }
  if (response.statusCode != 200 && response.statusCode != 206) return;
  start();
  log().notice("download of {} finished {}", identifier, response.url);
  std::optional<platform::fs::path> destination;
  bool known = false;
  queue_.sync([&] {
    known = resources_.contains(identifier);
    if (known) destination = pathToResource(identifier);
  });
  if (!known) {
    log().error("failed to find download for identifier: {} url: {}", identifier, task.originalRequest.url);
    return;
  }
  if (!destination) {
    log().notice("failed getting destination URL for {}", identifier);
    return;
  }
  // Readers see the old file or the new one, never a mix: a temporary file beside it, fsync, rename.
  auto ec = platform::createDirectory(env_.cachesFolder, true, 0700);
  if (!ec) ec = platform::writeFileAtomically(*destination, body, 0600);
  if (ec) {
    log().error("error copying download {}: {}", identifier, ec.message());
    return;
  }
  TavixDiagnosticDataReporter::addValue(1, kResourceFilesFetchedCounterKey);
  env_.center->post(kTVXFileDownloadCompletedNotification, nullptr, {},
                    Dictionary{{"identifier", PropertyValue(identifier)},
                               {"url", PropertyValue("file://" + destination->string())}});
}

void DownloadManager::taskDidComplete(const BackgroundDownloadSession::TaskInfo& task,
                                      const std::optional<HTTPURLResponse>& response,
                                      const std::optional<URLError>& error) {
  if (error && error->code == platform::http::URLErrorCancelled) return;
  const long status = response ? response->statusCode : 0;
  if (status < 200 || status >= 400) {
    report("status code " + std::to_string(status));
    return;
  }
  if (task.originalRequest.url.empty()) {
    log().error("task completed with nil url and error: {}", error ? error->description : "(null)");
  }
  if (error) {
    log().notice("download task error {}", error->description);
    report("download error " + error->domain + " " + std::to_string(error->code));
    return;
  }
  start();
  const std::string identifier = headerOf(task, kTVXDownloadIdentifierHeader);
  bool found = false;
  queue_.sync([&] {
    auto it = resources_.find(identifier);
    if (it == resources_.end()) return;
    found = true;
    auto& resource = it->second;
    resource.url = urlForCompare(task.originalRequest.url);
    const auto current = urlForCompare(task.currentURL);
    resource.redirectUrl = current && current != resource.url ? current : std::nullopt;
    log().notice("{} url: {}", identifier, resource.url.value_or("(null)"));
    TavixDiagnosticDataReporter::addValue(1, kResourceFilesFetchedCounterKey);
    saveResources();
  });
  if (!found) {
    log().error("could not find resource for download identifier: {} url: {}", identifier, task.originalRequest.url);
    report("can't find " + identifier);
  }
}

std::optional<std::string> DownloadManager::resourceVersion(const std::string& identifier) const {
  auto it = resources_.find(identifier);
  if (it == resources_.end()) return std::nullopt;
  const auto& resource = it->second;
  if (isLookupResource(identifier) && resource.redirectUrl) {
    auto signature = signatureFromURL(*resource.redirectUrl);
    return signature.empty() ? std::nullopt : std::optional(signature);
  }
  return resource.url ? queryItemValue(*resource.url, "version") : std::nullopt;
}

std::map<std::string, std::string> DownloadManager::resourceVersions() const {
  const_cast<DownloadManager*>(this)->start();
  std::map<std::string, std::string> versions;
  queue_.sync([&] {
    for (const auto& [identifier, resource] : resources_) {
      if (auto version = resourceVersion(identifier); version && !version->empty()) versions[identifier] = *version;
    }
  });
  return versions;
}

std::optional<DownloadResource> DownloadManager::resourceForKey(const std::string& identifier) const {
  std::optional<DownloadResource> copy;
  queue_.sync([&] {
    if (auto it = resources_.find(identifier); it != resources_.end()) copy = it->second;
  });
  return copy;
}

void DownloadManager::deleteResource(const std::string& identifier, bool removeFile) {
  queue_.assertCurrent("DownloadManager::deleteResource");
  log().notice("deleting resource: {}", identifier);
  if (resources_.erase(identifier) > 0) {
    saveResources();
    // Off the queue: a download of it that is still waiting must not land afterwards.
    env_.pool->post([session = env_.session, identifier] {
      for (const auto& task : session->allTasks()) {
        if (task.originalRequest.headers.get(kTVXDownloadIdentifierHeader) == identifier) {
          session->cancel(task.taskIdentifier);
        }
      }
    });
  }
  if (!removeFile) return;
  const auto path = pathToResource(identifier);
  if (!path) {
    log().notice("error trying to get path to file for deletion {}", identifier);
    return;
  }
  std::error_code ec;
  if (!platform::fs::remove(*path, ec)) {
    if (ec) log().notice("error trying to remove file at url {}: {}", path->string(), ec.message());
    return;  // an absent file is not an error
  }
  env_.center->post(kTVXFileDeletedNotification, nullptr, {}, Dictionary{{"identifier", PropertyValue(identifier)}});
}

bool DownloadManager::resourceDownloadAllowed(const std::string& identifier) const {
  if (!isLookupResource(identifier)) return true;
  return !env_.lookupEnabled || env_.lookupEnabled();
}

void DownloadManager::loadResources() {
  queue_.assertCurrent("DownloadManager::loadResources");
  const auto record = env_.defaults->objectForKey(kDownloadResourcesDefaultsKey);
  const Dictionary* entries = record ? record->dictionary() : nullptr;
  if (!entries) return;
  for (const auto& [identifier, value] : *entries) {
    if (resources_.contains(identifier)) continue;
    if (!isValidResourceIdentifier(identifier)) {
      log().error("ignoring stored resource with invalid identifier \"{}\"", identifier);
      continue;
    }
    const Dictionary* entry = value.dictionary();
    const auto url = entry ? entry->find("url") : Dictionary::const_iterator{};
    if (!entry || url == entry->end() || !url->second.string()) continue;
    DownloadResource resource{identifier, *url->second.string(), std::nullopt};
    if (auto redirect = entry->find("redirect_url"); redirect != entry->end() && redirect->second.string()) {
      resource.redirectUrl = *redirect->second.string();
    }
    resources_.emplace(identifier, std::move(resource));
    // A write the process did not live to finish leaves its temporary file beside the resource.
    std::error_code ec;
    const std::string prefix = "." + identifier + ".";
    for (const auto& item : platform::fs::directory_iterator(env_.cachesFolder, ec)) {
      const auto name = item.path().filename().string();
      if (name.size() == prefix.size() + 6 && name.rfind(prefix, 0) == 0) platform::fs::remove(item.path(), ec);
    }
  }
}

void DownloadManager::saveResources() {
  queue_.assertCurrent("DownloadManager::saveResources");
  Dictionary record;
  for (const auto& [identifier, resource] : resources_) {
    if (!resource.url) continue;  // nothing fetched yet: nothing to remember
    Dictionary entry{{"url", PropertyValue(*resource.url)}};
    if (resource.redirectUrl) entry["redirect_url"] = *resource.redirectUrl;
    record[identifier] = std::move(entry);
  }
  if (!env_.defaults->setObject(kDownloadResourcesDefaultsKey, std::move(record))) {
    log().error("exception saving resource {}: {}", kDownloadResourcesDefaultsKey, "defaults refused the record");
  }
}

std::optional<platform::fs::path> DownloadManager::pathToResource(const std::string& identifier) const {
  if (env_.cachesFolder.empty()) {
    log().error("error caches directory is nil");
    return std::nullopt;
  }
  std::string why;
  if (!isValidResourceIdentifier(identifier, &why)) {
    log().error("error resource bag key is invalid \"{}\": {}", identifier, why);
    return std::nullopt;
  }
  return env_.cachesFolder / identifier;
}

platform::ipc::UniqueFd DownloadManager::fileHandleForResource(const std::string& identifier,
                                                               Dictionary* attributes, TVXError* error) const {
  auto fail = [&](std::int64_t code, std::string reason) {
    if (error) *error = TVXError{kTVXErrorDomain, code, std::move(reason)};
    return platform::ipc::UniqueFd{};
  };
  const auto path = pathToResource(identifier);
  if (!path) {
    log().error("error getting path to resource: {}", identifier);
    return fail(404, "invalid resource identifier");
  }
  platform::ipc::UniqueFd fd(::open(path->c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!fd.valid()) {
    const int err = errno;
    if (err == ENOENT) {
      log().error("no file at path: {}", path->string());
      return fail(404, "no file for resource " + identifier);
    }
    log().error("error getting file handle for resource: {}: {}", identifier, std::strerror(err));
    return fail(500, std::strerror(err));
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) {
    const int err = errno;
    log().error("error getting file attributes: {}: {}", identifier, std::strerror(err));
    return fail(500, std::strerror(err));
  }
  if (attributes) {
    (*attributes)[kResourceFileSizeKey] = static_cast<std::int64_t>(st.st_size);
    (*attributes)[kResourceFileModificationDateKey] =
        platform::Date{platform::fromUnixSeconds(static_cast<double>(st.st_mtim.tv_sec) + st.st_mtim.tv_nsec / 1e9)};
  }
  return fd;
}

std::vector<DownloadResourceStatus> DownloadManager::resourceStatuses() const {
  std::map<std::string, DownloadResourceStatus> byIdentifier;
  queue_.sync([&] {
    for (const auto& [identifier, resource] : resources_) {
      auto& status = byIdentifier[identifier];
      status.identifier = identifier;
      status.url = resource.url.value_or("");
      status.version = resourceVersion(identifier).value_or("");
    }
  });
  for (const auto& task : env_.session->allTasks()) {
    const auto identifier = task.originalRequest.headers.get(kTVXDownloadIdentifierHeader);
    if (!identifier) continue;
    auto& status = byIdentifier[*identifier];
    status.identifier = *identifier;
    if (status.url.empty()) status.url = urlForCompare(task.originalRequest.url).value_or(task.originalRequest.url);
    status.downloading = true;
    status.downloadStarted = task.started;
    status.downloadBeginDate = task.earliestBeginDate;
    status.bytesReceived = task.bytesReceived;
    status.bytesExpected = task.bytesExpected;
  }
  std::vector<DownloadResourceStatus> out;
  for (auto& [identifier, status] : byIdentifier) {
    if (auto path = pathToResource(identifier)) {
      struct stat st {};
      if (::stat(path->c_str(), &st) == 0) {
        status.fileSize = static_cast<std::int64_t>(st.st_size);
        status.fileModificationDate =
            platform::fromUnixSeconds(static_cast<double>(st.st_mtim.tv_sec) + st.st_mtim.tv_nsec / 1e9);
      }
    }
    out.push_back(std::move(status));
  }
  return out;
}

void DownloadManager::report(const std::string& reason) const {
  if (env_.reportError) env_.reportError(500, kTVXErrorDomain, reason);
}

}  // namespace tavix
