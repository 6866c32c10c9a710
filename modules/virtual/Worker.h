// The module's own thread, for faults that call back from another thread than the polling one. Internal.
#pragma once

#include <deque>
#include <functional>
#include <thread>

#include "Mutex.h"

namespace virtualcamera {

// Runs jobs one after another, in the order they were posted. The thread starts with the first job.
class Worker {
 public:
  Worker() = default;
  ~Worker() { end(); }
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;

  void post(std::function<void()> job) {
    const camerakit::Guard guard(_mutex);
    if (_ending) return;
    _jobs.push_back(std::move(job));
    if (!_thread.joinable()) _thread = std::thread([this] { run(); });
    _posted.notifyAll();
  }

  // Drops what has not begun, and what is posted from now on, and waits for the job in progress.
  void end() {
    std::deque<std::function<void()>> dropped;
    {
      const camerakit::Guard guard(_mutex);
      _ending = true;
      dropped.swap(_jobs);
    }
    _posted.notifyAll();
    if (_thread.joinable()) _thread.join();
  }

 private:
  void run() {
    const camerakit::Guard guard(_mutex);
    for (;;) {
      while (!_ending && _jobs.empty()) _posted.wait(_mutex);
      if (_ending) return;
      const std::function<void()> job = std::move(_jobs.front());
      _jobs.pop_front();
      const camerakit::Release release(_mutex);
      job();
    }
  }

  camerakit::Mutex _mutex;
  camerakit::Condition _posted;
  std::deque<std::function<void()>> _jobs KIT_GUARDED_BY(_mutex);
  bool _ending KIT_GUARDED_BY(_mutex) = false;
  std::thread _thread;  // started under the mutex, joined by whoever ends it
};

}  // namespace virtualcamera
