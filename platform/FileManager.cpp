#include "FileManager.h"

#include <dirent.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "Log.h"

namespace platform {

bool FileManager::exists(const std::string& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0;
}

bool FileManager::isDirectory(const std::string& path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

bool FileManager::remove(const std::string& path) { return unlink(path.c_str()) == 0; }

int FileManager::reserve(int file, std::uint64_t bytes) {
  rlimit limit{};
  if (getrlimit(RLIMIT_FSIZE, &limit) == 0 && bytes > limit.rlim_cur) return EFBIG;
  const int error = keepRoom(file, bytes);
  return error == ENOSPC || error == EDQUOT || error == EFBIG ? error : 0;
}

std::vector<std::string> FileManager::contents(const std::string& directory) {
  std::vector<std::string> names;
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(opendir(directory.c_str()), closedir);
  if (!stream) return names;
  while (const dirent* entry = readdir(stream.get())) {
    const std::string_view name = static_cast<const char*>(entry->d_name);
    if (name != "." && name != "..") names.emplace_back(name);
  }
  std::sort(names.begin(), names.end());
  return names;
}

namespace {

// 0, or why it is no directory.
int unusable(const char* directory) {
  struct stat status {};
  if (stat(directory, &status) != 0) return errno;
  return S_ISDIR(status.st_mode) ? 0 : ENOTDIR;
}

}  // namespace

std::string temporaryDirectory() {
  std::string directory = "/tmp";
  const char* const named = std::getenv("TMPDIR");
  const bool isNamed = named != nullptr && *named != '\0';
  const int error = isNamed ? unusable(named) : 0;
  if (isNamed && error == 0) directory = named;
#if defined(__APPLE__)
  char users[1024];
  const size_t length = confstr(_CS_DARWIN_USER_TEMP_DIR, users, sizeof users);
  if (!isNamed && length > 0 && length <= sizeof users) directory = users;
#endif
  while (directory.size() > 1 && directory.back() == '/') directory.pop_back();
  if (error != 0) {
    log("The temporary directory %s cannot be used: %s; using %s", named, std::strerror(error), directory.c_str());
  }
  return directory;
}

std::string_view lastPathComponent(std::string_view path) {
  const auto slash = path.rfind('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

std::string_view deletingLastPathComponent(std::string_view path) {
  const auto slash = path.rfind('/');
  if (slash == std::string_view::npos) return {};
  return path.substr(0, slash == 0 ? 1 : slash);
}

std::string_view pathExtension(std::string_view path) {
  const std::string_view name = lastPathComponent(path);
  const auto period = name.rfind('.');
  return period == std::string_view::npos || period == 0 ? std::string_view() : name.substr(period + 1);
}

std::string_view deletingPathExtension(std::string_view path) {
  const std::string_view name = lastPathComponent(path);
  const auto period = name.rfind('.');
  return period == std::string_view::npos || period == 0 ? path : path.substr(0, path.size() - (name.size() - period));
}

std::string appendingPathComponent(std::string_view path, std::string_view component) {
  std::string joined(path);
  if (!joined.empty() && joined.back() != '/') joined += '/';
  return joined.append(component);
}

}  // namespace platform
