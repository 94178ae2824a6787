// Raw DEFLATE (no zlib or gzip wrapper): the coding of feedback upload bodies.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tavix::platform {

// The inflated bytes, or nothing when the input is not one complete raw DEFLATE stream.
std::optional<std::string> inflateRaw(std::string_view compressed);

}  // namespace tavix::platform
