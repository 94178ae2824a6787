// Who tells feedback sessions which versions of the bag's resource files the device holds: the
// download manager.
#pragma once

#include <map>
#include <string>

namespace tavix {

class ResourceVersionsProvider {
 public:
  virtual ~ResourceVersionsProvider() = default;
  // Resource name → version of the file on the device. Safe from any thread.
  virtual std::map<std::string, std::string> resourceVersions() const = 0;
};

}  // namespace tavix
