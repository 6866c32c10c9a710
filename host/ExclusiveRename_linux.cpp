#include <fcntl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

#include "ExclusiveRename.h"

namespace tether {

int renameExclusively(const std::string& from, const std::string& to) {
  constexpr unsigned kNoReplace = 1;
  return syscall(SYS_renameat2, AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), kNoReplace) == 0 ? 0 : errno;
}

}  // namespace tether
