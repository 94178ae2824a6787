#include "network/retryable_request.h"

#include <any>

#include "platform/dispatch.h"

namespace tavix {

using platform::http::DataTaskCompletion;
using platform::http::HTTPURLResponse;
using platform::http::URLError;
using platform::http::URLSession;
using platform::http::URLSessionDataTask;

namespace {

std::shared_ptr<URLSessionDataTask> startAttempt(const std::shared_ptr<URLSession>& session,
                                                 std::shared_ptr<const TVXRetryableNetworkRequest> request,
                                                 int attempt, int retriesLeft, platform::Clock& clock,
                                                 platform::SerialQueue& retryQueue,
                                                 std::shared_ptr<DataTaskCompletion> completion) {
  std::weak_ptr<URLSession> weakSession = session;
  return session->dataTask(
      request->httpRequest(),
      [weakSession, request, attempt, retriesLeft, &clock, &retryQueue, completion](
          std::string data, std::optional<HTTPURLResponse> response, std::optional<URLError> error) {
        if (!error) {
          (*completion)(std::move(data), std::move(response), std::nullopt);
          return;
        }
        const auto expire = request->expire();
        if ((expire && clock.now() > *expire) || retriesLeft == 0) {
          (*completion)(std::move(data), std::move(response), std::move(error));
          return;
        }
        auto retry = [weakSession, request, attempt, retriesLeft, &clock, &retryQueue, completion, error] {
          auto session = weakSession.lock();
          if (!session) {
            (*completion)({}, std::nullopt, error);
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
}

}  // namespace

std::shared_ptr<URLSessionDataTask> dataTaskWithRetryableRequest(
    const std::shared_ptr<URLSession>& session, std::shared_ptr<const TVXRetryableNetworkRequest> request,
    int attempt, int retriesLeft, platform::Clock& clock, platform::SerialQueue& retryQueue,
    DataTaskCompletion completion) {
  return startAttempt(session, std::move(request), attempt, retriesLeft, clock, retryQueue,
                      std::make_shared<DataTaskCompletion>(std::move(completion)));
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
