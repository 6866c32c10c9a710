// What a helper writes to its standard error: read on a thread of its own, passed on as it comes, and its last lines
// kept. The helper never waits for whom it is passed on to.
#pragma once

#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "Descriptors.h"
#include "Locks.h"
#include "Messages.h"
#include "Wakeup.h"

namespace tether {

class HelperLog {
 public:
  // Reads from `pipe` from now on, passes it on to `target`, which stays the caller's, and rings the wakeup for each
  // line. What `target` does not take in time is dropped beyond 256 KiB, with a line that says so. Throws
  // std::system_error when there are no descriptors or there is no thread to be had.
  HelperLog(Descriptor pipe, int target, std::shared_ptr<Wakeup> wakeup);
  HelperLog(const HelperLog&) = delete;
  HelperLog& operator=(const HelperLog&) = delete;
  // Reads no more; what has been read is passed on if the target takes it within a moment.
  ~HelperLog();

  // The process that writes has ended: what is in the pipe by now is all there will be. Any thread.
  void processEnded();
  // Waits until everything has been read.
  bool waitUntilFinished(Clock::time_point until) const;

  // The next line that was not taken, of the last 100. Any thread, as the rest.
  std::optional<LogLine> take();
  bool empty() const;
  // The last lines, at most 100, the oldest first, taken or not.
  std::vector<LogLine> lastLines() const;

 private:
  void run();
  bool readSome();
  void keep(std::string_view bytes);
  void keepLine();
  void finish();
  void passOn();

  Descriptor _pipe;
  const int _target;
  std::shared_ptr<Wakeup> _wakeup;
  Pipe _bell = Pipe::make();

  // The thread's own.
  std::string _line;     // begun
  std::string _waiting;  // to be passed on
  int _dropped = 0;

  mutable platform::Mutex _lock;
  mutable platform::Condition _changed;
  std::deque<LogLine> _lines GUARDED_BY(_lock);
  std::size_t _untaken GUARDED_BY(_lock) = 0;  // of the lines, at the end
  bool _processEnded GUARDED_BY(_lock) = false;
  bool _finished GUARDED_BY(_lock) = false;
  bool _stops GUARDED_BY(_lock) = false;
  std::thread _thread;
};

// Opens a file to append log lines to, made where it is missing. Never waits: a FIFO keeps what comes before its reader
// does. Throws std::system_error.
Descriptor openForLog(const std::string& path);

}  // namespace tether
