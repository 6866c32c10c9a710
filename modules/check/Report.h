// What a check has to say, and what the process that checks leaves behind when the module ends it.
//
// The module runs in a process of its own. This page of memory is shared with the one that watches: whatever becomes of
// the first, the second knows what was going on and how many faults there were.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <set>
#include <string>

#include "Locks.h"

namespace modulecheck {

using Clock = std::chrono::steady_clock;

// What one thread is doing, for the case that it never says how it ended.
struct Activity {
  std::atomic<bool> taken{false};
  std::atomic<int64_t> since{0};  // Clock's ticks; 0: nothing that could hang
  char text[160]{};
};

struct Shared {
  Activity activities[8];
  std::atomic<int> faults{0};
  std::atomic<int> cameras{0};
  std::atomic<int> pictures{0};
  std::atomic<int64_t> late{0};  // by how much the watcher woke late so far, in ticks: the machine is busy
  std::atomic<bool> finished{false};
};

// In memory that a forked process shares. Throws std::bad_alloc.
Shared& makeShared();

// Any thread. What differs in numbers only is told once for every level of object.
class Report {
 public:
  // `output` is where lines go.
  Report(Shared& shared, int output) : _shared(shared), _output(output) {}

  void fault(const std::string& level, const std::string& object, const std::string& what, const std::string& expected);
  // Not against the contract, but worth knowing.
  void note(const std::string& level, const std::string& object, const std::string& what);

  Shared& shared() { return _shared; }

 private:
  bool isNew(const std::string& kind);
  void write(const std::string& line) const;

  Shared& _shared;
  const int _output;
  platform::Mutex _lock;
  std::set<std::string> _told GUARDED_BY(_lock);
};

// The calling thread is at something as long as it lives. They nest.
class Doing {
 public:
  Doing(Shared& shared, const std::string& text);
  ~Doing();
  Doing(const Doing&) = delete;
  Doing& operator=(const Doing&) = delete;

 private:
  Activity* _activity;
  int64_t _outerSince = 0;
  char _outerText[sizeof Activity::text]{};
};

}  // namespace modulecheck
