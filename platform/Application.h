// The process: started once, ended in one place.
#pragma once

#include <atomic>
#include <functional>
#include <memory>

namespace platform {

class Application {
 public:
  static Application& shared();

  // Ends the process with status 0: delivers kApplicationWillTerminateNotification, waits up to half a second for a
  // write to standard output in progress on another thread, and leaves. No destructor runs, so threads may go on until
  // the last moment. For the main thread.
  //
  // SIGTERM and SIGINT come here too. Where the main thread is held up, a thread of the application's own comes here in
  // its place, within two seconds of the signal or of the end of the standard input: observers may be called there.
  [[noreturn]] void terminate();

  // From now on the end of the standard input ends nothing: the process is on its way to terminate() already, and may
  // take its time. Signals still end it. Any thread.
  void ignoreEndOfInput() { _ignoresEndOfInput = true; }
  bool ignoresEndOfInput() const { return _ignoresEndOfInput; }

 private:
  Application() = default;

  std::atomic<bool> _ignoresEndOfInput{false};
};

// Turns the calling thread into the application's main thread: makes the main interface with `load`, keeps it, and runs
// the main run loop until the application terminates. Ignores SIGPIPE. Guards the standard pipes (FileHandle). Returns
// only if the interface could not be made, with a line in the log and a status other than 0, or the loop is stopped.
int applicationMain(int argc, char** argv, const std::function<std::shared_ptr<void>()>& load);

}  // namespace platform
