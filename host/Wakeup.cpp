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

void Wakeup::waitUntil(Clock::time_point until) {
  const auto now = Clock::now();
  const auto left = std::clamp<Clock::duration>(until - std::min(now, until), 0s, kLongestPoll);
  pollfd ready{_pipe.read.get(), POLLIN, 0};
  poll(&ready, 1, static_cast<int>(std::chrono::ceil<std::chrono::milliseconds>(left).count()));
  std::array<char, 256> bytes{};
  while (read(_pipe.read.get(), bytes.data(), bytes.size()) > 0) {
  }
}

}  // namespace tether
