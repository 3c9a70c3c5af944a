#pragma once

// The process's thread pools, as asio I/O contexts: timers and sockets whose
// handlers then post to a SerialQueue. Created on first use, never torn down
// (blocks may still be queued while the process exits).

#include <asio/io_context.hpp>

#include "platform/SerialQueue.h"

namespace zerith {

asio::io_context& ioContext(Pool pool = Pool::General);

}  // namespace zerith
