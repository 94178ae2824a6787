// Who tells feedback sessions which versions of the bag's resource files the device holds. The
// download manager answers once it exists; until then no one does and sessions carry none.
#pragma once

#include <map>
#include <mutex>
#include <string>

namespace tavix {

class ResourceVersionsProvider {
 public:
  virtual ~ResourceVersionsProvider() = default;
  // Resource name → version of the file on the device. Safe from any thread.
  virtual std::map<std::string, std::string> resourceVersions() const = 0;
};

// The provider start-up hands out: sessions and the objects that open them keep the provider they
// were made with, so it exists before them and whoever learns the versions sets them here.
class ResourceVersions final : public ResourceVersionsProvider {
 public:
  std::map<std::string, std::string> resourceVersions() const override {
    std::lock_guard lock(mutex_);
    return versions_;
  }
  void setResourceVersions(std::map<std::string, std::string> versions) {
    std::lock_guard lock(mutex_);
    versions_ = std::move(versions);
  }

 private:
  mutable std::mutex mutex_;
  std::map<std::string, std::string> versions_;
};

}  // namespace tavix
