// The global concurrent queue: a fixed pool of worker threads (at least 2,
// one per core) running tasks concurrently, started in FIFO order. Lives
// until the process ends. sync() runs the task at once on the calling thread
// (a concurrent queue cannot deadlock on itself, so it is allowed from the
// global queue too). Every member may be called from any thread.
#pragma once

#include "platform/DispatchQueue.h"

namespace platform {

DispatchQueue& globalQueue();

}  // namespace platform
