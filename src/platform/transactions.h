// Keep-alive transactions: named, counted holds that say "work is pending, do not exit".
// The daemon exits when idle only while no transaction is open.
//
// Threading: every method is safe from any thread; the idle handler runs on the thread that
// closed the last transaction, with no lock held.
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

namespace tavix::platform {

class TransactionTracker {
 public:
  // An open transaction; closes when destroyed or reset. Movable, not copyable.
  class Transaction {
   public:
    Transaction() = default;
    Transaction(Transaction&& other) noexcept : tracker_(other.tracker_), name_(std::move(other.name_)) {
      other.tracker_ = nullptr;
    }
    Transaction& operator=(Transaction&& other) noexcept;
    ~Transaction() { reset(); }
    void reset();
    bool isOpen() const { return tracker_ != nullptr; }

   private:
    friend class TransactionTracker;
    Transaction(TransactionTracker* t, std::string name) : tracker_(t), name_(std::move(name)) {}
    TransactionTracker* tracker_ = nullptr;
    std::string name_;
  };

  // The tracker must outlive its transactions.
  [[nodiscard]] Transaction begin(std::string name);

  std::size_t openCount() const;
  std::map<std::string, std::size_t> open() const;

  // Called each time the count drops to zero.
  void setIdleHandler(std::function<void()> handler);

 private:
  void end(const std::string& name);

  mutable std::mutex lock_;
  std::map<std::string, std::size_t> open_;
  std::size_t total_ = 0;
  std::shared_ptr<std::function<void()>> idleHandler_;
};

}  // namespace tavix::platform
