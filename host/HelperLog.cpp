#include "HelperLog.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <csignal>
#include <system_error>

namespace tether {
namespace {

using namespace std::chrono_literals;

constexpr std::size_t kMostLines = 100;
constexpr std::size_t kLongestLine = 4096;
constexpr std::size_t kMostWaiting = std::size_t{256} << 10;
constexpr auto kLastWrite = 500ms;
// Others may write to the pipe for ever.
constexpr auto kLongestEnd = 1s;

bool isReady(int descriptor, short what) {
  pollfd ready{descriptor, what, 0};
  return poll(&ready, 1, 0) == 1 && (ready.revents & what) != 0;
}

// "2024-05-01 12:00:00.123 TetherHelper[99] " is not part of what a line says.
std::string_view withoutStamp(std::string_view line) {
  constexpr std::string_view kForm = "0000-00-00 00:00:00.000 ";
  if (line.size() < kForm.size()) return line;
  for (std::size_t i = 0; i < kForm.size(); ++i) {
    const bool digit = line[i] >= '0' && line[i] <= '9';
    if (kForm[i] == '0' ? !digit : line[i] != kForm[i]) return line;
  }
  const auto end = line.find("] ", kForm.size());
  return end == std::string_view::npos ? line : line.substr(end + 2);
}

}  // namespace

HelperLog::HelperLog(Descriptor pipe, int target, std::shared_ptr<Wakeup> wakeup)
    : _pipe(std::move(pipe)), _target(target), _wakeup(std::move(wakeup)) {
  setNonBlocking(_pipe.get());
  setNonBlocking(_bell.write.get());
  _thread = std::thread([this] { run(); });
}

HelperLog::~HelperLog() {
  {
    const platform::Guard guard(_lock);
    _stops = true;
  }
  _bell.write.reset();
  _thread.join();
}

void HelperLog::processEnded() {
  {
    const platform::Guard guard(_lock);
    _processEnded = true;
  }
  const char byte = 0;
  [[maybe_unused]] const ssize_t ignored = write(_bell.write.get(), &byte, 1);
}

void HelperLog::run() {
  // Signals are the other threads' business, and a target that is gone is an error of the write.
  sigset_t all;
  sigfillset(&all);
  pthread_sigmask(SIG_BLOCK, &all, nullptr);
  auto until = Clock::time_point::max();
  bool reads = true;
  for (;;) {
    std::array<pollfd, 3> watched{{{_bell.read.get(), POLLIN, 0},
                                   {reads ? _pipe.get() : -1, POLLIN, 0},
                                   {_waiting.empty() ? -1 : _target, POLLOUT, 0}}};
    poll(watched.data(), watched.size(), -1);
    std::array<char, 16> rings{};
    if ((watched[0].revents & POLLIN) != 0) (void)!read(_bell.read.get(), rings.data(), rings.size());
    {
      const platform::Guard guard(_lock);
      if (_stops) break;
      if (_processEnded) until = std::min(until, Clock::now() + kLongestEnd);
    }
    // An end that is known by now is looked for before the pipe is: what was written before it is there.
    const bool ended = until != Clock::time_point::max();
    reads = reads && readSome() && !(ended && (!isReady(_pipe.get(), POLLIN) || Clock::now() >= until));
    if (!reads) finish();
    passOn();
  }
  keepLine();
  for (const auto last = Clock::now() + kLastWrite; !_waiting.empty() && Clock::now() < last; passOn()) {
    pollfd ready{_target, POLLOUT, 0};
    poll(&ready, 1, static_cast<int>(kLastWrite.count()));
  }
}

// False at the end of the pipe.
bool HelperLog::readSome() {
  std::array<char, 16 * 1024> bytes{};
  const ssize_t got = read(_pipe.get(), bytes.data(), bytes.size());
  if (got < 0) return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
  keep({bytes.data(), static_cast<std::size_t>(got)});
  return got > 0;
}

void HelperLog::keep(std::string_view bytes) {
  if (_waiting.size() + bytes.size() > kMostWaiting) {
    _dropped += static_cast<int>(std::count(bytes.begin(), bytes.end(), '\n'));
  } else {
    if (_dropped > 0) _waiting += "(" + std::to_string(std::exchange(_dropped, 0)) + " lines were dropped here)\n";
    _waiting += bytes;
  }
  for (const char byte : bytes) {
    if (byte == '\n') {
      keepLine();
    } else if (_line.size() < kLongestLine) {
      _line += byte;
    }
  }
}

void HelperLog::keepLine() {
  if (_line.empty()) return;
  {
    const platform::Guard guard(_lock);
    _lines.push_back({std::string(withoutStamp(_line))});
    ++_untaken;
    if (_lines.size() > kMostLines) _lines.pop_front();
    _untaken = std::min(_untaken, _lines.size());
  }
  _line.clear();
  _wakeup->ring();
}

// As much as the target takes at once; what it fails to take is given up.
void HelperLog::passOn() {
  while (!_waiting.empty()) {
    pollfd ready{_target, POLLOUT, 0};
    if (poll(&ready, 1, 0) != 1) return;
    // A pipe that is ready takes so much without a wait.
    const ssize_t written = write(_target, _waiting.data(), std::min<std::size_t>(_waiting.size(), PIPE_BUF));
    if (written < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR)) return;
    _waiting.erase(0, written < 0 ? _waiting.size() : static_cast<std::size_t>(written));
  }
}

void HelperLog::finish() {
  keepLine();
  {
    const platform::Guard guard(_lock);
    _finished = true;
  }
  _changed.notifyAll();
}

bool HelperLog::waitUntilFinished(Clock::time_point until) const {
  const platform::Guard guard(_lock);
  while (!_finished && _changed.waitUntil(_lock, until)) continue;
  return _finished;
}

std::optional<LogLine> HelperLog::take() {
  const platform::Guard guard(_lock);
  if (_untaken == 0) return {};
  return _lines[_lines.size() - _untaken--];
}

bool HelperLog::empty() const {
  const platform::Guard guard(_lock);
  return _untaken == 0;
}

std::vector<LogLine> HelperLog::lastLines() const {
  const platform::Guard guard(_lock);
  return {_lines.begin(), _lines.end()};
}

Descriptor openForLog(const std::string& path) {
  struct stat status {};
  const bool fifo = stat(path.c_str(), &status) == 0 && S_ISFIFO(status.st_mode);
  // To write alone, a FIFO without a reader cannot be opened, and is at its end whenever a reader goes.
  const int access = fifo ? O_RDWR : O_WRONLY;
  const platform::Guard guard(spawnLock());
  Descriptor file(open(path.c_str(), access | O_CREAT | O_APPEND | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, 0666));
  if (!file) throw std::system_error(errno, std::generic_category(), path);
  return file;
}

}  // namespace tether
