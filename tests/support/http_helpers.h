// One URL session task run to its end, for tests that talk HTTP on loopback.
#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>

#include "platform/http/url_session.h"

namespace tavix::testing {

struct HTTPOutcome {
  std::string data;
  std::optional<platform::http::HTTPURLResponse> response;
  std::optional<platform::http::URLError> error;
  platform::http::URLSessionTaskMetrics metrics;
  // How often the completion ran; checked after the delegate pool drained, a second call is a fault.
  std::shared_ptr<std::atomic<int>> completions;
};

// Resumes the task and waits for its first completion. `keep` receives the task.
HTTPOutcome fetch(platform::http::URLSession& session, platform::http::URLRequest request,
                  std::shared_ptr<platform::http::URLSessionDataTask>* keep = nullptr);

}  // namespace tavix::testing
