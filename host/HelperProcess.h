// The helper as a child process: started, asked how it ended, and never left behind.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "Locks.h"
#include "RunLoop.h"

namespace tether {

// The helper could not be started; the text says which and why.
class HelperNotStarted : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// <folder of the running executable>/TetherHelper.app/Contents/<platform>/TetherHelper.
std::string helperBesideExecutable();

class HelperProcess {
 public:
  struct Start {
    std::string executable;
    // NAME=value, on top of this process's environment.
    std::vector<std::string> environment;
    // Become the child's standard input, output and error; stay the caller's. The first two are above 2. An error of
    // -1: this process's own.
    int input = -1;
    int output = -1;
    int error = -1;
    // Becomes the child's descriptor 3, if it is not negative; stays the caller's. Above 2.
    int inherited = -1;
    // Called once the child has ended, on a thread of the process's own, at any time until the destructor returns.
    std::function<void()> ended;
  };

  // Starts the child in a process group of its own, so that a Ctrl-C meant for this process is not the child's end,
  // with no signal blocked or ignored, and with no other descriptor of ours than the inherited one. Throws
  // HelperNotStarted.
  explicit HelperProcess(const Start& start);
  HelperProcess(const HelperProcess&) = delete;
  HelperProcess& operator=(const HelperProcess&) = delete;
  // Kills a child that still runs, and waits until it is gone.
  ~HelperProcess();

  pid_t pid() const { return _pid; }
  // Waits for the end, no longer than `until`. The status as waitpid() gives it, or none while the child runs.
  std::optional<int> waitUntil(platform::Clock::time_point until);
  // Sends a signal to a child that still runs.
  void signal(int number);
  // SIGTERM, and SIGKILL to a child that is still there after `grace`. The child is gone when this returns.
  int stop(std::chrono::milliseconds grace);

 private:
  void reap(const std::function<void()>& ended);

  pid_t _pid = -1;
  platform::Mutex _lock;
  platform::Condition _changed;
  std::optional<int> _status GUARDED_BY(_lock);
  std::thread _reaper;
};

// How a child ended, in words: "exit status 3", "killed by signal 9 (Killed)".
std::string describeStatus(int status);

}  // namespace tether
