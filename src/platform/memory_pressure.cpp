#include "platform/memory_pressure.h"

#include <algorithm>
#include <atomic>
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

}  // namespace tavix::platform
