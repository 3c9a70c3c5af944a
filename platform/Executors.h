#pragma once

// The process's thread pools, as asio I/O contexts: timers and sockets whose
// handlers then post to a SerialQueue. Created on first use, never torn down
// (blocks may still be queued while the process exits).

#include <asio/io_context.hpp>

#include "platform/SerialQueue.h"

namespace zerith {

asio::io_context& ioContext(Pool pool = Pool::General);

// The I/O threads for sockets whose handlers are short: each context is run
// by one thread of its own, so the thread that wakes from epoll_wait runs the
// handler itself and goes back to epoll_wait, with no second thread woken to
// take the reactor over (as a context run by several threads does). Sockets
// are spread over the contexts so that several connections still run in
// parallel. A handler that may wait must move that work to a SerialQueue.
asio::io_context& socketContext();
// True on one of socketContext()'s threads.
bool onSocketThread();

}  // namespace zerith
