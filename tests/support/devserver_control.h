// Requests to the devserver from a test, mostly to its control routes (/_faults, /_recorded,
// /_reset): header-only, so that test binaries that never talk HTTP need not link it.
#pragma once

#include <future>
#include <memory>
#include <string>

#include "platform/http/url_session.h"

namespace tavix::testing {

// The body of the devserver's answer to `method` `path`, sent on `session`.
inline std::string devserverCall(platform::http::URLSession& session, const std::string& base,
                                 const std::string& path, const std::string& method = "GET", std::string body = {}) {
  platform::http::URLRequest request;
  request.url = base + path;
  request.method = method;
  request.body = std::move(body);
  auto done = std::make_shared<std::promise<std::string>>();
  auto answer = done->get_future();
  session.dataTask(request, [done](std::string data, auto, auto) { done->set_value(std::move(data)); })->resume();
  return answer.get();
}

}  // namespace tavix::testing
