// Memory-pressure events: the platform's memory-pressure dispatch source.
//
// A source delivers its handler on its queue whenever an event in its mask is raised. Events come
// from the kernel's pressure-stall information (PressureStallMonitor over /proc/pressure/memory,
// where readable) or are raised by hand (raiseMemoryPressure, for the tool's "memory-pressure").
//
// Threading: raiseMemoryPressure() is safe from any thread. A source is created, resumed and
// cancelled on its owner's queue; after cancel() (or destruction) its handler does not start.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include <optional>
#include <string_view>

#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/log.h"

namespace tavix::platform {

enum MemoryPressureEvent : std::uint32_t {
  MemoryPressureNormal = 0x1,
  MemoryPressureWarn = 0x2,
  MemoryPressureCritical = 0x4,
  MemoryPressureProcessLimitWarn = 0x10,
  MemoryPressureProcessLimitCritical = 0x20,
};

class MemoryPressureSource {
 public:
  // `queue` must outlive the source. The handler receives the raised event.
  MemoryPressureSource(std::uint32_t mask, SerialQueue& queue, std::function<void(std::uint32_t)> handler);
  ~MemoryPressureSource();
  MemoryPressureSource(const MemoryPressureSource&) = delete;
  MemoryPressureSource& operator=(const MemoryPressureSource&) = delete;

  // Starts delivery; a new source is suspended.
  void resume();
  void cancel();

  struct State;

 private:
  std::shared_ptr<State> state_;
};

// Delivers `event` to every resumed source whose mask contains it.
void raiseMemoryPressure(std::uint32_t event);

// Raises critical pressure (MemoryPressureCritical | MemoryPressureProcessLimitCritical) when the
// share of time in which every task stalled on memory reaches `thresholdPercent`: once per rise,
// and again only after the share fell below the threshold. Start and stop it on `queue`.
//
// Where the kernel offers it, a PSI trigger on `file` (a "full" stall of that share of each
// `interval`) wakes the monitor only when pressure comes; the process sleeps meanwhile. Elsewhere
// (a plain file, or a kernel or container that refuses triggers) it reads the file's
// "full avg10" every `interval`.
class PressureStallMonitor {
 public:
  PressureStallMonitor(Clock& clock, SerialQueue& queue, fs::path file = "/proc/pressure/memory",
                       double thresholdPercent = 10, Duration interval = seconds(2));
  ~PressureStallMonitor();
  // False (and nothing started) when the file cannot be read or parsed. A trigger the kernel
  // refuses is logged to `log`, once, before the monitor falls back to reading the file.
  bool start(Logger* log = nullptr);
  void stop();
  // True while the kernel's trigger, not a timer, drives the monitor.
  bool triggered() const { return trigger_ != nullptr; }

  // The "full avg10" value of a PSI file's text, or nullopt.
  static std::optional<double> fullAverage10(std::string_view text);

 private:
  void poll();
  bool startTrigger(Logger* log);

  struct Trigger;
  Clock& clock_;
  SerialQueue& queue_;
  std::shared_ptr<Trigger> trigger_;
  fs::path file_;
  double threshold_;
  Duration interval_;
  RepeatingTimer timer_;
  bool raised_ = false;
};

}  // namespace tavix::platform
