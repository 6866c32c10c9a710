#include "FileMover.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <initializer_list>
#include <string_view>
#include <vector>

#include "Descriptors.h"
#include "ExclusiveRename.h"
#include "FileManager.h"

namespace tether {
namespace {

constexpr int kMostNumbers = 100'000;
constexpr std::size_t kCopyChunk = std::size_t{1} << 20;

// Two of these are one number on some systems.
bool isOneOf(int error, std::initializer_list<int> errors) {
  return std::find(errors.begin(), errors.end(), error) != errors.end();
}

bool cannotRenameExclusively(int error) { return isOneOf(error, {EINVAL, ENOSYS, ENOTSUP, EOPNOTSUPP}); }

bool cannotLink(int error) { return isOneOf(error, {EPERM, ENOSYS, ENOTSUP, EOPNOTSUPP, EMLINK}); }

// A name to put into a folder: the last component, and never one that leads elsewhere.
std::string bareName(const std::string& name) {
  std::string bare(platform::lastPathComponent(name));
  return bare.empty() || bare == "." || bare == ".." ? "Picture" : bare;
}

Descriptor makeHidden(std::string& name) {
  const std::lock_guard guard(spawnLock());
  Descriptor file(mkstemp(name.data()));
  if (file) fcntl(file.get(), F_SETFD, FD_CLOEXEC);
  return file;
}

}  // namespace

int FileCalls::renameExclusively(const std::string& from, const std::string& to) {
  return tether::renameExclusively(from, to);
}

int FileCalls::link(const std::string& from, const std::string& to) {
  return linkat(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), 0) == 0 ? 0 : errno;
}

ssize_t FileCalls::write(int descriptor, const void* bytes, std::size_t count) {
  return ::write(descriptor, bytes, count);
}

int FileCalls::flush(int descriptor) { return fsync(descriptor) == 0 ? 0 : errno; }

int FileCalls::remove(const std::string& path) { return unlink(path.c_str()) == 0 ? 0 : errno; }

// A name in the folder, and the next one when it is taken.
struct FileMover::Name {
  std::string base;
  std::string extension;  // with its period
  bool sparesBases = false;
  std::vector<std::string> taken;  // bases in the folder
  int number = 1;

  std::string numbered() const { return number == 1 ? base : base + "-" + std::to_string(number); }
  std::string file() const { return numbered() + extension; }
  bool isSpared() const {
    if (!sparesBases) return false;
    const std::string candidate = numbered();
    for (const std::string& other : taken) {
      if (other == candidate) return true;
    }
    return false;
  }
};

FileMover::FileMover(std::string folder, FileCalls* calls)
    : _folder(std::move(folder)), _calls(calls == nullptr ? &_system : calls) {
  const mode_t mask = umask(S_IRWXG | S_IRWXO);
  umask(mask);
  _mode = 0666U & ~mask;
}

MovedFile FileMover::move(const std::string& source, const std::string& announced, bool firstOfPair,
                          const std::optional<std::string>& base) {
  MovedFile result;
  result.path = source;
  const auto failed = [&](int error) {
    result.description = std::strerror(error);
    return result;
  };
  struct stat status {};
  if (lstat(source.c_str(), &status) != 0) return failed(errno);
  if (!S_ISREG(status.st_mode)) {
    result.description = "not a regular file";
    return result;
  }
  result.size = status.st_size;
  if (const Descriptor file(open(source.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC)); file) fchmod(file.get(), _mode);

  const std::string bare = bareName(announced);
  const std::string_view plain = platform::deletingPathExtension(bare);
  Name name{base ? *base : std::string(plain), bare.substr(plain.size()), firstOfPair && !base, {}, 1};
  if (name.sparesBases) {
    for (const std::string& other : platform::FileManager::contents(_folder)) {
      name.taken.emplace_back(platform::deletingPathExtension(other));
    }
  }

  int error = place(source, name);
  if (error == EXDEV) {
    std::string hidden = platform::appendingPathComponent(_folder, "." + name.file() + ".XXXXXX");
    error = copy(source, hidden, status.st_size);
    if (error == 0) {
      error = place(hidden, name);
      if (error != 0) _calls->remove(hidden);
    }
    if (error == 0) {
      // The picture has its name; a folder that cannot be flushed does not take that back.
      flushFolder();
      const int left = _calls->remove(source);
      if (left != 0) result.description = "the first copy stays at " + source + ": " + std::strerror(left);
    }
  }
  if (error != 0) return failed(error);
  result.moved = true;
  result.base = name.numbered();
  result.path = platform::appendingPathComponent(_folder, name.file());
  return result;
}

// Gives `from` the first free name.
int FileMover::place(const std::string& from, Name& name) {
  for (; name.number <= kMostNumbers; ++name.number) {
    if (name.isSpared()) continue;
    const int error = placeAs(from, platform::appendingPathComponent(_folder, name.file()));
    if (error != EEXIST) return error;
  }
  return EEXIST;
}

// Where a file system knows neither an exclusive rename nor links, the name is reserved with an empty file of ours.
int FileMover::placeAs(const std::string& from, const std::string& to) {
  int error = _calls->renameExclusively(from, to);
  if (!cannotRenameExclusively(error)) return error;
  error = _calls->link(from, to);
  if (error == 0) _calls->remove(from);
  if (!cannotLink(error)) return error;
  const Descriptor reserved(open(to.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!reserved) return errno;
  if (rename(from.c_str(), to.c_str()) == 0) return 0;
  error = errno;
  unlink(to.c_str());
  return error;
}

// The end of the hidden name is chosen here: one that a killed process left must not be in the way.
int FileMover::copy(const std::string& source, std::string& hidden, std::int64_t size) {
  const Descriptor from(open(source.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  struct stat status {};
  if (!from || fstat(from.get(), &status) != 0) return errno;
  const Descriptor to = makeHidden(hidden);
  if (!to) return errno;
  fchmod(to.get(), _mode);
  int error = copyBytes(from.get(), to.get(), size);
  if (error == 0) error = _calls->flush(to.get());
  if (error == 0) {
    struct stat copied {};
    if (fstat(to.get(), &copied) != 0 || copied.st_size != size) error = EIO;
  }
  if (error != 0) _calls->remove(hidden);
  return error;
}

int FileMover::copyBytes(int from, int to, std::int64_t size) {
  std::vector<char> bytes(kCopyChunk);
  std::int64_t copied = 0;
  for (;;) {
    const ssize_t got = read(from, bytes.data(), bytes.size());
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return errno;
    if (got == 0) return copied == size ? 0 : EIO;
    for (ssize_t done = 0; done < got;) {
      const ssize_t written = _calls->write(to, bytes.data() + done, static_cast<std::size_t>(got - done));
      if (written < 0 && errno != EINTR) return errno;
      if (written == 0) return EIO;
      if (written > 0) done += written;
    }
    copied += got;
  }
}

int FileMover::flushFolder() {
  const Descriptor folder(open(_folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return folder ? _calls->flush(folder.get()) : errno;
}

}  // namespace tether
