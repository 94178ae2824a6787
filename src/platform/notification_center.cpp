#include "platform/notification_center.h"

#include <algorithm>

namespace tavix::platform {

struct NotificationCenter::Registration::Entry {
  std::string name;
  const void* sender;
  SerialQueue* queue;
  Observer observer;
  std::recursive_mutex lock;  // held during delivery; recursive so an observer may remove itself
  bool alive = true;

  void deliver(const Notification& n) {
    std::lock_guard<std::recursive_mutex> guard(lock);
    if (alive) observer(n);
  }
};

NotificationCenter::Registration& NotificationCenter::Registration::operator=(Registration&& other) noexcept {
  if (this != &other) {
    reset();
    entry_ = std::move(other.entry_);
  }
  return *this;
}

NotificationCenter::Registration::~Registration() { reset(); }

void NotificationCenter::Registration::reset() {
  if (!entry_) return;
  std::lock_guard<std::recursive_mutex> guard(entry_->lock);
  entry_->alive = false;
  entry_.reset();
}

NotificationCenter::Registration NotificationCenter::addObserver(std::string name, const void* sender,
                                                                 SerialQueue* queue, Observer observer) {
  Registration r;
  r.entry_ = std::make_shared<Registration::Entry>();
  r.entry_->name = std::move(name);
  r.entry_->sender = sender;
  r.entry_->queue = queue;
  r.entry_->observer = std::move(observer);
  std::lock_guard<std::mutex> guard(lock_);
  entries_.erase(std::remove_if(entries_.begin(), entries_.end(), [](const auto& w) { return w.expired(); }),
                 entries_.end());
  entries_.push_back(r.entry_);
  return r;
}

void NotificationCenter::post(const Notification& notification) {
  std::vector<std::shared_ptr<Registration::Entry>> matching;
  {
    std::lock_guard<std::mutex> guard(lock_);
    for (const auto& weak : entries_) {
      auto entry = weak.lock();
      if (!entry) continue;
      if (!entry->name.empty() && entry->name != notification.name) continue;
      if (entry->sender && entry->sender != notification.sender) continue;
      matching.push_back(std::move(entry));
    }
  }
  for (auto& entry : matching) {
    if (entry->queue) {
      // The entry holds no strong reference back to the registration, so a removed observer
      // simply finds alive == false when its turn comes.
      entry->queue->async([entry, notification] { entry->deliver(notification); });
    } else {
      entry->deliver(notification);
    }
  }
}

void NotificationCenter::post(std::string name, const void* sender, std::any object, Dictionary userInfo) {
  post(Notification{std::move(name), sender, std::move(object), std::move(userInfo)});
}

}  // namespace tavix::platform
