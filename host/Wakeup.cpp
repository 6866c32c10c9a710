#include "Wakeup.h"

#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>

namespace tether {
namespace {

using namespace std::chrono_literals;

// What one poll() is asked for at most; a longer wait takes another.
constexpr auto kLongestPoll = 1h;

}  // namespace

Wakeup::Wakeup() : _pipe(Pipe::make()) {
  setNonBlocking(_pipe.read.get());
  setNonBlocking(_pipe.write.get());
}

void Wakeup::ring() noexcept {
  const int savedErrno = errno;
  const char byte = 0;
  // A full pipe has rung already.
  [[maybe_unused]] const ssize_t ignored = write(_pipe.write.get(), &byte, 1);
  errno = savedErrno;
}

void Wakeup::interrupt() noexcept {
  ++_interruptions;
  ring();
}

void Wakeup::nudge() noexcept {
  _nudged = true;
  ring();
}

void Wakeup::waitUntil(Clock::time_point until) { pollUntil(until, -1); }

bool Wakeup::waitUntilWritable(int descriptor, Clock::time_point until) {
  while (!pollUntil(until, descriptor)) {
    // Rings are of no account: who waits for one looks for its reason first.
    if (interrupted() || Clock::now() >= until) return false;
  }
  return true;
}

// One poll; takes the rings. Whether the descriptor, if it is one, is ready.
bool Wakeup::pollUntil(Clock::time_point until, int writable) {
  const auto now = Clock::now();
  const auto left = std::clamp<Clock::duration>(until - std::min(now, until), 0s, kLongestPoll);
  std::array<pollfd, 2> ready{{{_pipe.read.get(), POLLIN, 0}, {writable, POLLOUT, 0}}};
  const int result =
      poll(ready.data(), ready.size(), static_cast<int>(std::chrono::ceil<std::chrono::milliseconds>(left).count()));
  std::array<char, 256> bytes{};
  while (read(_pipe.read.get(), bytes.data(), bytes.size()) > 0) {
  }
  return result > 0 && ready[1].revents != 0;
}

}  // namespace tether
