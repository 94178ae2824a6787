#include "platform/transactions.h"

namespace tavix::platform {

TransactionTracker::Transaction& TransactionTracker::Transaction::operator=(Transaction&& other) noexcept {
  if (this != &other) {
    reset();
    tracker_ = other.tracker_;
    name_ = std::move(other.name_);
    other.tracker_ = nullptr;
  }
  return *this;
}

void TransactionTracker::Transaction::reset() {
  if (!tracker_) return;
  TransactionTracker* t = tracker_;
  tracker_ = nullptr;
  t->end(name_);
}

TransactionTracker::Transaction TransactionTracker::begin(std::string name) {
  std::lock_guard<std::mutex> guard(lock_);
  ++open_[name];
  ++total_;
  return Transaction(this, std::move(name));
}

void TransactionTracker::end(const std::string& name) {
  std::shared_ptr<std::function<void()>> handler;
  {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = open_.find(name);
    if (it != open_.end() && --it->second == 0) open_.erase(it);
    if (--total_ == 0) handler = idleHandler_;
  }
  if (handler && *handler) (*handler)();
}

std::size_t TransactionTracker::openCount() const {
  std::lock_guard<std::mutex> guard(lock_);
  return total_;
}

std::map<std::string, std::size_t> TransactionTracker::open() const {
  std::lock_guard<std::mutex> guard(lock_);
  return open_;
}

void TransactionTracker::setIdleHandler(std::function<void()> handler) {
  std::lock_guard<std::mutex> guard(lock_);
  idleHandler_ = std::make_shared<std::function<void()>>(std::move(handler));
}

}  // namespace tavix::platform
