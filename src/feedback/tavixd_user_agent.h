// The daemon's own user agent: "<name/version> (<device>) <name/version>", where the device text
// is "<ProductType>; <ProductName> <ProductVersion> <BuildVersion>". Session files carry it as
// their version, and the daemon's own feedback is filed under it. Built once; thread-safe.
#pragma once

#include <string>

namespace tavix {

// The daemon's name and version, e.g. "tavixd/0.1.0".
extern const char* const kTVXTavixdNameVersion;

const std::string& tavixdUserAgent();

}  // namespace tavix
