// The whole of one check: what the helper does with a module from its start to its end, in the same order, on two
// threads.
#pragma once

#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
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
  bool isIdle() const { return unfinished_ == 0; }
  // Ends when what is being done is done; the rest is dropped.
  void stop();

 private:
  void work();

  std::mutex mutex_;
  std::condition_variable changed_;
  std::queue<std::function<void()>> tasks_;
  bool ends_ = false;
  std::atomic<int> unfinished_{0};
  std::thread thread_;
};

class Course {
 public:
  explicit Course(Context& context) : context_(context) {}

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

  Context& context_;
  std::unique_ptr<Module> module_;
  std::vector<std::unique_ptr<Camera>> cameras_;  // those that were given up, too
  std::map<uint32_t, Camera*> present_;
  Transfers transfers_;
};

}  // namespace modulecheck
