// An in-process notification centre: observers register for a name (and optionally one sender)
// and hear every matching post. Posts are delivered synchronously on the posting thread, or
// asynchronously on the observer's queue when one is given.
//
// Threading: safe from any thread. Removal (destroying the Registration) waits for a delivery in
// progress on another thread, so nothing runs after it returns.
#pragma once

#include <any>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/dispatch.h"
#include "platform/property_value.h"

namespace tavix::platform {

struct Notification {
  std::string name;
  const void* sender = nullptr;  // identity only, for filtering
  std::any object;               // what the poster hands over, e.g. the new bag
  Dictionary userInfo;
};

class NotificationCenter {
 public:
  using Observer = std::function<void(const Notification&)>;

  class Registration {
   public:
    Registration() = default;
    Registration(Registration&&) noexcept = default;
    Registration& operator=(Registration&&) noexcept;
    ~Registration();
    void reset();
    explicit operator bool() const { return entry_ != nullptr; }

   private:
    friend class NotificationCenter;
    struct Entry;
    std::shared_ptr<Entry> entry_;
  };

  NotificationCenter() = default;
  NotificationCenter(const NotificationCenter&) = delete;
  NotificationCenter& operator=(const NotificationCenter&) = delete;

  // `name` empty: every notification. `sender` null: any sender. `queue` null: deliver on the
  // posting thread; otherwise the queue must outlive the registration.
  [[nodiscard]] Registration addObserver(std::string name, const void* sender, SerialQueue* queue, Observer observer);

  void post(const Notification& notification);
  void post(std::string name, const void* sender = nullptr, std::any object = {}, Dictionary userInfo = {});

 private:
  std::mutex lock_;
  std::vector<std::weak_ptr<Registration::Entry>> entries_;
};

}  // namespace tavix::platform
