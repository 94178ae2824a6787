#include "support/http_helpers.h"

#include <gtest/gtest.h>

#include <chrono>
#include <future>

namespace tavix::testing {

HTTPOutcome fetch(platform::http::URLSession& session, platform::http::URLRequest request,
                  std::shared_ptr<platform::http::URLSessionDataTask>* keep) {
  auto calls = std::make_shared<std::atomic<int>>(0);
  std::promise<HTTPOutcome> done;
  auto task = session.dataTask(std::move(request), [&done, calls](std::string data, auto response, auto error) {
    if (++*calls == 1) done.set_value({std::move(data), std::move(response), std::move(error), {}, calls});
  });
  task->resume();
  auto future = done.get_future();
  EXPECT_EQ(future.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  HTTPOutcome outcome = future.get();
  outcome.metrics = task->metrics();
  if (keep) *keep = task;
  return outcome;
}

}  // namespace tavix::testing
