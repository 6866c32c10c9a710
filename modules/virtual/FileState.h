// What a file looks like from outside, to tell whether it has changed. Internal.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <algorithm>
#include <cstdint>
#include <optional>
#include <string>

namespace virtualcamera {

// In nanoseconds since 1970, as far as they go.
inline int64_t modificationTime(const struct stat& status) {
#ifdef __APPLE__
  const struct timespec time = status.st_mtimespec;
#else
  const struct timespec time = status.st_mtim;
#endif
  return std::clamp<int64_t>(time.tv_sec, -4'000'000'000, 9'000'000'000) * 1'000'000'000 + time.tv_nsec;
}

struct FileState {
  ino_t inode = 0;
  off_t size = 0;
  int64_t modified = 0;

  bool operator==(const FileState&) const = default;
  // Without the inode: a folder that was away may come back from another file system.
  bool looksLike(const FileState& other) const { return size == other.size && modified == other.modified; }

  // Nothing for what is no regular file, or is not there.
  static std::optional<FileState> of(const struct stat& status) {
    if (!S_ISREG(status.st_mode)) return std::nullopt;
    return FileState{status.st_ino, status.st_size, modificationTime(status)};
  }
  static std::optional<FileState> of(const std::string& path) {
    struct stat status {};
    return stat(path.c_str(), &status) == 0 ? of(status) : std::nullopt;
  }
  static std::optional<FileState> of(int descriptor) {
    struct stat status {};
    return fstat(descriptor, &status) == 0 ? of(status) : std::nullopt;
  }
};

}  // namespace virtualcamera
