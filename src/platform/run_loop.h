// The main thread's run loop and the process's signal sources.
#pragma once

#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>

#include "platform/dispatch.h"

namespace tavix::platform {

// Parks the main thread until stop() is called from any thread. The daemon's work happens on the
// pool; the main thread only waits, then leads the orderly shutdown.
class RunLoop {
 public:
  void run();
  void stop();
  bool isStopped() const;

 private:
  mutable std::mutex lock_;
  std::condition_variable wake_;
  bool stopped_ = false;
};

// Delivers a POSIX signal to a handler on the pool instead of in signal context. While the
// source lives, the signal's default action (ending the process) does not happen.
class SignalSource {
 public:
  SignalSource(DispatchPool& pool, int signo, std::function<void()> handler);
  ~SignalSource();
  SignalSource(const SignalSource&) = delete;
  SignalSource& operator=(const SignalSource&) = delete;

 private:
  struct Impl;
  std::shared_ptr<Impl> impl_;
};

}  // namespace tavix::platform
