// Requests that survive transport failures: a data task that, on a transport error, starts a
// fresh task for the same request until its retries are spent or its deadline has passed.
// HTTP statuses, whatever they are, end the loop: only the transport is retried.
#pragma once

#include <cstdint>
#include <memory>
#include <functional>
#include <optional>
#include <string>

#include "platform/clock.h"
#include "platform/http/url_session.h"

namespace tavix {

class TVXRetryableNetworkRequest {
 public:
  // `expire` none means the request has no deadline: it is retried until its retries are spent
  // (the bag fetch relies on this). `proxy` (a URL) is set on every attempt's task.
  TVXRetryableNetworkRequest(platform::http::URLRequest httpRequest, std::optional<platform::TimePoint> expire,
                             bool delayOnFail, std::optional<std::string> proxy = std::nullopt)
      : httpRequest_(std::move(httpRequest)), expire_(expire), delayOnFail_(delayOnFail), proxy_(std::move(proxy)) {}

  const platform::http::URLRequest& httpRequest() const { return httpRequest_; }
  void setHttpRequest(platform::http::URLRequest request) { httpRequest_ = std::move(request); }
  std::optional<platform::TimePoint> expire() const { return expire_; }
  void setExpire(std::optional<platform::TimePoint> expire) { expire_ = expire; }
  bool delayOnFail() const { return delayOnFail_; }
  void setDelayOnFail(bool delayOnFail) { delayOnFail_ = delayOnFail; }
  const std::optional<std::string>& proxy() const { return proxy_; }

 private:
  platform::http::URLRequest httpRequest_;
  std::optional<platform::TimePoint> expire_;
  bool delayOnFail_;
  std::optional<std::string> proxy_;
};

// A data task's outcome together with the timing of the task that produced it.
using TimedDataTaskCompletion =
    std::function<void(std::string data, std::optional<platform::http::HTTPURLResponse> response,
                       std::optional<platform::http::URLError> error, const platform::http::URLSessionTaskMetrics&)>;

// A plain data task on `session`, not yet resumed, whose completion also hears its timing.
std::shared_ptr<platform::http::URLSessionDataTask> dataTaskWithTiming(
    const std::shared_ptr<platform::http::URLSession>& session, const platform::http::URLRequest& request,
    TimedDataTaskCompletion completion);

// Pause before a retry when the request asks for one.
inline constexpr double kTVXRetryDelaySeconds = 1.5;

// The first data task of the loop, not yet resumed: the caller resumes it. Later attempts are
// made and resumed by the loop itself, on `retryQueue` (after the delay, timed by `clock`, which
// also judges the deadline). `completion` is called once, with the outcome and the timing of the
// last attempt, on the session's delegate queue. The session is held weakly between attempts; if
// it is gone the last error is reported. `retryQueue` must outlive the loop.
std::shared_ptr<platform::http::URLSessionDataTask> dataTaskWithRetryableRequest(
    const std::shared_ptr<platform::http::URLSession>& session,
    std::shared_ptr<const TVXRetryableNetworkRequest> request, int attempt, int retriesLeft, platform::Clock& clock,
    platform::SerialQueue& retryQueue, TimedDataTaskCompletion completion);

// The number of feedback records a task carries, kept on the task itself.
void setNumberOfFeedbacks(platform::http::URLSessionDataTask& task, std::optional<std::int64_t> count);
std::optional<std::int64_t> numberOfFeedbacks(const platform::http::URLSessionDataTask& task);

}  // namespace tavix
