#include "FileMover.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <initializer_list>
#include <string_view>
#include <vector>

#include "Descriptors.h"
#include "ExclusiveRename.h"
#include "FileManager.h"
#include "PictureType.h"

namespace tether {
namespace {

constexpr const char* kNotRegular = "not a regular file";
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

constexpr std::string_view kCopyPrefix = ".tether-copy.";
constexpr std::string_view kCopySuffix = "XXXXXX";

enum class Hold { kMine, kAnothers, kUnknown };

// A copy is held by whoever makes it, for as long as the process lives.
Hold hold(const Descriptor& copy) {
  if (flock(copy.get(), LOCK_EX | LOCK_NB) != 0) return errno == EWOULDBLOCK ? Hold::kAnothers : Hold::kUnknown;
  struct stat status {};
  // One that went before it was held.
  return fstat(copy.get(), &status) == 0 && status.st_nlink > 0 ? Hold::kMine : Hold::kAnothers;
}

// A fresh file of a hidden name. Where someone took it for a dead one before it was held, another.
Descriptor makeHidden(const std::string& folder, std::string& path) {
  for (;;) {
    path = platform::appendingPathComponent(folder, std::string(kCopyPrefix).append(kCopySuffix));
    Descriptor file;
    {
      const platform::Guard guard(spawnLock());
      file = Descriptor(mkstemp(path.data()));
      if (file) fcntl(file.get(), F_SETFD, FD_CLOEXEC);
    }
    if (!file || hold(file) != Hold::kAnothers) return file;
  }
}

// Some file systems know no flush of a folder, and some folders may be written but not read.
bool cannotFlushFolder(int error) { return isOneOf(error, {EINVAL, ENOSYS, ENOTSUP, EOPNOTSUPP, EACCES, EPERM}); }

bool isSame(const std::string& path, const std::string& other) {
  struct stat one {};
  struct stat two {};
  return stat(path.c_str(), &one) == 0 && stat(other.c_str(), &two) == 0 && one.st_dev == two.st_dev &&
         one.st_ino == two.st_ino;
}

// "base.jpg", "base-2.jpg" and so on.
bool isNumbered(std::string_view name, std::string_view base, std::string_view extension) {
  if (name.size() < base.size() + extension.size() || !name.starts_with(base) || !name.ends_with(extension))
    return false;
  const std::string_view number = name.substr(base.size(), name.size() - base.size() - extension.size());
  return number.empty() || (number.size() > 1 && number.front() == '-' &&
                            number.find_first_not_of("0123456789", 1) == std::string_view::npos);
}

// Of two regular files with the same bytes.
std::optional<std::int64_t> sizeOfSame(const std::string& one, const std::string& other) {
  struct stat first {};
  struct stat second {};
  if (lstat(one.c_str(), &first) != 0 || lstat(other.c_str(), &second) != 0 || !S_ISREG(first.st_mode) ||
      !S_ISREG(second.st_mode) || first.st_size != second.st_size) {
    return {};
  }
  std::ifstream left(one, std::ios::binary);
  std::ifstream right(other, std::ios::binary);
  using Bytes = std::istreambuf_iterator<char>;
  const bool same = left && right && std::equal(Bytes(left), Bytes(), Bytes(right));
  return same ? std::optional<std::int64_t>(first.st_size) : std::nullopt;
}

bool isOnDevice(const std::string& path, dev_t device) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 && status.st_dev == device;
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

int FileCalls::flush(int descriptor) {
#ifdef F_FULLFSYNC
  // What fsync() leaves in the disk's own memory there.
  if (fcntl(descriptor, F_FULLFSYNC) == 0) return 0;
#endif
  return fsync(descriptor) == 0 ? 0 : errno;
}

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

MovedFile FileMover::move(const std::string& source, const std::string& announced, std::optional<std::int64_t> size,
                          bool firstOfPair, const std::optional<std::string>& base) {
  MovedFile result;
  result.path = source;
  const auto failed = [&](const std::string& why) {
    result.description = why;
    return result;
  };
  const Descriptor file(open(source.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  struct stat status {};
  if (!file) return failed(errno == ELOOP ? kNotRegular : std::strerror(errno));
  if (fstat(file.get(), &status) != 0) return failed(std::strerror(errno));
  if (!S_ISREG(status.st_mode)) return failed(kNotRegular);
  result.size = status.st_size;
  if (size && *size != status.st_size) {
    return failed("it has " + std::to_string(status.st_size) + " bytes, not the " + std::to_string(*size) +
                  " announced");
  }

  const std::string bare = nameByContent(bareName(announced), file.get());
  const std::string_view plain = platform::deletingPathExtension(bare);
  Name name{base ? *base : std::string(plain), bare.substr(plain.size()), firstOfPair && !base, {}, 1};
  if (name.sparesBases) {
    for (const std::string& other : platform::FileManager::contents(_folder)) {
      name.taken.emplace_back(platform::deletingPathExtension(other));
    }
  }

  int error = isOnDevice(_folder, status.st_dev) ? rename(file, result, name) : EXDEV;
  if (error == EXDEV) error = copy(file, result, name);
  if (error != 0) return failed(std::strerror(error) + result.description);
  result.moved = true;
  result.base = name.numbered();
  result.path = pathOf(name);
  return result;
}

int FileMover::rename(const Descriptor& file, MovedFile& result, Name& name) {
  fchmod(file.get(), _mode);
  int error = _calls->flush(file.get());
  if (error == 0) error = place(result.path, name);
  if (error != 0) return error;
  error = flushFolder();
  if (error != 0 && placeAs(pathOf(name), result.path) != 0) result.path = pathOf(name);
  return error;
}

int FileMover::copy(const Descriptor& file, MovedFile& result, Name& name) {
  std::string hidden;
  const Descriptor copied = makeHidden(_folder, hidden);
  if (!copied) return errno;
  fchmod(copied.get(), _mode);
  int error = copyBytes(file.get(), copied.get(), result.size);
  if (error == 0) error = _calls->flush(copied.get());
  struct stat status {};
  if (error == 0 && (fstat(copied.get(), &status) != 0 || status.st_size != result.size)) error = EIO;
  if (error == 0) error = place(hidden, name);
  if (error != 0) {
    _calls->remove(hidden);
    return error;
  }
  error = flushFolder();
  if (error != 0) {
    if (_calls->remove(pathOf(name)) != 0) result.description = "; a copy that may not last is at " + pathOf(name);
    return error;
  }
  removeFirst(result, pathOf(name));
  return 0;
}

MovedFile& FileMover::removeFirst(MovedFile& moved, const std::string& to) {
  const int left = _calls->remove(moved.path);
  if (left != 0) moved.description = "the first copy stays at " + moved.path + ": " + std::strerror(left);
  moved.moved = true;
  moved.path = to;
  return moved;
}

std::optional<MovedFile> FileMover::finish(const std::string& source, const std::string& announced) {
  const Descriptor first(open(source.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  const std::string bare = nameByContent(bareName(announced), first.get());
  const std::string_view base = platform::deletingPathExtension(bare);
  const std::string_view extension = std::string_view(bare).substr(base.size());
  for (const std::string& other : platform::FileManager::contents(_folder)) {
    if (!isNumbered(other, base, extension)) continue;
    const std::string there = platform::appendingPathComponent(_folder, other);
    const auto size = sizeOfSame(source, there);
    if (!size) continue;
    const Descriptor file(open(there.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    if (!file || _calls->flush(file.get()) != 0 || flushFolder() != 0) continue;
    MovedFile finished;
    finished.path = source;
    finished.size = *size;
    finished.base = platform::deletingPathExtension(other);
    return removeFirst(finished, there);
  }
  return {};
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
  if (::rename(from.c_str(), to.c_str()) == 0) return 0;
  error = errno;
  unlink(to.c_str());
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
  flushFoldersAbove();
  const Descriptor folder(open(_folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const int error = folder ? _calls->flush(folder.get()) : errno;
  return cannotFlushFolder(error) ? 0 : error;
}

// The folder may be as new as what is in it. Once, and as far as that can be.
void FileMover::flushFoldersAbove() {
  if (std::exchange(_flushedAbove, true)) return;
  for (std::string above = _folder + "/.."; Descriptor folder{open(above.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)};
       above += "/..") {
    fsync(folder.get());
    if (isSame(above, above + "/..")) return;
  }
}

std::string FileMover::pathOf(const Name& name) const { return platform::appendingPathComponent(_folder, name.file()); }

std::vector<std::string> removeDeadCopies(const std::string& folder) {
  std::vector<std::string> removed;
  for (const std::string& name : platform::FileManager::contents(folder)) {
    if (name.size() != kCopyPrefix.size() + kCopySuffix.size() || !name.starts_with(kCopyPrefix)) continue;
    std::string path = platform::appendingPathComponent(folder, name);
    const Descriptor file(open(path.c_str(), O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat status {};
    const bool ours = file && fstat(file.get(), &status) == 0 && S_ISREG(status.st_mode) && status.st_uid == geteuid();
    if (ours && hold(file) == Hold::kMine && unlink(path.c_str()) == 0) removed.push_back(std::move(path));
  }
  return removed;
}

}  // namespace tether
