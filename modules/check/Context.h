// What all objects of one check share: the module's entry point, where findings go, and who is known to be called back.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <memory>
#include <set>
#include <thread>

#include "MAID.h"
#include "Report.h"

namespace modulecheck {

class Object;

// The limits that docs/camera-modules.md states. What a sanitizer slows down is given more.
#if defined(TETHER_SANITIZED)
inline constexpr int kSlowness = 5;
#else
inline constexpr int kSlowness = 1;
#endif
inline constexpr std::chrono::milliseconds kPollLimit{500 * kSlowness};
inline constexpr std::chrono::seconds kCallLimit{2 * kSlowness};

// A started action. Its address is no reference, so that a wrong one is not followed.
struct Action {
  Object* object = nullptr;
  uint32_t capability = 0;
  tagNkMAIDObject* record = nullptr;
  std::atomic<bool> refused{false};
  std::atomic<bool> reported{false};   // its completion has begun
  std::atomic<bool> completed{false};  // and has ended
  std::atomic<int32_t> result{0};
};

// One thread's way through the module: a call of ours, and inside its callbacks further ones.
struct Frame {
  Frame(const Object& object, uint32_t command);
  ~Frame();
  Frame(const Frame&) = delete;
  Frame& operator=(const Frame&) = delete;
  static Frame* current();

  const Object& object;
  const uint32_t command;
  Frame* const outer;
  std::chrono::nanoseconds ours{0};  // spent in callbacks
};

// A thread that calls into the module over and over, so that others can see whether it gets through.
struct Caller {
  std::atomic<bool> calling{false};
  std::atomic<uint64_t> calls{0};
};

class Context {
 public:
  // One in a process; made on its main thread.
  Context(Report& findings, std::chrono::milliseconds longestWait);
  static Context& theOne();

  // Objects stay known, and alive, to the end: what calls back late or wrongly finds them.
  void add(const Object* object);
  Object* find(void* reference) const;

  // The reference that goes with a start.
  void* addAction(std::shared_ptr<Action> action);
  std::shared_ptr<Action> action(void* reference) const;

  // Inside a callback: whether the main thread's calls return meanwhile, as far as it makes any.
  bool mainThreadGetsThrough();

  Report& report;
  const std::chrono::milliseconds patience;  // with a call, and with an action that does not go on
  NkMAIDEntryPoint* entryPoint = nullptr;
  const std::thread::id mainThreadId = std::this_thread::get_id();
  Caller mainThread;
  std::atomic<uint32_t> holds{0};  // odd while a callback waits on purpose: what lasts then is ours

 private:
  mutable platform::Mutex _lock;
  std::set<const void*> _objects GUARDED_BY(_lock);
  std::deque<std::shared_ptr<Action>> _actions GUARDED_BY(_lock);
};

}  // namespace modulecheck
