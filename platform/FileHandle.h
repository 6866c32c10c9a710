// One end of a pipe, or a file: whole writes, and background reads that report through a notification.
#pragma once

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>

#include "Data.h"
#include "Locks.h"
#include "RunLoop.h"

namespace platform {

class FileHandle {
 public:
  // The pipes that were the process's standard input and output when it started; they live until it ends.
  static const std::shared_ptr<FileHandle>& standardInput();
  static const std::shared_ptr<FileHandle>& standardOutput();
  // Moves both to descriptors of their own, once, before they are used. What a library closes, reads or prints on
  // descriptors 0 and 1 from then on is /dev/null and the standard error. Throws std::system_error.
  static void guardStandardPipes();

  // Takes the descriptor over and closes it in the end.
  explicit FileHandle(int descriptor) : _descriptor(descriptor) {}
  FileHandle(const FileHandle&) = delete;
  FileHandle& operator=(const FileHandle&) = delete;
  ~FileHandle();

  int descriptor() const { return _descriptor; }

  // Starts one read of whatever there is, at most 64 KiB. When it completes, the default notification center delivers
  // kFileHandleReadCompletionNotification with this handle as the object and the bytes, none at the end of the input or
  // when reading fails, on the calling thread's run loop. One read at a time, always from the same thread.
  void readInBackgroundAndNotify();
  // Gives the reading up. From the thread that started it.
  void stopReading();

  // Writes all bytes before it returns, apart from every other write through this handle; waits for a reader as long as
  // it takes. 0, or the error number of the write that failed: part of the bytes may then be out. Any thread.
  int write(const char* bytes, std::size_t count);

  // Lets no further write begin, they report ECANCELED, and waits so long at most for the one in progress to be whole.
  void finishWriting(Clock::duration wait);

 private:
  void readNow();

  const int _descriptor;
  std::atomic<bool> _writingIsOver{false};
  TimedLock _writeLock;
  DescriptorWatch _watch;
};

}  // namespace platform
