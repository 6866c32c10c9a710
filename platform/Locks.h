// Locks with a bounded wait, on the monotonic clock. Taken only through guards:
//
//   std::unique_lock guard(lock, 10s);   // waits at most 10 seconds
//   if (!guard) ...                      // not had
//
// They are built from a mutex and a condition, which every sanitizer understands, unlike the system's timed mutexes.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

namespace platform {

// Must outlive every call on it, unlock() included: the lock is free before that returns.
class TimedLock {
 public:
  void lock() {
    if (take()) return;
    std::unique_lock guard(_state);
    ++_waiting;
    _freed.wait(guard, [this] { return take(); });
    --_waiting;
  }
  template <typename Duration>
  bool try_lock_for(Duration wait) {
    if (take()) return true;
    std::unique_lock guard(_state);
    ++_waiting;
    const bool taken = _freed.wait_for(guard, wait, [this] { return take(); });
    --_waiting;
    return taken;
  }
  void unlock() {
    _taken = false;
    // Who began to wait before is seen here, and who begins now sees it free.
    if (_waiting == 0) return;
    std::lock_guard guard(_state);
    _freed.notify_one();
  }

 private:
  bool take() { return !_taken.exchange(true); }

  std::mutex _state;
  std::condition_variable _freed;
  std::atomic<bool> _taken{false};
  std::atomic<int> _waiting{0};
};

// May be taken again by the thread that holds it; free once it was given back as often.
class RecursiveTimedLock {
 public:
  void lock() {
    std::unique_lock guard(_state);
    _freed.wait(guard, [this] { return isFree(); });
    take();
  }
  template <typename Duration>
  bool try_lock_for(Duration wait) {
    std::unique_lock guard(_state);
    if (!isFree() && !_freed.wait_for(guard, wait, [this] { return isFree(); })) return false;
    take();
    return true;
  }
  void unlock() {
    std::lock_guard guard(_state);
    if (--_depth == 0) _freed.notify_one();
  }

 private:
  bool isFree() const { return _depth == 0 || _owner == std::this_thread::get_id(); }
  void take() {
    _owner = std::this_thread::get_id();
    ++_depth;
  }

  std::mutex _state;
  std::condition_variable _freed;
  std::thread::id _owner;
  int _depth = 0;
};

}  // namespace platform
