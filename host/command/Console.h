// Where the command writes: results to standard output, one line at a time; words about its course to standard error;
// and, where that is a terminal, one live line that later output replaces. Any thread.
#pragma once

#include <atomic>
#include <mutex>
#include <string>

#include "Text.h"

namespace tether::command {

class Console {
 public:
  explicit Console(bool json);
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
  void replaceStatus(const std::string& text);

  const bool _json;
  const bool _live;
  std::atomic<bool> _closed{false};
  std::mutex _lock;  // held for one line
  std::string _shown;
};

}  // namespace tether::command
