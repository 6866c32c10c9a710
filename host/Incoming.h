// What a helper writes to its standard output: read on a thread of its own, and kept in order until it is taken.
//
// What nobody takes is kept up to 64 MiB of memory, whoever waits for what; beyond it the helper is made to wait.
#pragma once

#include <deque>
#include <functional>
#include <memory>
#include <optional>

#include "Descriptors.h"
#include "Locks.h"
#include "Messages.h"
#include "Thread.h"
#include "Wakeup.h"

namespace tether {

class Incoming {
 public:
  // Reads from `pipe` from now on, and rings the wakeup for each message and at the end. `seen` is called with every
  // message on the reading thread, before anyone can take it. Throws std::system_error when there is no thread to be
  // had.
  Incoming(Descriptor pipe, std::shared_ptr<Wakeup> wakeup, std::function<void(const Message&)> seen);
  Incoming(const Incoming&) = delete;
  Incoming& operator=(const Incoming&) = delete;
  // Reads no more.
  ~Incoming();

  // The process that writes has ended: what is in the pipe by now is all there will be, whoever else holds the other
  // end. Any thread.
  void processEnded();
  // Whether everything has been read: nothing comes after what is kept.
  bool finished() const;
  // Waits for that.
  bool waitUntilFinished(Clock::time_point until) const;

  // The thread that uses the session ---------------------------------------------------------------------------------

  bool empty() const;
  std::optional<Message> take();
  // The first reply with an id from `first` to `last` that is not among the oldest `passed` messages; adds those that
  // it passed over.
  std::optional<Message> takeReply(std::int32_t first, std::int32_t last, std::size_t& passed);
  // Whether a heartbeat ever came.
  bool beatOnce() const;
  // When something came last; now, while the helper is made to wait.
  Clock::time_point heard() const;

 private:
  void read(int pipe);
  void keep(Message message);
  void finish();

  std::shared_ptr<Wakeup> _wakeup;
  std::function<void(const Message&)> _seen;

  mutable platform::Mutex _lock;
  mutable platform::Condition _changed;
  std::deque<Message> _messages GUARDED_BY(_lock);
  std::size_t _memory GUARDED_BY(_lock) = 0;  // that the messages take
  bool _full GUARDED_BY(_lock) = false;       // the reading thread waits
  bool _beatOnce GUARDED_BY(_lock) = false;
  bool _processEnded GUARDED_BY(_lock) = false;
  bool _finished GUARDED_BY(_lock) = false;
  bool _stops GUARDED_BY(_lock) = false;
  Clock::time_point _heard GUARDED_BY(_lock) = Clock::now();

  std::shared_ptr<platform::Thread> _thread;
};

}  // namespace tether
