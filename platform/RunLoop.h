// A run loop: one per thread, made at first use, that waits for timers, readable descriptors and calls posted from
// other threads, and runs them on its own thread, one after the other.
//
// The contract:
// - The clock is monotonic. A turn waits in one poll() until something is due, ready or posted; it never spins.
// - A turn runs what is due when it begins (timers by their time, posted calls by the time of posting), in order of
//   that time, then of request; then the callbacks of readable descriptors. What is requested during a turn runs in a
//   later one, never inside the request.
// - Any number of posts wake the loop once.
// - A repeating timer keeps to its first schedule: times that were missed are left out, not made up for. Its callback
//   is not entered again from a turn nested in it.
// - A callback may cancel anything, itself included, and may run turns of the same loop: the nested turn takes over
//   what the outer one has not run yet.
// - An exception that leaves a callback is logged; the loop goes on. A call that is waited for passes it to the waiter.
// - When a loop ends (its thread's function returns) the calls still queued are destroyed on its thread without being
//   run, and those who wait for them, and those who post later, are told so.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <vector>

#include "Locks.h"

namespace platform {

using Clock = std::chrono::steady_clock;
using Seconds = std::chrono::duration<double>;

class Timer;
class DescriptorWatch;

class RunLoop : public std::enable_shared_from_this<RunLoop> {
 public:
  using Call = std::function<void()>;

  // The calling thread's loop.
  static const std::shared_ptr<RunLoop>& current();
  // Ends the calling thread's loop, if it has one. Thread does this when its function returns.
  static void endCurrent();
  // A loop for a thread that is about to be started, which makes it its own before it asks for current(). Throws
  // std::system_error when the system has no descriptors left; current() does so for a loop that it has to make.
  static std::shared_ptr<RunLoop> make();
  static void setCurrent(std::shared_ptr<RunLoop> loop);

  RunLoop(const RunLoop&) = delete;
  RunLoop& operator=(const RunLoop&) = delete;
  ~RunLoop();

  // Any thread -------------------------------------------------------------------------------------------------------

  bool isCurrent() const;
  // Queues a call. False, and the call is destroyed here, when the loop has ended.
  bool post(Call call);
  // Runs a call on the loop's thread and waits until it has run; from that thread itself, runs it at once. False when
  // the loop ended first: the call did not and will not run. Rethrows what the call throws.
  bool perform(const Call& call);
  // As perform(), but the loop's thread may also run the call where it asks for urgent ones, and one that it has not
  // begun within `wait` is taken back: false.
  bool performUrgently(const Call& call, Clock::duration wait);
  // Ends a wait in progress, as a posted call that does nothing would.
  void wakeUp();

  // The loop's own thread --------------------------------------------------------------------------------------------

  // Turns until stop().
  void run();
  // Ends the innermost run() after the current turn. Own thread only.
  void stop();
  // One turn that waits no longer than `until`. False, at once, when the loop has nothing that could ever wake it.
  bool runOnce(Clock::time_point until);
  // Runs a call once, not before the delay has passed, unless the loop ends first.
  void performAfter(Seconds delay, Call call);
  // Runs the urgent calls that wait for the calling thread, in order: for a thread that is kept from turning its loop.
  static void runUrgentCalls();

 private:
  friend class Timer;
  friend class DescriptorWatch;

  struct Waiter;
  struct Posted {
    Clock::time_point due;
    std::uint64_t order;
    Call call;
    std::shared_ptr<Waiter> waiter;
    bool urgent;
  };
  struct Scheduled {
    Clock::time_point due;
    std::uint64_t order;
    std::uint64_t id;
    Clock::duration interval;  // zero: once
    Call call;
  };
  struct Firing;
  struct Later;
  struct Watch;

  RunLoop();
  bool enqueue(Call call, std::shared_ptr<Waiter> waiter, bool urgent);
  bool takeBack(const Waiter& waiter);
  static void runPosted(Posted posted);
  bool runNextUrgent();
  Posted takePosted(const std::deque<Posted>::iterator& place) REQUIRES(_lock);
  void end();
  std::uint64_t schedule(Clock::duration delay, Clock::duration interval, Call call);
  void cancel(std::uint64_t id);
  void turn(Clock::time_point until);
  void waitForWork(Clock::time_point until);
  bool runNextDue(Clock::time_point now, std::uint64_t limit);
  void runReadyWatches();
  void fire(Scheduled timer);
  void insert(Scheduled timer);
  bool hasInputs();

  // What other threads touch.
  Mutex _lock;
  std::deque<Posted> _posted GUARDED_BY(_lock);
  std::atomic<int> _urgent{0};  // of these; read without the lock
  std::uint64_t _nextOrder GUARDED_BY(_lock) = 0;
  bool _wakeUpSent GUARDED_BY(_lock) = false;
  bool _ended GUARDED_BY(_lock) = false;
  int _wakeRead = -1;
  int _wakeWrite = -1;

  // The own thread's.
  std::vector<Scheduled> _timers;  // a heap, the earliest first
  std::vector<std::shared_ptr<Watch>> _watches;
  std::uint64_t _nextId = 1;
  Firing* _firing = nullptr;
  bool _stopped = false;
};

// A timer on the loop of the thread that makes it; that thread alone may touch it. Destroying it cancels it, also from
// inside its own callback.
class Timer {
 public:
  Timer() = default;
  static Timer once(Seconds delay, RunLoop::Call call);
  static Timer repeating(Seconds interval, RunLoop::Call call);
  Timer(Timer&& other) noexcept;
  Timer& operator=(Timer&& other) noexcept;
  ~Timer() { invalidate(); }

  void invalidate();

 private:
  Timer(std::shared_ptr<RunLoop> loop, std::uint64_t id) : _loop(std::move(loop)), _id(id) {}

  std::shared_ptr<RunLoop> _loop;
  std::uint64_t _id = 0;
};

// Calls back on the loop of the thread that makes it while its descriptor can be read (or is at its end) and the watch
// is enabled. That thread alone may touch it. Destroying it ends it, also from inside its own callback.
class DescriptorWatch {
 public:
  DescriptorWatch() = default;
  DescriptorWatch(int descriptor, RunLoop::Call readable);
  DescriptorWatch(DescriptorWatch&& other) noexcept = default;
  DescriptorWatch& operator=(DescriptorWatch&& other) noexcept;
  ~DescriptorWatch() { end(); }

  void setEnabled(bool enabled);
  void end();
  explicit operator bool() const { return _watch != nullptr; }

 private:
  std::shared_ptr<RunLoop> _loop;
  std::shared_ptr<RunLoop::Watch> _watch;
};

}  // namespace platform
