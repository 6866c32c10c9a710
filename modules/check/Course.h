// The whole of one check: what the helper does with a module from its start to its end, in the same order, on two
// threads.
#pragma once

#include <functional>
#include <memory>
#include <queue>
#include <string>
#include <thread>
#include <vector>

#include "Camera.h"

namespace modulecheck {

// The thread that transfers pictures, one after the other, and takes down cameras.
class Transfers {
 public:
  Transfers();
  ~Transfers() { stop(); }
  Transfers(const Transfers&) = delete;
  Transfers& operator=(const Transfers&) = delete;

  // Any thread. After stop(): nothing.
  void add(std::function<void()> task);
  bool isIdle() const { return _unfinished == 0; }
  // Ends when what is being done is done; the rest is dropped.
  void stop();

 private:
  void work();

  platform::Mutex _lock;
  platform::Condition _changed;
  std::queue<std::function<void()>> _tasks GUARDED_BY(_lock);
  bool _ends GUARDED_BY(_lock) = false;
  std::atomic<int> _unfinished{0};
  std::thread _thread;
};

class Course {
 public:
  explicit Course(Context& context) : _context(context) {}

  // Checks the module of the bundle at that path. What there is to say is reported.
  void run(const std::string& bundlePath);

 private:
  using Condition = std::function<bool()>;

  void check();
  void scan();
  void meet(uint32_t id);
  void work(Camera& camera);
  void shoot(Camera& camera, int times);
  void findAgain(Camera& camera);
  // Polls the module as an idle pass does, until it is so, or long enough.
  bool idleUntil(const Condition& condition, Clock::duration longest);
  void idle(Clock::duration time);

  Context& _context;
  std::unique_ptr<Module> _module;
  std::vector<std::unique_ptr<Camera>> _cameras;  // those that were given up, too
  std::map<uint32_t, Camera*> _present;
  Transfers _transfers;
};

}  // namespace modulecheck
