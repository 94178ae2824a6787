#include "platform/defaults.h"

#include <algorithm>
#include <cerrno>

#include "platform/file_watcher.h"
#include "platform/log.h"

namespace tavix::platform {

struct UserDefaults::Subscription::Entry {
  std::recursive_mutex lock;  // held while the observer runs; recursive so it may unsubscribe itself
  bool alive = true;
  Observer observer;
};

UserDefaults::Subscription::~Subscription() { reset(); }

void UserDefaults::Subscription::reset() {
  if (!entry_) return;
  std::lock_guard<std::recursive_mutex> guard(entry_->lock);
  entry_->alive = false;
  entry_.reset();
}

UserDefaults::UserDefaults(fs::path folder, std::string domain, Logger* log)
    : folder_(std::move(folder)), domain_(std::move(domain)), log_(log) {
  Loaded loaded = load();
  persistent_ = std::move(loaded.values);
}

UserDefaults::~UserDefaults() {
  watcher_.reset();
  watchQueue_.reset();
}

fs::path UserDefaults::filePath() const { return folder_ / (domain_ + ".plist"); }

UserDefaults::Loaded UserDefaults::load() const {
  std::string bytes;
  if (auto ec = readFile(filePath(), &bytes)) {
    if (ec.value() != ENOENT && log_) log_->error("cannot read defaults {}: {}", filePath().string(), ec.message());
    return {ec.value() == ENOENT, {}};
  }
  auto value = parsePlist(bytes);
  if (!value || !value->dictionary()) {
    if (log_) log_->error("defaults file {} is not a property-list dictionary; ignoring it", filePath().string());
    return {false, {}};
  }
  return {true, std::move(*value->dictionary())};
}

bool UserDefaults::save(const Dictionary& values) {
  if (auto ec = createDirectory(folder_, true, 0700)) {
    if (log_) log_->error("cannot create defaults folder {}: {}", folder_.string(), ec.message());
    return false;
  }
  const PropertyValue plist(values);
  if (!plistCanHold(plist)) {
    if (log_) log_->error("cannot write defaults {}: a string holds U+0000", filePath().string());
    return false;
  }
  if (auto ec = writeFileAtomically(filePath(), toXmlPlist(plist), 0600)) {
    if (log_) log_->error("cannot write defaults {}: {}", filePath().string(), ec.message());
    return false;
  }
  return true;
}

void UserDefaults::registerDefaults(const Dictionary& values) {
  std::unique_lock<std::shared_mutex> guard(lock_);
  for (const auto& [key, value] : values) registered_.insert_or_assign(key, value);
}

std::optional<PropertyValue> UserDefaults::objectForKey(std::string_view key) const {
  std::shared_lock<std::shared_mutex> guard(lock_);
  const std::string k(key);
  if (auto it = persistent_.find(k); it != persistent_.end()) return it->second;
  if (auto it = registered_.find(k); it != registered_.end()) return it->second;
  return std::nullopt;
}

bool UserDefaults::boolForKey(std::string_view key) const {
  auto v = objectForKey(key);
  return v ? v->asBool().value_or(false) : false;
}

std::int64_t UserDefaults::integerForKey(std::string_view key) const {
  auto v = objectForKey(key);
  return v ? v->asInteger().value_or(0) : 0;
}

double UserDefaults::doubleForKey(std::string_view key) const {
  auto v = objectForKey(key);
  return v ? v->asReal().value_or(0.0) : 0.0;
}

std::optional<std::string> UserDefaults::stringForKey(std::string_view key) const {
  auto v = objectForKey(key);
  if (v && v->string()) return *v->string();
  return std::nullopt;
}

std::optional<TimePoint> UserDefaults::dateForKey(std::string_view key) const {
  auto v = objectForKey(key);
  if (v && v->date()) return v->date()->time;
  return std::nullopt;
}

bool UserDefaults::setObject(const std::string& key, PropertyValue value) {
  return update([&](Dictionary& values) { values.insert_or_assign(key, std::move(value)); });
}

bool UserDefaults::removeObject(const std::string& key) {
  return update([&](Dictionary& values) { values.erase(key); });
}

bool UserDefaults::update(const std::function<void(Dictionary&)>& change) {
  bool saved;
  std::vector<std::string> changed;
  {
    // Read-modify-write against the file, so what another writer put there survives.
    std::lock_guard<std::mutex> file(fileLock_);
    Loaded onDisk = load();
    Dictionary next = onDisk.ok ? std::move(onDisk.values) : persistentDomain();
    change(next);
    saved = save(next);
    std::unique_lock<std::shared_mutex> guard(lock_);
    changed = changedKeys(persistent_, next);
    persistent_ = std::move(next);
  }
  notify(changed);
  return saved;
}

bool UserDefaults::synchronize() {
  std::vector<std::string> changed;
  bool ok;
  {
    std::lock_guard<std::mutex> file(fileLock_);
    Loaded onDisk = load();
    ok = onDisk.ok;
    if (!ok) return false;
    std::unique_lock<std::shared_mutex> guard(lock_);
    changed = changedKeys(persistent_, onDisk.values);
    persistent_ = std::move(onDisk.values);
  }
  notify(changed);
  return ok;
}

void UserDefaults::watch(DispatchPool& pool) {
  if (watcher_) return;
  if (auto ec = createDirectory(folder_, true, 0700)) {
    if (log_) log_->error("cannot create defaults folder {}: {}", folder_.string(), ec.message());
    return;
  }
  watchQueue_ = std::make_unique<SerialQueue>(pool, "com.norvel.tavixd.defaults." + domain_);
  const std::string file = domain_ + ".plist";
  std::error_code ec;
  watcher_ = std::make_unique<FileWatcher>(pool, *watchQueue_, folder_, [this, file](const std::string& name) {
    if (name == file) synchronize();
  }, &ec);
  if (ec && log_) log_->error("cannot watch defaults folder {}: {}", folder_.string(), ec.message());
  // A change made between the first read and the watch taking hold is caught here.
  synchronize();
}

Dictionary UserDefaults::persistentDomain() const {
  std::shared_lock<std::shared_mutex> guard(lock_);
  return persistent_;
}

std::unique_ptr<UserDefaults> UserDefaults::suite(std::string domain) const {
  return std::make_unique<UserDefaults>(folder_, std::move(domain), log_);
}

UserDefaults::Subscription UserDefaults::addObserver(Observer observer) {
  Subscription subscription;
  subscription.entry_ = std::make_shared<Subscription::Entry>();
  subscription.entry_->observer = std::move(observer);
  std::lock_guard<std::mutex> guard(observersLock_);
  observers_.erase(std::remove_if(observers_.begin(), observers_.end(), [](const auto& w) { return w.expired(); }),
                   observers_.end());
  observers_.push_back(subscription.entry_);
  return subscription;
}

void UserDefaults::notify(const std::vector<std::string>& keys) {
  if (keys.empty()) return;
  std::vector<std::shared_ptr<Subscription::Entry>> live;
  {
    std::lock_guard<std::mutex> guard(observersLock_);
    for (const auto& weak : observers_) {
      if (auto entry = weak.lock()) live.push_back(std::move(entry));
    }
  }
  for (const auto& entry : live) {
    std::lock_guard<std::recursive_mutex> guard(entry->lock);
    if (!entry->alive) continue;
    for (const auto& key : keys) entry->observer(key);
  }
}

std::vector<std::string> UserDefaults::changedKeys(const Dictionary& before, const Dictionary& after) {
  std::vector<std::string> keys;
  for (const auto& [key, value] : before) {
    auto it = after.find(key);
    if (it == after.end() || !(it->second == value)) keys.push_back(key);
  }
  for (const auto& [key, value] : after) {
    if (!before.count(key)) keys.push_back(key);
  }
  return keys;
}

}  // namespace tavix::platform
