// Ends one thread's waits from elsewhere: a reader that has something for it, or a signal handler that wants it to
// stop. Shared between those who ring and the one thread that waits.
#pragma once

#include <atomic>

#include "Descriptors.h"
#include "RunLoop.h"

namespace tether {

using platform::Clock;

class Wakeup {
 public:
  // Throws std::system_error when there are no descriptors left.
  Wakeup();
  Wakeup(const Wakeup&) = delete;
  Wakeup& operator=(const Wakeup&) = delete;

  // Any thread, and signal handlers. Any number of rings end one wait.
  void ring() noexcept;
  // Rings, and asks the waiting thread to give up what it waits for. Any thread, and signal handlers.
  void interrupt() noexcept;

  // Ends one wait for a message, which then gives nothing, or the next one: there is something to look at elsewhere.
  // Any thread.
  void nudge() noexcept;
  // Whether someone nudged since the last call. The waiting thread.
  bool takeNudge() noexcept { return _nudged.exchange(false); }

  // Whether someone interrupted since the last acknowledge().
  bool interrupted() const noexcept { return _interruptions > _acknowledged; }
  // Takes note of the interruptions so far: waits go on until the next one.
  void acknowledge() noexcept { _acknowledged = _interruptions.load(); }

  // Whether someone ever interrupted.
  bool everInterrupted() const noexcept { return _interruptions > 0; }

  // Waits until something can be written to a descriptor, or writing fails at once. False when that has not come by
  // `until`, or someone interrupted. The waiting thread.
  bool waitUntilWritable(int descriptor, Clock::time_point until);
  // Waits for a ring, no longer than `until`; a ring since the last wait ends it at once.
  void waitUntil(Clock::time_point until);

 private:
  bool pollUntil(Clock::time_point until, int writable);

  Pipe _pipe;
  std::atomic<bool> _nudged{false};
  std::atomic<int> _interruptions{0};
  std::atomic<int> _acknowledged{0};
};

}  // namespace tether
