#include "Log.h"

#include <poll.h>
#include <sys/time.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <ctime>
#include <memory>

#include "Locks.h"

namespace platform {
namespace {

// The longest line that a pipe takes whole.
constexpr std::size_t kLongestLine = 4096;

using Sink = std::function<void(const std::string&)>;

Mutex sinkLock;
std::shared_ptr<const Sink>& currentSink() REQUIRES(sinkLock) {
  static std::shared_ptr<const Sink> sink;
  return sink;
}

std::size_t writeStamp(char* out, std::size_t room) {
  timeval now{};
  gettimeofday(&now, nullptr);
  tm local{};
  localtime_r(&now.tv_sec, &local);
  const std::size_t date = std::strftime(out, room, "%Y-%m-%d %H:%M:%S", &local);
  const int rest = std::snprintf(out + date, room - date, ".%03d TetherHelper[%d] ",
                                 static_cast<int>(now.tv_usec / 1000), static_cast<int>(getpid()));
  return date + static_cast<std::size_t>(rest);
}

// Held from the question whether there is room until the line is out: another thread would take the room.
Mutex writeLock;
unsigned long dropped GUARDED_BY(writeLock) = 0;  // lines since the last one that went out

bool writeNow(const char* line, std::size_t length) {
  pollfd ready{STDERR_FILENO, POLLOUT, 0};
  if (poll(&ready, 1, 0) != 1 || (ready.revents & POLLOUT) == 0) return false;
  ssize_t written = 0;
  do {
    written = write(STDERR_FILENO, line, length);
  } while (written < 0 && errno == EINTR);
  return written >= 0;
}

bool writeNoteOfDropped() REQUIRES(writeLock) {
  std::array<char, 160> line{};
  const std::size_t stamp = writeStamp(line.data(), line.size());
  const int text = std::snprintf(line.data() + stamp, line.size() - stamp,
                                 "%lu log lines were dropped here: nobody read them\n", dropped);
  return writeNow(line.data(), stamp + static_cast<std::size_t>(text));
}

void writeLine(const char* line, std::size_t length) {
  const Guard guard(writeLock);
  if (dropped > 0 && writeNoteOfDropped()) dropped = 0;
  if (dropped > 0 || !writeNow(line, length)) ++dropped;
}

}  // namespace

void log(const char* format, ...) {
  const int savedErrno = errno;
  std::array<char, kLongestLine> line{};
  const std::size_t stamp = writeStamp(line.data(), line.size());
  va_list arguments;
  va_start(arguments, format);
  const std::size_t room = line.size() - stamp - 1;
  const int wanted = std::vsnprintf(line.data() + stamp, room, format, arguments);
  va_end(arguments);
  const std::size_t text = wanted < 0 ? 0 : std::min(static_cast<std::size_t>(wanted), room - 1);

  std::shared_ptr<const Sink> sink;
  {
    const Guard guard(sinkLock);
    sink = currentSink();
  }
  if (sink) {
    (*sink)(std::string(line.data() + stamp, text));
  } else {
    line[stamp + text] = '\n';
    writeLine(line.data(), stamp + text + 1);
  }
  errno = savedErrno;
}

void setLogSink(std::function<void(const std::string&)> sink) {
  auto fresh = sink ? std::make_shared<const std::function<void(const std::string&)>>(std::move(sink)) : nullptr;
  const Guard guard(sinkLock);
  currentSink().swap(fresh);
}

}  // namespace platform
