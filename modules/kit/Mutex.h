// A mutex and what belongs to it, in words that clang's thread-safety analysis checks (-Wthread-safety); other
// compilers read over them. Not needed by authors of modules, but theirs to use.
//
//   const Guard guard(_mutex);                                  // held until the end of the scope
//   const Release release(_mutex);                              // given up until then
//   while (!_ready) _changed.wait(_mutex);                      // a Condition, with the mutex held
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#if defined(__clang__)
#define KIT_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define KIT_THREAD_ATTRIBUTE(x)
#endif

#define KIT_GUARDED_BY(mutex) KIT_THREAD_ATTRIBUTE(guarded_by(mutex))
#define KIT_REQUIRES(...) KIT_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define KIT_EXCLUDES(...) KIT_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))

namespace camerakit {

class KIT_THREAD_ATTRIBUTE(capability("mutex")) Mutex {
 public:
  void lock() KIT_THREAD_ATTRIBUTE(acquire_capability()) { _mutex.lock(); }
  bool tryLock() KIT_THREAD_ATTRIBUTE(try_acquire_capability(true)) { return _mutex.try_lock(); }
  void unlock() KIT_THREAD_ATTRIBUTE(release_capability()) { _mutex.unlock(); }

 private:
  friend class Condition;
  std::mutex _mutex;
};

struct Adopt {};

class KIT_THREAD_ATTRIBUTE(scoped_lockable) Guard {
 public:
  explicit Guard(Mutex& mutex) KIT_THREAD_ATTRIBUTE(acquire_capability(mutex)) : _mutex(mutex) { _mutex.lock(); }
  // Takes over what the calling thread holds already.
  Guard(Mutex& mutex, Adopt) KIT_REQUIRES(mutex) : _mutex(mutex) {}
  Guard(const Guard&) = delete;
  Guard& operator=(const Guard&) = delete;
  ~Guard() KIT_THREAD_ATTRIBUTE(release_capability()) { _mutex.unlock(); }

 private:
  Mutex& _mutex;
};

class KIT_THREAD_ATTRIBUTE(scoped_lockable) Release {
 public:
  explicit Release(Mutex& mutex) KIT_THREAD_ATTRIBUTE(release_capability(mutex)) : _mutex(mutex) { _mutex.unlock(); }
  Release(const Release&) = delete;
  Release& operator=(const Release&) = delete;
  ~Release() KIT_THREAD_ATTRIBUTE(release_capability()) { _mutex.lock(); }  // so is the end of the scope said

 private:
  Mutex& _mutex;
};

// Waited for in a loop that asks for what is awaited.
class Condition {
 public:
  void wait(Mutex& mutex) KIT_REQUIRES(mutex) {
    std::unique_lock held(mutex._mutex, std::adopt_lock);
    _condition.wait(held);
    held.release();
  }
  // False when the time has come.
  bool waitUntil(Mutex& mutex, std::chrono::steady_clock::time_point until) KIT_REQUIRES(mutex) {
    std::unique_lock held(mutex._mutex, std::adopt_lock);
    const bool woken = _condition.wait_until(held, until) == std::cv_status::no_timeout;
    held.release();
    return woken;
  }
  void notifyAll() { _condition.notify_all(); }

 private:
  std::condition_variable _condition;
};

}  // namespace camerakit
