#include "core/assembly.h"

#include "platform/defaults.h"

namespace tavix {

bool Assembly::useMarvola() const { return userDefaults && userDefaults->boolForKey("TVXUseMarvola"); }

platform::fs::path Assembly::cachesFolder() const { return paths.cachesFolder(kTavixdDomain); }

}  // namespace tavix
