#include "PictureFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <utility>

#include "DebugTrace.h"
#include "FileManager.h"
#include "Locks.h"
#include "Log.h"
#include "NotificationCenter.h"
#include "UniqueFilePath.h"

namespace {

using namespace std::chrono_literals;

// How often a name that was taken between the search for it and the creation of the file is searched anew.
constexpr int kMostNameTries = 1000;
constexpr auto kFileLockWait = 200ms;
// Long enough for the pauses in a series, short enough that memory is not held through a break.
constexpr auto kBufferRest = 5s;
// A smaller file is written before its blocks are chosen; to keep room for it costs more than it saves.
constexpr std::size_t kLeastReserved = std::size_t{1} << 20;

// A picture's buffer, for the next one: new memory costs more than filling it.
class KeptBuffer {
 public:
  void keep(platform::MemoryBlock used) {
    const platform::Guard guard(_lock);
    if (used.size() > _block.size()) _block = std::move(used);
    _since = std::chrono::steady_clock::now();
  }
  platform::MemoryBlock take() {
    const platform::Guard guard(_lock);
    return std::move(_block);
  }
  platform::MemoryBlock takeRested() {
    const platform::Guard guard(_lock);
    return std::chrono::steady_clock::now() - _since >= kBufferRest ? std::move(_block) : platform::MemoryBlock();
  }

 private:
  platform::Mutex _lock;
  platform::MemoryBlock _block GUARDED_BY(_lock);
  std::chrono::steady_clock::time_point _since GUARDED_BY(_lock);
};

KeptBuffer& keptBuffer() {
  static auto* const buffer = new KeptBuffer;
  return *buffer;
}

// The file that is being received. The process may end at any moment, and what is not whole then must not stay.
struct UnfinishedFile {
  platform::TimedLock lock;
  std::string path GUARDED_BY(lock);
  bool processEnds GUARDED_BY(lock) = false;
  const platform::Observer observer = platform::NotificationCenter::defaultCenter().addObserver(
      std::string(platform::kApplicationWillTerminateNotification), nullptr, [this](const auto&) { endProcess(); });

  void endProcess() {
    if (!lock.try_lock_for(kFileLockWait)) return;  // a file system that hangs must not keep the process
    const platform::Guard guard(lock, platform::kAdopt);
    processEnds = true;
    if (!path.empty()) platform::FileManager::remove(path);
  }
};

UnfinishedFile& unfinishedFile() {
  static auto* const file = new UnfinishedFile;
  return *file;
}

// Answers how much was written. A signal does not end it; that one can interrupt a write some file systems insist on.
std::size_t writeWhole(const char* bytes, std::size_t size, std::FILE* file) {
  std::size_t written = 0;
  errno = EINTR;
  while (written < size && errno == EINTR) {
    errno = 0;
    std::clearerr(file);
    written += std::fwrite(bytes + written, 1, size - written, file);
  }
  return written;
}

}  // namespace

bool PictureFile::begin(std::string& directory, const std::string& name, std::size_t size) {
  _size = size;
  _known = 0;
  if (!create(directory, name)) {
    platform::log("Could not create a file for %s: %s", name.c_str(), std::strerror(errno));
    return false;
  }
  if (takeRoom(name)) return true;
  giveUp();
  platform::FileManager::remove(_path);
  return false;
}

bool PictureFile::create(std::string& directory, const std::string& name) {
  UnfinishedFile& unfinished = unfinishedFile();
  const platform::Guard guard(unfinished.lock);
  errno = ECANCELED;
  if (unfinished.processEnds) return false;
  for (int tries = 0; tries < kMostNameTries; ++tries) {
    _path = MakeUniqueFilePath(directory, name);
    // A file of its own: no link is followed, nothing is taken over. Only the owner can read it.
    const int descriptor = open(_path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (descriptor < 0 && (errno == EEXIST || errno == EINTR)) continue;
    if (descriptor < 0) return false;
    _file.reset(fdopen(descriptor, "wb"));
    if (!_file) {
      close(descriptor);
      platform::FileManager::remove(_path);
      return false;
    }
    // It is written in one piece; a buffer between would only copy.
    std::setvbuf(_file.get(), nullptr, _IONBF, 0);
    unfinished.path = _path;
    return true;
  }
  return false;
}

// The buffer and the room on the disk: what is missing had better be known before anybody is told of the picture.
bool PictureFile::takeRoom(const std::string& name) {
  const int error = _size < kLeastReserved ? 0 : platform::FileManager::reserve(fileno(_file.get()), _size);
  if (error != 0) {
    platform::log("No room for the %zu bytes of %s: %s", _size, name.c_str(), std::strerror(error));
    return false;
  }
  _buffer = keptBuffer().take();
  if (_buffer.size() < _size) {
    _buffer = {};  // before there is another one
    _buffer = platform::MemoryBlock(_size);
  }
  if (_buffer.size() >= _size) return true;
  platform::log("No memory for the %zu bytes of %s", _size, name.c_str());
  return false;
}

void PictureFile::store(std::uint64_t offset, const void* bytes, std::size_t count) {
  if (bytes == nullptr || count == 0 || count > _size || offset > _size - count) return;
  zeroUpTo(offset);
  std::memcpy(_buffer.data() + offset, bytes, count);
  _known = std::max<std::size_t>(_known, offset + count);
}

// What was never stored is zero, not what the picture before had there.
void PictureFile::zeroUpTo(std::size_t end) {
  if (end <= _known) return;
  std::memset(_buffer.data() + _known, 0, end - _known);
  _known = end;
}

bool PictureFile::finish() {
  zeroUpTo(_size);
  const std::size_t written = writeWhole(_buffer.data(), _size, _file.get());
  int error = errno;
  const bool closed = std::fclose(_file.release()) == 0;
  if (written == _size) error = errno;
  bool finished = false;
  {
    UnfinishedFile& unfinished = unfinishedFile();
    const platform::Guard guard(unfinished.lock);
    finished = written == _size && closed && !unfinished.processEnds;
    unfinished.path.clear();
  }
  keptBuffer().keep(std::move(_buffer));
  if (finished) return true;
  platform::log("Writing %s failed: %s", _path.c_str(), std::strerror(error));
  platform::FileManager::remove(_path);
  return false;
}

void PictureFile::giveUp() {
  if (!_file) return;
  UnfinishedFile& unfinished = unfinishedFile();
  const platform::Guard guard(unfinished.lock);
  unfinished.path.clear();
  // The room that was kept for it would stay with the empty file.
  if (ftruncate(fileno(_file.get()), 0) != 0) debugmsgstr("cannot shorten %s", _path.c_str());
  _file.reset();
  keptBuffer().keep(std::move(_buffer));
}

void PictureFile::giveRestedBufferBack() {
  const platform::MemoryBlock rested = keptBuffer().takeRested();  // given back after the lock: it takes a while
}
