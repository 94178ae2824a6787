// Private to the platform layer: the Asio view of the DispatchPool.
#pragma once

#include <asio/io_context.hpp>

#include "platform/dispatch.h"

namespace tavix::platform {

inline asio::io_context& asioContext(DispatchPool& pool) {
  return *static_cast<asio::io_context*>(pool.nativeContext());
}

}  // namespace tavix::platform
