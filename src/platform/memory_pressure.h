// Memory-pressure events: the platform's memory-pressure dispatch source.
//
// A source delivers its handler on its queue whenever an event in its mask is raised. Events are
// raised by hand (raiseMemoryPressure, which the command-line tool's "memory-pressure" command
// reaches through the daemon); the kernel's PSI file is not watched yet.
//
// Threading: raiseMemoryPressure() is safe from any thread. A source is created, resumed and
// cancelled on its owner's queue; after cancel() (or destruction) its handler does not start.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "platform/dispatch.h"

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

}  // namespace tavix::platform
