// What start-up makes for resource files, in a temp home: a background session over the journal
// and a download manager on it. A test adjusts `env` before `start()`; `start()` again is a
// daemon restart over the same journal and defaults.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/names.h"
#include "platform/clock.h"
#include "platform/defaults.h"
#include "platform/dispatch.h"
#include "platform/http/url_session.h"
#include "platform/log.h"
#include "platform/notification_center.h"
#include "resources/download_manager.h"
#include "support/temp_home.h"

namespace tavix::testing {

struct Downloads {
  Downloads(const TempHome& home, platform::DispatchPool& pool, platform::Clock& clock)
      : journal(home.cache() / "journal"),
        transport(std::make_shared<platform::http::URLSession>(
            platform::http::URLSessionConfiguration{.delegatePool = &pool})),
        defaults(std::make_shared<platform::UserDefaults>(home.config(), kTavixdDomain)) {
    env.pool = &pool;
    env.clock = &clock;
    env.center = center;
    env.defaults = defaults;
    env.cachesFolder = home.cache() / kTavixdDomain;
    env.fileDownloadRequest = [](const std::string& url, std::optional<std::string>, bool) {
      return std::optional(platform::http::URLRequest{url});
    };
  }
  void start() {
    manager.reset();
    session = platform::http::BackgroundDownloadSession::create(transport, journal, *env.pool, *env.clock, log);
    env.session = session;
    manager = DownloadManager::create(env);
  }
  std::string file(const std::string& identifier) const { return readFile(env.cachesFolder / identifier); }

  platform::fs::path journal;
  platform::Logger log{kTavixdDomain, "test"};
  std::shared_ptr<platform::http::URLSession> transport;
  std::shared_ptr<platform::NotificationCenter> center = std::make_shared<platform::NotificationCenter>();
  std::shared_ptr<platform::UserDefaults> defaults;
  DownloadManager::Environment env;
  std::shared_ptr<platform::http::BackgroundDownloadSession> session;
  std::shared_ptr<DownloadManager> manager;
};

}  // namespace tavix::testing
