// Locks with a bounded wait, on the monotonic clock. Taken only through guards:
//
//   std::unique_lock guard(lock, 10s);   // waits at most 10 seconds
//   if (!guard) ...                      // not had
#pragma once

#include <mutex>

namespace platform {

using TimedLock = std::timed_mutex;
// May be taken again by the thread that holds it; free once it was given back as often.
using RecursiveTimedLock = std::recursive_timed_mutex;

}  // namespace platform
