// Points in time and durations, as every part of the daemon counts them. A small header on
// purpose: values that carry dates (property lists, records) need it without the timer machinery.
#pragma once

#include <chrono>

namespace tavix::platform {

using TimePoint = std::chrono::system_clock::time_point;
using Duration = std::chrono::system_clock::duration;

// Seconds as a Duration, for the many limits expressed in seconds.
constexpr Duration seconds(double s) {
  return std::chrono::duration_cast<Duration>(std::chrono::duration<double>(s));
}
// Seconds since the Unix epoch, and back.
double toUnixSeconds(TimePoint t);
TimePoint fromUnixSeconds(double s);

}  // namespace tavix::platform
