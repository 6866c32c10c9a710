// Locks, and what waits under them. Taken only through guards:
//
//   const Guard guard(_lock);                      // until the end of the scope
//   while (!_ready) _changed.wait(_lock);          // a Condition, with the lock held
//
//   if (!_lock.try_lock_for(10s)) return;          // a bounded wait, on the monotonic clock
//   const Guard guard(_lock, kAdopt);
//
// What is guarded says so, and clang checks it. Locks that guard no field, the recursive ones, are also held by the
// standard guards.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

#include "ThreadSafety.h"

namespace platform {

class TETHER_CAPABILITY("mutex") Mutex {
 public:
  void lock() ACQUIRE() { _mutex.lock(); }
  void unlock() RELEASE() { _mutex.unlock(); }

 private:
  friend class Condition;
  std::mutex _mutex;
};

// May be taken again by the thread that holds it.
class TETHER_CAPABILITY("mutex") RecursiveMutex {
 public:
  void lock() ACQUIRE() { _mutex.lock(); }
  void unlock() RELEASE() { _mutex.unlock(); }

 private:
  std::recursive_mutex _mutex;
};

struct Adopt {};
inline constexpr Adopt kAdopt{};

// Holds a lock until the end of its scope.
template <typename Lock>
class TETHER_SCOPED Guard {
 public:
  explicit Guard(Lock& lock) ACQUIRE(lock) : _lock(lock) { _lock.lock(); }
  // Takes over what the calling thread has taken already.
  Guard(Lock& lock, Adopt) REQUIRES(lock) : _lock(lock) {}
  Guard(const Guard&) = delete;
  Guard& operator=(const Guard&) = delete;
  ~Guard() RELEASE() { _lock.unlock(); }

 private:
  Lock& _lock;
};

// Gives a lock up for the rest of its scope, whose end takes it again.
template <typename Lock>
class TETHER_SCOPED Release {
 public:
  explicit Release(Lock& lock) RELEASE(lock) : _lock(lock) { _lock.unlock(); }
  Release(const Release&) = delete;
  Release& operator=(const Release&) = delete;
  ~Release() RELEASE() { _lock.lock(); }  // so is the end of the scope said

 private:
  Lock& _lock;
};

// Wakes those who wait for a change of what a Mutex guards.
class Condition {
 public:
  void wait(Mutex& lock) REQUIRES(lock) {
    std::unique_lock held(lock._mutex, std::adopt_lock);
    _condition.wait(held);
    held.release();
  }
  // False when the time has come.
  bool waitUntil(Mutex& lock, std::chrono::steady_clock::time_point until) REQUIRES(lock) {
    std::unique_lock held(lock._mutex, std::adopt_lock);
    const bool woken = _condition.wait_until(held, until) == std::cv_status::no_timeout;
    held.release();
    return woken;
  }
  void notifyOne() { _condition.notify_one(); }
  void notifyAll() { _condition.notify_all(); }

 private:
  std::condition_variable _condition;
};

// A lock with a bounded wait, built from a mutex and a condition, which every sanitizer understands, unlike the
// system's timed mutexes. Must outlive every call on it, unlock() included: the lock is free before that returns.
class TETHER_CAPABILITY("mutex") TimedLock {
 public:
  void lock() ACQUIRE() {
    if (take()) return;
    std::unique_lock guard(_state);
    ++_waiting;
    _freed.wait(guard, [this] { return take(); });
    --_waiting;
  }
  template <typename Duration>
  bool try_lock_for(Duration wait) TRY_ACQUIRE(true) {
    if (take()) return true;
    std::unique_lock guard(_state);
    ++_waiting;
    const bool taken = _freed.wait_for(guard, wait, [this] { return take(); });
    --_waiting;
    return taken;
  }
  void unlock() RELEASE() {
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
class TETHER_CAPABILITY("mutex") RecursiveTimedLock {
 public:
  void lock() ACQUIRE() {
    std::unique_lock guard(_state);
    _freed.wait(guard, [this] { return isFree(); });
    take();
  }
  template <typename Duration>
  bool try_lock_for(Duration wait) TRY_ACQUIRE(true) {
    std::unique_lock guard(_state);
    if (!isFree() && !_freed.wait_for(guard, wait, [this] { return isFree(); })) return false;
    take();
    return true;
  }
  void unlock() RELEASE() {
    std::lock_guard guard(_state);
    if (--_depth == 0) _freed.notify_one();
  }
  // Whether the calling thread holds it.
  bool isMine() {
    std::lock_guard guard(_state);
    return _depth > 0 && _owner == std::this_thread::get_id();
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
