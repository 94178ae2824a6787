#include "core/assembly.h"

#include <functional>
#include <mutex>

#include "core/logging.h"
#include "platform/defaults.h"
#include "platform/http/url_session.h"

namespace tavix {

namespace {

using platform::http::URLSession;
using platform::http::URLSessionConfiguration;

// Response bodies each session takes: search-family answers are a few kilobytes, the bag tens;
// resources are files the bag names; upload answers are acknowledgements.
constexpr std::size_t kQueryBodyLimit = 4 * 1024 * 1024;
constexpr std::size_t kBagBodyLimit = 2 * 1024 * 1024;
constexpr std::size_t kResourceBodyLimit = 64 * 1024 * 1024;
constexpr std::size_t kUploadReplyBodyLimit = 1024 * 1024;

std::shared_ptr<URLSession> makeOnce(std::once_flag& once, std::shared_ptr<URLSession>& slot,
                                     const std::function<URLSessionConfiguration()>& configure) {
  std::call_once(once, [&] { slot = std::make_shared<URLSession>(configure()); });
  return slot;
}

}  // namespace

struct Assembly::Sessions {
  std::once_flag queryOnce, bagOnce, downloadOnce, uploadOnce;
  std::shared_ptr<URLSession> query, bag, download, upload;
};

Assembly::Assembly() : sessions_(std::make_unique<Sessions>()) {}
Assembly::~Assembly() = default;

std::shared_ptr<URLSession> Assembly::urlSession() const {
  return makeOnce(sessions_->queryOnce, sessions_->query, [this] {
    // "Parallax" is the fast-connection pair: TCP Fast Open and TLS session resumption.
    const bool noParallax = userDefaults && userDefaults->boolForKey("TVXNoParallax");
    URLSessionConfiguration c;
    c.memoryCacheCapacity = 4194304;
    c.connectionIdleTimeout = std::chrono::seconds(10);
    c.tcpFastOpen = !noParallax;
    c.tlsSessionReuse = !noParallax;
    c.multiplexing = true;
    // A client waits on every query: the bag's request time-out bounds each one in all.
    c.requestTimeoutIsDeadline = true;
    c.maximumResponseBodySize = kQueryBodyLimit;
    c.logger = &TavixLogForCategory(TavixLoggingCategoryConnection);
    return c;
  });
}

std::shared_ptr<URLSession> Assembly::bagSession() const {
  return makeOnce(sessions_->bagOnce, sessions_->bag, [] {
    URLSessionConfiguration c;
    c.connectionIdleTimeout = std::chrono::seconds(10);
    c.requestTimeoutIsDeadline = true;
    c.maximumResponseBodySize = kBagBodyLimit;
    c.logger = &TavixLogForCategory(TavixLoggingCategoryBag);
    return c;
  });
}

std::shared_ptr<URLSession> Assembly::downloadURLSession() const {
  return makeOnce(sessions_->downloadOnce, sessions_->download, [] {
    URLSessionConfiguration c;
    c.identifier = "com.norvel.tavixd";
    c.maximumResponseBodySize = kResourceBodyLimit;
    c.logger = &TavixLogForCategory(TavixLoggingCategoryDownloadManager);
    return c;
  });
}

std::shared_ptr<URLSession> Assembly::uploadURLSession() const {
  return makeOnce(sessions_->uploadOnce, sessions_->upload, [] {
    URLSessionConfiguration c;
    c.identifier = "com.norvel.tavixd.flusher.urlsession";
    c.timeoutIntervalForRequest = 300;
    c.timeoutIntervalForResource = 604800;
    c.maximumResponseBodySize = kUploadReplyBodyLimit;
    c.logger = &TavixLogForCategory(TavixLoggingCategoryUploadManager);
    return c;
  });
}

platform::fs::path Assembly::cachesFolder() const { return paths.cachesFolder(kTavixdDomain); }

}  // namespace tavix
