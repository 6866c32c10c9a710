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
#include <mutex>

namespace platform {
namespace {

// The longest line that a pipe takes whole.
constexpr std::size_t kLongestLine = 4096;

std::mutex sinkLock;
std::shared_ptr<const std::function<void(const std::string&)>>& currentSink() {
  static std::shared_ptr<const std::function<void(const std::string&)>> sink;
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

void writeLine(const char* line, std::size_t length) {
  pollfd ready{STDERR_FILENO, POLLOUT, 0};
  if (poll(&ready, 1, 0) != 1 || (ready.revents & POLLOUT) == 0) return;
  while (write(STDERR_FILENO, line, length) < 0 && errno == EINTR) {
  }
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

  std::shared_ptr<const std::function<void(const std::string&)>> sink;
  {
    std::lock_guard guard(sinkLock);
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
  std::lock_guard guard(sinkLock);
  currentSink().swap(fresh);
}

}  // namespace platform
