#include "platform/memory_pressure.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <mutex>
#include <vector>

#include <asio/post.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/strand.hpp>

#include "platform/asio_context.h"

namespace tavix::platform {

struct MemoryPressureSource::State {
  std::uint32_t mask;
  SerialQueue* queue;
  std::function<void(std::uint32_t)> handler;
  std::atomic<bool> cancelled{false};
};

namespace {

std::mutex& registryLock() {
  static std::mutex lock;
  return lock;
}

std::vector<std::weak_ptr<MemoryPressureSource::State>>& registry() {
  static std::vector<std::weak_ptr<MemoryPressureSource::State>> sources;
  return sources;
}

}  // namespace

MemoryPressureSource::MemoryPressureSource(std::uint32_t mask, SerialQueue& queue,
                                           std::function<void(std::uint32_t)> handler)
    : state_(std::make_shared<State>()) {
  state_->mask = mask;
  state_->queue = &queue;
  state_->handler = std::move(handler);
}

MemoryPressureSource::~MemoryPressureSource() { cancel(); }

void MemoryPressureSource::resume() {
  std::lock_guard<std::mutex> guard(registryLock());
  registry().push_back(state_);
}

void MemoryPressureSource::cancel() {
  state_->cancelled = true;
  std::lock_guard<std::mutex> guard(registryLock());
  auto& sources = registry();
  sources.erase(std::remove_if(sources.begin(), sources.end(),
                               [&](const auto& weak) {
                                 auto s = weak.lock();
                                 return !s || s == state_;
                               }),
                sources.end());
}

void raiseMemoryPressure(std::uint32_t event) {
  std::vector<std::shared_ptr<MemoryPressureSource::State>> targets;
  {
    std::lock_guard<std::mutex> guard(registryLock());
    for (const auto& weak : registry()) {
      if (auto s = weak.lock(); s && (s->mask & event)) targets.push_back(s);
    }
  }
  for (auto& s : targets) {
    s->queue->async([s, event] {
      if (!s->cancelled) s->handler(event);
    });
  }
}

// A PSI trigger: the kernel marks its descriptor with POLLPRI at most once per window in which
// the stall passed the threshold. Waited on by the pool's reactor; judged on the monitor's queue.
struct PressureStallMonitor::Trigger : std::enable_shared_from_this<Trigger> {
  Trigger(SerialQueue& queue, Clock& clock, Duration window, int fd)
      : descriptor(asio::make_strand(asioContext(queue.pool())), fd), queue(queue), clock(clock), window(window) {}

  void wait() {
    descriptor.async_wait(asio::posix::stream_descriptor::wait_error, [self = shared_from_this()](const std::error_code& ec) {
      if (ec || self->stopped.load()) return;
      self->queue.async([self] {
        if (!self->stopped.load()) self->fired();
      });
      self->wait();
    });
  }

  // Events come once a window while the stall lasts: a gap of more than two windows means it
  // fell below the threshold in between, and the next event is a new rise.
  void fired() {
    const TimePoint now = clock.now();
    const bool rise = !lastEvent || now - *lastEvent > 2 * window;
    lastEvent = now;
    if (rise) raiseMemoryPressure(MemoryPressureCritical | MemoryPressureProcessLimitCritical);
  }

  void close() {
    stopped = true;
    asio::post(descriptor.get_executor(), [self = shared_from_this()] {
      std::error_code ignored;
      self->descriptor.close(ignored);
    });
  }

  asio::posix::stream_descriptor descriptor;  // on its strand: the close may race the wait otherwise
  SerialQueue& queue;
  Clock& clock;
  const Duration window;
  std::atomic<bool> stopped{false};
  std::optional<TimePoint> lastEvent;  // on `queue`
};

PressureStallMonitor::PressureStallMonitor(Clock& clock, SerialQueue& queue, fs::path file, double thresholdPercent,
                                           Duration interval)
    : clock_(clock),
      queue_(queue),
      file_(std::move(file)),
      threshold_(thresholdPercent),
      interval_(interval),
      timer_(clock, queue) {}

PressureStallMonitor::~PressureStallMonitor() {
  if (trigger_) trigger_->close();
}

std::optional<double> PressureStallMonitor::fullAverage10(std::string_view text) {
  std::size_t line = text.find("full ");
  if (line == std::string_view::npos) return std::nullopt;
  std::size_t key = text.find("avg10=", line);
  if (key == std::string_view::npos) return std::nullopt;
  std::string value(text.substr(key + 6, text.find(' ', key) - key - 6));
  char* end = nullptr;
  double v = std::strtod(value.c_str(), &end);
  if (end == value.c_str()) return std::nullopt;
  return v;
}

bool PressureStallMonitor::start(Logger* log) {
  std::string text;
  if (readFile(file_, &text) || !fullAverage10(text)) return false;
  if (startTrigger(log)) return true;
  timer_.start(interval_, [this] { poll(); });
  return true;
}

bool PressureStallMonitor::startTrigger(Logger* log) {
  // Only the kernel's own file takes a trigger; writing one into a plain file would change it.
  struct statfs fsInfo {};
  if (::statfs(file_.c_str(), &fsInfo) != 0 || fsInfo.f_type != PROC_SUPER_MAGIC) return false;
  const auto windowUs = std::chrono::duration_cast<std::chrono::microseconds>(interval_).count();
  const auto stallUs = std::clamp<long long>(static_cast<long long>(windowUs * threshold_ / 100), 1, windowUs);
  const std::string line = "full " + std::to_string(stallUs) + " " + std::to_string(windowUs);
  const int fd = ::open(file_.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0 || ::write(fd, line.c_str(), line.size() + 1) < 0) {
    // Containers and older kernels refuse (EACCES, EPERM, EROFS, EINVAL): reading the file still works.
    const int error = errno;
    if (fd >= 0) ::close(fd);
    if (log) {
      log->info("no memory pressure trigger on {} ({}); reading it every {} s instead", file_.string(),
                std::strerror(error), std::chrono::duration<double>(interval_).count());
    }
    return false;
  }
  trigger_ = std::make_shared<Trigger>(queue_, clock_, interval_, fd);
  trigger_->wait();
  return true;
}

void PressureStallMonitor::stop() {
  timer_.stop();
  if (trigger_) trigger_->close();
  trigger_.reset();
}

void PressureStallMonitor::poll() {
  std::string text;
  if (readFile(file_, &text)) return;
  auto full = fullAverage10(text);
  if (!full) return;
  if (*full >= threshold_) {
    if (!raised_) raiseMemoryPressure(MemoryPressureCritical | MemoryPressureProcessLimitCritical);
    raised_ = true;
  } else {
    raised_ = false;
  }
}

}  // namespace tavix::platform
