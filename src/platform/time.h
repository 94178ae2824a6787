// Points in time and durations, as every part of the daemon counts them. A small header on
// purpose: values that carry dates (property lists, records) need it without the timer machinery.
#pragma once

#include <chrono>

namespace tavix::platform {

using TimePoint = std::chrono::system_clock::time_point;
using Duration = std::chrono::system_clock::duration;

// Seconds as a Duration, for the many limits expressed in seconds. Limits come from the bag and
// from clients: seconds beyond what a Duration holds saturate (the conversion would be undefined),
// and NaN reads as zero.
constexpr Duration seconds(double s) {
  constexpr double most = std::chrono::duration<double>(Duration::max()).count() * 0.999;
  if (s != s) return Duration::zero();
  if (s > most) s = most;
  if (s < -most) s = -most;
  return std::chrono::duration_cast<Duration>(std::chrono::duration<double>(s));
}
// `t` moved by `s` seconds, saturating at the ends of what a TimePoint holds: expiries that come
// from a server ("max_age") may be anything.
TimePoint addSeconds(TimePoint t, double s);

// Seconds since the Unix epoch, and back; the way back saturates as seconds() does.
double toUnixSeconds(TimePoint t);
TimePoint fromUnixSeconds(double s);

}  // namespace tavix::platform
