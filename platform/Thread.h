// A thread with a name, a cancel flag and a run loop. A running thread keeps its object alive.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string>

#include "Locks.h"
#include "RunLoop.h"

namespace platform {

// Starts a thread that nobody waits for. Throws std::system_error, which says so, when the system has none to give.
void startDetached(std::function<void()> body);

class Thread : public std::enable_shared_from_this<Thread> {
 public:
  static std::shared_ptr<Thread> make(std::function<void()> body);
  // The calling thread; one that was not made here is adopted.
  static std::shared_ptr<Thread> current();

  // Throws std::system_error when the system has no thread to give, or no descriptors for its loop. Once only.
  void start();
  // Asks the thread to end; its body looks when it likes. Also ends a wait of its run loop.
  void cancel();
  bool isCancelled() const { return _cancelled; }
  // Waits until the body has returned and the thread's run loop has ended. Not from the thread itself.
  void join();

  // The thread's run loop; waits for a thread that was started to get that far.
  std::shared_ptr<RunLoop> runLoop();

  // Names the calling thread.
  static void setCurrentName(const std::string& name);
  // Number and name, for log lines.
  std::string description() const;

 private:
  explicit Thread(std::function<void()> body);
  void main(const std::shared_ptr<RunLoop>& loop);

  const int _number;
  std::function<void()> _body;
  std::atomic<bool> _cancelled{false};
  mutable Mutex _lock;
  Condition _changed;
  std::string _name GUARDED_BY(_lock);
  std::shared_ptr<RunLoop> _runLoop GUARDED_BY(_lock);
  bool _finished GUARDED_BY(_lock) = false;
};

}  // namespace platform
