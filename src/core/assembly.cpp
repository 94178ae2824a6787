#include "core/assembly.h"

#include <functional>
#include <mutex>

#include "platform/defaults.h"
#include "platform/http/url_session.h"

namespace tavix {

bool Assembly::useMarvola() const { return userDefaults && userDefaults->boolForKey("TVXUseMarvola"); }

namespace {

using platform::http::URLSession;
using platform::http::URLSessionConfiguration;

// Made once and never released: the sessions outlive every Assembly and run until the process
// ends, so each keeps a delegate queue of its own rather than one on a pool that may go first.
std::shared_ptr<URLSession> makeOnce(std::once_flag& once, std::shared_ptr<URLSession>*& slot,
                                     const std::function<URLSessionConfiguration()>& configure) {
  std::call_once(once, [&] { slot = new std::shared_ptr<URLSession>(std::make_shared<URLSession>(configure())); });
  return *slot;
}

}  // namespace

std::shared_ptr<URLSession> Assembly::urlSession() const {
  static std::once_flag once;
  static std::shared_ptr<URLSession>* session = nullptr;
  return makeOnce(once, session, [this] {
    // "Parallax" is the fast-connection pair: TCP Fast Open and TLS session resumption.
    const bool noParallax = userDefaults && userDefaults->boolForKey("TVXNoParallax");
    URLSessionConfiguration c;
    c.memoryCacheCapacity = 4194304;
    c.connectionIdleTimeout = std::chrono::seconds(10);
    c.tcpFastOpen = !noParallax;
    c.tlsSessionReuse = !noParallax;
    c.multiplexing = true;
    return c;
  });
}

std::shared_ptr<URLSession> Assembly::bagSession() const {
  static std::once_flag once;
  static std::shared_ptr<URLSession>* session = nullptr;
  return makeOnce(once, session, [] {
    URLSessionConfiguration c;
    c.connectionIdleTimeout = std::chrono::seconds(10);
    return c;
  });
}

std::shared_ptr<URLSession> Assembly::downloadURLSession() const {
  static std::once_flag once;
  static std::shared_ptr<URLSession>* session = nullptr;
  return makeOnce(once, session, [] {
    URLSessionConfiguration c;
    c.identifier = "com.norvel.tavixd";
    return c;
  });
}

std::shared_ptr<URLSession> Assembly::uploadURLSession() const {
  static std::once_flag once;
  static std::shared_ptr<URLSession>* session = nullptr;
  return makeOnce(once, session, [] {
    URLSessionConfiguration c;
    c.identifier = "com.norvel.tavixd.flusher.urlsession";
    c.timeoutIntervalForRequest = 300;
    c.timeoutIntervalForResource = 604800;
    return c;
  });
}

platform::fs::path Assembly::cachesFolder() const { return paths.cachesFolder(kTavixdDomain); }

}  // namespace tavix
