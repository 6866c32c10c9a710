#include "FileHandle.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <system_error>

#include "Log.h"
#include "NotificationCenter.h"

namespace platform {
namespace {

constexpr std::size_t kLargestRead = 64 * 1024;
// One write() takes no more than 2 GiB less a page on Linux, and fails above 2 GiB on macOS.
constexpr std::size_t kLargestWrite = 1U << 30;

int standardInputDescriptor = STDIN_FILENO;
int standardOutputDescriptor = STDOUT_FILENO;

int checked(int result) {
  if (result < 0) throw std::system_error(errno, std::generic_category(), "standard pipes");
  return result;
}

}  // namespace

const std::shared_ptr<FileHandle>& FileHandle::standardInput() {
  static const auto* const handle = new std::shared_ptr<FileHandle>(new FileHandle(standardInputDescriptor));
  return *handle;
}

const std::shared_ptr<FileHandle>& FileHandle::standardOutput() {
  static const auto* const handle = new std::shared_ptr<FileHandle>(new FileHandle(standardOutputDescriptor));
  return *handle;
}

void FileHandle::guardStandardPipes() {
  standardInputDescriptor = checked(fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, STDERR_FILENO + 1));
  standardOutputDescriptor = checked(fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, STDERR_FILENO + 1));
  const int nothing = checked(open("/dev/null", O_RDWR | O_CLOEXEC));
  checked(dup2(nothing, STDIN_FILENO));
  checked(dup2(STDERR_FILENO, STDOUT_FILENO));
  close(nothing);
}

FileHandle::~FileHandle() {
  stopReading();
  close(_descriptor);
}

void FileHandle::readInBackgroundAndNotify() {
  if (_watch) {
    _watch.setEnabled(true);
  } else {
    _watch = DescriptorWatch(_descriptor, [this] { readNow(); });
  }
}

void FileHandle::stopReading() { _watch.end(); }

void FileHandle::readNow() {
  std::vector<char> bytes(kLargestRead);
  const ssize_t got = read(_descriptor, bytes.data(), bytes.size());
  if (got < 0) {
    if (errno == EINTR || errno == EAGAIN || errno == EWOULDBLOCK) return;
    log("Reading descriptor %d failed: %s", _descriptor, std::strerror(errno));
  }
  _watch.setEnabled(false);
  bytes.resize(static_cast<std::size_t>(std::max<ssize_t>(got, 0)));
  NotificationCenter::defaultCenter().post(
      {kFileHandleReadCompletionNotification, this, std::make_shared<const Data>(std::move(bytes))});
}

void FileHandle::finishWriting(Clock::duration wait) {
  _writingIsOver = true;
  if (_writeLock.try_lock_for(wait)) _writeLock.unlock();
}

int FileHandle::write(const char* bytes, std::size_t count) {
  // Looked at before the lock, which a thread that writes on and on would hardly let go of otherwise, and under it.
  if (_writingIsOver) return ECANCELED;
  const Guard guard(_writeLock);
  if (_writingIsOver) return ECANCELED;
  while (count > 0) {
    const ssize_t written = ::write(_descriptor, bytes, std::min(count, kLargestWrite));
    if (written >= 0) {
      bytes += written;
      count -= static_cast<std::size_t>(written);
      continue;
    }
    const int error = errno;
    if (error == EAGAIN || error == EWOULDBLOCK) {
      pollfd ready{_descriptor, POLLOUT, 0};
      poll(&ready, 1, -1);
    } else if (error != EINTR) {
      return error;
    }
  }
  return 0;
}

}  // namespace platform
