// The module's own thread, for faults that call back from another thread than the polling one. Internal.
#pragma once

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>

namespace virtualcamera {

// Runs jobs one after another, in the order they were posted. The thread starts with the first job; the destructor
// drops what has not begun and waits for the job in progress.
class Worker {
 public:
  Worker() = default;
  ~Worker() {
    {
      const std::lock_guard lock(mutex_);
      ending_ = true;
    }
    posted_.notify_all();
    if (thread_.joinable()) thread_.join();
  }
  Worker(const Worker&) = delete;
  Worker& operator=(const Worker&) = delete;

  void post(std::function<void()> job) {
    const std::lock_guard lock(mutex_);
    jobs_.push_back(std::move(job));
    if (!thread_.joinable()) thread_ = std::thread([this] { run(); });
    posted_.notify_all();
  }

 private:
  void run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      posted_.wait(lock, [this] { return ending_ || !jobs_.empty(); });
      if (ending_) return;
      const std::function<void()> job = std::move(jobs_.front());
      jobs_.pop_front();
      lock.unlock();
      job();
      lock.lock();
    }
  }

  std::mutex mutex_;
  std::condition_variable posted_;
  std::deque<std::function<void()>> jobs_;
  bool ending_ = false;
  std::thread thread_;
};

}  // namespace virtualcamera
