// The thread to which callbacks are carried. It is known once it runs.
#pragma once

#include <memory>

#include "Locks.h"
#include "Thread.h"

class HomeThread {
 public:
  HomeThread() = default;
  HomeThread(const HomeThread&) = delete;
  HomeThread& operator=(const HomeThread&) = delete;

  // Waits for the thread to start. Any thread.
  std::shared_ptr<platform::Thread> homeThread() {
    const platform::Guard guard(_homeLock);
    while (!_homeThread) _homeKnown.wait(_homeLock);
    return _homeThread;
  }

 protected:
  ~HomeThread() = default;
  // The calling thread is it.
  void comeHome() {
    const platform::Guard guard(_homeLock);
    _homeThread = platform::Thread::current();
    _homeKnown.notifyAll();
  }

 private:
  platform::Mutex _homeLock;
  platform::Condition _homeKnown;
  std::shared_ptr<platform::Thread> _homeThread GUARDED_BY(_homeLock);
};
