#include "Log.h"

#include <poll.h>
#include <unistd.h>

#include <algorithm>

namespace gphoto2camera {

void log(const std::string& camera, const std::string& text) {
  std::string line = "gphoto2: " + (camera.empty() ? text : camera + ": " + text);
  std::replace(line.begin(), line.end(), '\n', ' ');
  line += '\n';
  pollfd ready{STDERR_FILENO, POLLOUT, 0};
  if (poll(&ready, 1, 0) == 1 && (ready.revents & POLLOUT) != 0)
    static_cast<void>(!write(STDERR_FILENO, line.data(), line.size()));
}

}  // namespace gphoto2camera
