#include "core/url_sessions.h"

#include "core/logging.h"
#include "platform/defaults.h"

namespace tavix {

using platform::http::URLSessionConfiguration;

namespace {

// Response bodies each session takes: search-family answers are a few kilobytes, the bag tens;
// resources are files the bag names; upload answers are acknowledgements.
constexpr std::size_t kQueryBodyLimit = 4 * 1024 * 1024;
constexpr std::size_t kBagBodyLimit = 2 * 1024 * 1024;
constexpr std::size_t kResourceBodyLimit = 64 * 1024 * 1024;
constexpr std::size_t kUploadReplyBodyLimit = 1024 * 1024;

}  // namespace

URLSessionConfiguration querySessionConfiguration(const platform::UserDefaults& defaults) {
  // "Parallax" is the fast-connection pair: TCP Fast Open and TLS session resumption.
  const bool noParallax = defaults.boolForKey("TVXNoParallax");
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
}

URLSessionConfiguration bagSessionConfiguration() {
  URLSessionConfiguration c;
  c.connectionIdleTimeout = std::chrono::seconds(10);
  c.requestTimeoutIsDeadline = true;
  c.maximumResponseBodySize = kBagBodyLimit;
  c.logger = &TavixLogForCategory(TavixLoggingCategoryBag);
  return c;
}

URLSessionConfiguration downloadSessionConfiguration() {
  URLSessionConfiguration c;
  c.identifier = "com.norvel.tavixd";
  c.maximumResponseBodySize = kResourceBodyLimit;
  c.logger = &TavixLogForCategory(TavixLoggingCategoryDownloadManager);
  return c;
}

URLSessionConfiguration uploadSessionConfiguration() {
  URLSessionConfiguration c;
  c.identifier = "com.norvel.tavixd.flusher.urlsession";
  c.timeoutIntervalForRequest = 300;
  c.timeoutIntervalForResource = 604800;
  c.maximumResponseBodySize = kUploadReplyBodyLimit;
  c.logger = &TavixLogForCategory(TavixLoggingCategoryUploadManager);
  return c;
}

}  // namespace tavix
