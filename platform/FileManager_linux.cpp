#include <fcntl.h>

#include <cerrno>

#include "FileManager.h"

namespace platform {

int FileManager::keepRoom(int file, std::uint64_t bytes) {
  int result = 0;
  do {
    result = fallocate(file, FALLOC_FL_KEEP_SIZE, 0, static_cast<off_t>(bytes));
  } while (result != 0 && errno == EINTR);
  return result == 0 ? 0 : errno;
}

}  // namespace platform
