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

  // Whether someone interrupted since the last acknowledge().
  bool interrupted() const noexcept { return _interruptions > _acknowledged; }
  // Takes note of the interruptions so far: waits go on until the next one.
  void acknowledge() noexcept { _acknowledged = _interruptions.load(); }

  // Waits for a ring, no longer than `until`; a ring since the last wait ends it at once.
  void waitUntil(Clock::time_point until);

 private:
  Pipe _pipe;
  std::atomic<int> _interruptions{0};
  std::atomic<int> _acknowledged{0};
};

}  // namespace tether
