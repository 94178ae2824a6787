#include "platform/counters.h"

#include <cerrno>

#include "platform/property_value.h"

namespace tavix::platform {

std::shared_ptr<std::function<void()>> CounterStore::markDirty() {
  if (dirty_) return nullptr;
  dirty_ = true;
  return dirtyHandler_;
}

void CounterStore::notify(const std::shared_ptr<std::function<void()>>& handler) {
  if (handler && *handler) (*handler)();
}

void CounterStore::setDirtyHandler(std::function<void()> handler) {
  std::lock_guard<std::mutex> guard(lock_);
  dirtyHandler_ = std::make_shared<std::function<void()>>(std::move(handler));
}

void CounterStore::setValue(std::int64_t value, const std::string& key) {
  std::shared_ptr<std::function<void()>> handler;
  {
    std::lock_guard<std::mutex> guard(lock_);
    values_[key] = value;
    handler = markDirty();
  }
  notify(handler);
}

void CounterStore::addValue(std::int64_t delta, const std::string& key) {
  std::shared_ptr<std::function<void()>> handler;
  {
    std::lock_guard<std::mutex> guard(lock_);
    values_[key] += delta;
    handler = markDirty();
  }
  notify(handler);
}

void CounterStore::clear(const std::string& key) {
  std::shared_ptr<std::function<void()>> handler;
  {
    std::lock_guard<std::mutex> guard(lock_);
    if (values_.erase(key)) handler = markDirty();
  }
  notify(handler);
}

std::int64_t CounterStore::value(const std::string& key) const {
  std::lock_guard<std::mutex> guard(lock_);
  auto it = values_.find(key);
  return it == values_.end() ? 0 : it->second;
}

std::map<std::string, std::int64_t> CounterStore::snapshot() const {
  std::lock_guard<std::mutex> guard(lock_);
  return values_;
}

bool CounterStore::dirty() const {
  std::lock_guard<std::mutex> guard(lock_);
  return dirty_;
}

std::error_code CounterStore::read(const fs::path& file, std::map<std::string, std::int64_t>* out) {
  out->clear();
  std::string bytes;
  if (auto ec = readFile(file, &bytes)) return ec.value() == ENOENT ? std::error_code() : ec;
  auto parsed = parsePlist(bytes);
  if (!parsed || !parsed->dictionary()) return std::make_error_code(std::errc::illegal_byte_sequence);
  for (const auto& [key, value] : *parsed->dictionary()) {
    if (auto n = value.integer()) (*out)[key] = *n;
  }
  return {};
}

std::error_code CounterStore::load(const fs::path& file) {
  std::map<std::string, std::int64_t> loaded;
  if (auto ec = read(file, &loaded)) return ec;
  std::lock_guard<std::mutex> guard(lock_);
  values_ = std::move(loaded);
  dirty_ = false;
  return {};
}

std::error_code CounterStore::save(const fs::path& file) {
  Dictionary dict;
  {
    std::lock_guard<std::mutex> guard(lock_);
    for (const auto& [key, value] : values_) dict.emplace(key, PropertyValue(value));
    dirty_ = false;
  }
  auto ec = writeFileAtomically(file, toXmlPlist(PropertyValue(std::move(dict))), 0600);
  if (ec) {
    std::shared_ptr<std::function<void()>> handler;
    {
      std::lock_guard<std::mutex> guard(lock_);
      handler = markDirty();
    }
    notify(handler);
  }
  return ec;
}

}  // namespace tavix::platform
