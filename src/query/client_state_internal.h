// Small helpers the query-path files of ClientState share. Not for use outside src/query.
#pragma once

#include <cstdint>
#include <string>

#include "feedback/tavix_feedback.h"
#include "platform/clock.h"
#include "platform/http/url_request.h"

namespace tavix::query_internal {

// Event time stamps follow the daemon's clock (nanoseconds), so that records and sessions agree,
// also on a virtual clock.
inline std::uint64_t eventTimestamp(const platform::Clock& clock) { return hostTicksNow(&clock); }

// "Name: value, Name: value" for the protocol log.
inline std::string headersText(const platform::http::HeaderFields& headers) {
  std::string out;
  for (const auto& [name, value] : headers.all()) {
    if (!out.empty()) out += ", ";
    out += name + ": " + value;
  }
  return out;
}

}  // namespace tavix::query_internal
