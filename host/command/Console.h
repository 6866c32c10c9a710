// Where the command writes: results to standard output, one line at a time; words about its course to standard error;
// and, where that is a terminal, one live line that later output replaces. Any thread.
//
// A reader that takes nothing for a while is waited for, until the user interrupts: what is to be said then and later
// is given up when it is not taken within a moment.
#pragma once

#include <atomic>
#include <string>
#include <string_view>
#include <thread>

#include "Locks.h"
#include "Text.h"
#include "Wakeup.h"

namespace tether::command {

class Console {
 public:
  // Made on the thread that waits in the wakeup, which outlives the console.
  Console(bool json, Wakeup& wakeup);
  // Clears the live line.
  ~Console();
  Console(const Console&) = delete;
  Console& operator=(const Console&) = delete;

  bool json() const { return _json; }
  // Whether there is a live line.
  bool live() const { return _live; }

  // A result: the object in JSON, else the text unless it is empty.
  void result(const std::string& text, const Json& object);
  // A word to the user, in both modes.
  void say(const std::string& text);
  // Sets the live line; "" clears it.
  void status(const std::string& text);

  // Standard output takes nothing any more.
  bool closed() const { return _closed; }

 private:
  void writeLine(std::string line);
  void replaceStatus(const std::string& text) REQUIRES(_lock);
  bool writeAll(int descriptor, std::string_view text);
  bool waitFor(int descriptor);

  const bool _json;
  const bool _live;
  Wakeup& _wakeup;
  const std::thread::id _thread = std::this_thread::get_id();
  std::atomic<bool> _closed{false};
  platform::Mutex _lock;  // held for one line
  std::string _shown GUARDED_BY(_lock);
};

}  // namespace tether::command
