#include <fcntl.h>

#include <cerrno>

#include "FileManager.h"

namespace platform {

int FileManager::keepRoom(int file, std::uint64_t bytes) {
  fstore_t request = {F_ALLOCATEALL, F_PEOFPOSMODE, 0, static_cast<off_t>(bytes), 0};
  return fcntl(file, F_PREALLOCATE, &request) == 0 ? 0 : errno;
}

}  // namespace platform
