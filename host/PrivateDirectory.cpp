#include "PrivateDirectory.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <system_error>

#include "FileManager.h"

namespace tether {

PrivateDirectory::PrivateDirectory()
    : _path(platform::appendingPathComponent(platform::temporaryDirectory(), "tether.XXXXXX")) {
  if (mkdtemp(_path.data()) == nullptr) throw std::system_error(errno, std::generic_category(), _path);
}

PrivateDirectory::~PrivateDirectory() { tidy(); }

std::vector<std::string> PrivateDirectory::tidy() const {
  std::vector<std::string> left;
  for (const std::string& name : platform::FileManager::contents(_path)) {
    std::string path = platform::appendingPathComponent(_path, name);
    struct stat status {};
    const bool empty = lstat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode) && status.st_size == 0;
    if (!empty || unlink(path.c_str()) != 0) left.push_back(std::move(path));
  }
  if (left.empty()) rmdir(_path.c_str());
  return left;
}

}  // namespace tether
