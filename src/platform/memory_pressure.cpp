#include "platform/memory_pressure.h"

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <string>
#include <mutex>
#include <vector>

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

PressureStallMonitor::PressureStallMonitor(Clock& clock, SerialQueue& queue, fs::path file, double thresholdPercent,
                                           Duration interval)
    : file_(std::move(file)), threshold_(thresholdPercent), interval_(interval), timer_(clock, queue) {}

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

bool PressureStallMonitor::start() {
  std::string text;
  if (readFile(file_, &text) || !fullAverage10(text)) return false;
  timer_.start(interval_, [this] { poll(); });
  return true;
}

void PressureStallMonitor::stop() { timer_.stop(); }

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
