#include "network/retryable_request.h"

#include <any>
#include <utility>

#include "platform/dispatch.h"

namespace tavix {

using platform::http::HTTPURLResponse;
using platform::http::URLError;
using platform::http::URLSession;
using platform::http::URLSessionDataTask;
using platform::http::URLSessionTaskMetrics;

namespace {

std::shared_ptr<URLSessionDataTask> startAttempt(const std::shared_ptr<URLSession>& session,
                                                 std::shared_ptr<const TVXRetryableNetworkRequest> request,
                                                 int attempt, int retriesLeft, platform::Clock& clock,
                                                 platform::SerialQueue& retryQueue,
                                                 std::shared_ptr<TimedDataTaskCompletion> completion) {
  std::weak_ptr<URLSession> weakSession = session;
  auto task = dataTaskWithTiming(
      session, request->httpRequest(),
      [weakSession, request, attempt, retriesLeft, &clock, &retryQueue, completion](
          std::string data, std::optional<HTTPURLResponse> response, std::optional<URLError> error,
          const URLSessionTaskMetrics& metrics) {
        if (!error) {
          (*completion)(std::move(data), std::move(response), std::nullopt, metrics);
          return;
        }
        const auto expire = request->expire();
        if ((expire && clock.now() > *expire) || retriesLeft == 0) {
          (*completion)(std::move(data), std::move(response), std::move(error), metrics);
          return;
        }
        auto retry = [weakSession, request, attempt, retriesLeft, &clock, &retryQueue, completion, error, metrics] {
          auto session = weakSession.lock();
          if (!session) {
            (*completion)({}, std::nullopt, error, metrics);
            return;
          }
          startAttempt(session, request, attempt + 1, retriesLeft - 1, clock, retryQueue, completion)->resume();
        };
        if (request->delayOnFail()) {
          clock.after(platform::seconds(kTVXRetryDelaySeconds), retryQueue, std::move(retry));
        } else {
          retryQueue.async(std::move(retry));
        }
      });
  if (request->proxy()) task->setProxy(*request->proxy());
  return task;
}

}  // namespace

std::shared_ptr<URLSessionDataTask> dataTaskWithTiming(const std::shared_ptr<URLSession>& session,
                                                       const platform::http::URLRequest& request,
                                                       TimedDataTaskCompletion completion) {
  // The timing lives on the task, which exists only once dataTask() returns; the completion lets
  // go of it, which breaks the cycle task -> completion -> holder -> task.
  auto holder = std::make_shared<std::shared_ptr<URLSessionDataTask>>();
  auto task = session->dataTask(request, [holder, completion = std::move(completion)](
                                             std::string data, std::optional<HTTPURLResponse> response,
                                             std::optional<URLError> error) {
    URLSessionTaskMetrics metrics;
    if (auto task = std::exchange(*holder, nullptr)) metrics = task->metrics();
    completion(std::move(data), std::move(response), std::move(error), metrics);
  });
  *holder = task;
  return task;
}

std::shared_ptr<URLSessionDataTask> dataTaskWithRetryableRequest(
    const std::shared_ptr<URLSession>& session, std::shared_ptr<const TVXRetryableNetworkRequest> request,
    int attempt, int retriesLeft, platform::Clock& clock, platform::SerialQueue& retryQueue,
    TimedDataTaskCompletion completion) {
  return startAttempt(session, std::move(request), attempt, retriesLeft, clock, retryQueue,
                      std::make_shared<TimedDataTaskCompletion>(std::move(completion)));
}

namespace {
constexpr const char* kNumberOfFeedbacksKey = "numberOfFeedbacks";
}

void setNumberOfFeedbacks(URLSessionDataTask& task, std::optional<std::int64_t> count) {
  task.setValue(kNumberOfFeedbacksKey, count ? std::any(*count) : std::any());
}

std::optional<std::int64_t> numberOfFeedbacks(const URLSessionDataTask& task) {
  const std::any value = task.value(kNumberOfFeedbacksKey);
  if (const auto* count = std::any_cast<std::int64_t>(&value)) return *count;
  return std::nullopt;
}

}  // namespace tavix
