#include "Descriptors.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <system_error>

namespace tether {

Descriptor aboveStandardError(Descriptor low) {
  if (low.get() > STDERR_FILENO) {
    fcntl(low.get(), F_SETFD, FD_CLOEXEC);
    return low;
  }
  Descriptor high(fcntl(low.get(), F_DUPFD_CLOEXEC, STDERR_FILENO + 1));
  if (!high) throw std::system_error(errno, std::generic_category(), "no descriptor to be had");
  return high;
}

void Descriptor::reset() {
  if (_descriptor >= 0) close(std::exchange(_descriptor, -1));
}

Pipe Pipe::make() {
  const platform::Guard guard(spawnLock());
  std::array<int, 2> ends{};
  if (pipe(ends.data()) != 0) throw std::system_error(errno, std::generic_category(), "no pipe to be had");
  Descriptor read(ends[0]);
  Descriptor write(ends[1]);
  return {aboveStandardError(std::move(read)), aboveStandardError(std::move(write))};
}

void setNonBlocking(int descriptor) { fcntl(descriptor, F_SETFL, fcntl(descriptor, F_GETFL) | O_NONBLOCK); }

platform::Mutex& spawnLock() {
  static platform::Mutex lock;
  return lock;
}

}  // namespace tether
