// Requests that survive transport failures: a data task that, on a transport error, starts a
// fresh task for the same request until its retries are spent or its deadline has passed.
// HTTP statuses, whatever they are, end the loop: only the transport is retried.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>

#include "platform/clock.h"
#include "platform/http/url_session.h"

namespace tavix {

class TVXRetryableNetworkRequest {
 public:
  // `expire` none means the request has no deadline: it is retried until its retries are spent
  // (the bag fetch, more results and cards rely on this).
  TVXRetryableNetworkRequest(platform::http::URLRequest httpRequest, std::optional<platform::TimePoint> expire,
                             bool delayOnFail)
      : httpRequest_(std::move(httpRequest)), expire_(expire), delayOnFail_(delayOnFail) {}

  const platform::http::URLRequest& httpRequest() const { return httpRequest_; }
  void setHttpRequest(platform::http::URLRequest request) { httpRequest_ = std::move(request); }
  std::optional<platform::TimePoint> expire() const { return expire_; }
  void setExpire(std::optional<platform::TimePoint> expire) { expire_ = expire; }
  bool delayOnFail() const { return delayOnFail_; }
  void setDelayOnFail(bool delayOnFail) { delayOnFail_ = delayOnFail; }

 private:
  platform::http::URLRequest httpRequest_;
  std::optional<platform::TimePoint> expire_;
  bool delayOnFail_;
};

// Pause before a retry when the request asks for one.
inline constexpr double kTVXRetryDelaySeconds = 1.5;

// The first data task of the loop, not yet resumed: the caller resumes it. Later attempts are
// made and resumed by the loop itself, on `retryQueue` (after the delay, timed by `clock`, which
// also judges the deadline). `completion` is called once, with the outcome of the last attempt,
// on the session's delegate queue. The session is held weakly between attempts; if it is gone
// the last error is reported. `retryQueue` must outlive the loop.
std::shared_ptr<platform::http::URLSessionDataTask> dataTaskWithRetryableRequest(
    const std::shared_ptr<platform::http::URLSession>& session,
    std::shared_ptr<const TVXRetryableNetworkRequest> request, int attempt, int retriesLeft, platform::Clock& clock,
    platform::SerialQueue& retryQueue, platform::http::DataTaskCompletion completion);

// The number of feedback records a task carries, kept on the task itself.
void setNumberOfFeedbacks(platform::http::URLSessionDataTask& task, std::optional<std::int64_t> count);
std::optional<std::int64_t> numberOfFeedbacks(const platform::http::URLSessionDataTask& task);

}  // namespace tavix
