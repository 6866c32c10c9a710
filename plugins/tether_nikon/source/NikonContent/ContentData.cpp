#include "ContentData.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <mutex>
#include <utility>

#include "ContentContainer.h"
#include "DebugTrace.h"
#include "FileManager.h"
#include "Locks.h"
#include "Log.h"
#include "NameTables.h"
#include "NikonTetherService.h"
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

// Deliveries share the map, the number and the service's count. Not held while calling into the SDK.
std::mutex& deliveryLock() {
  static auto* const lock = new std::mutex;
  return *lock;
}

// A picture's buffer, for the next one: new memory costs more than filling it. Under the lock of the deliveries.
struct KeptBuffer {
  platform::MemoryBlock block;
  std::chrono::steady_clock::time_point since;

  void keep(platform::MemoryBlock used) {
    if (used.size() > block.size()) block = std::move(used);
    since = std::chrono::steady_clock::now();
  }
};

KeptBuffer& keptBuffer() {
  static auto* const buffer = new KeptBuffer;
  return *buffer;
}

// The file that is being received. The process may end at any moment, and what is not whole then must not stay.
struct UnfinishedFile {
  platform::TimedLock lock;
  std::string path;
  bool processEnds = false;
  const platform::Observer observer = platform::NotificationCenter::defaultCenter().addObserver(
      std::string(platform::kApplicationWillTerminateNotification), nullptr, [this](const auto&) {
        const std::unique_lock guard(lock, kFileLockWait);
        if (!guard) return;  // a file system that hangs must not keep the process
        processEnds = true;
        if (!path.empty()) platform::FileManager::remove(path);
      });
};

UnfinishedFile& unfinishedFile() {
  static auto* const file = new UnfinishedFile;
  return *file;
}

const char* extensionOf(std::uint32_t fileDataType) {
  switch (fileDataType) {
    case kNkMAIDFileDataType_JPEG:
      return ".jpg";
    case kNkMAIDFileDataType_TIFF:
      return ".tif";
    case kNkMAIDFileDataType_NEF:
      return ".nef";
    case kNkMAIDFileDataType_NDF:
      return ".ndf";
    default:
      return ".dat";
  }
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

std::uint64_t endOf(const tagNkMAIDFileInfo& info) { return std::uint64_t{info.ulStart} + info.ulLength; }

}  // namespace

std::map<std::int32_t, std::string>& gDownloadIdToNameMap = *new std::map<std::int32_t, std::string>;

std::int32_t CContentData::_fileNumber = 1;

CContentData::CContentData(CContentContainer* container, std::int32_t dataType, std::int32_t downloadId)
    : CNikonThreadedObject(container, static_cast<std::uint32_t>(dataType), "CContentData"),
      _container(container),
      _downloadId(downloadId) {
  container->addChild(dataType, this);
  debugDumpCapabilities();
  std::int32_t result = getIntCapability(kNkMAIDCapability_StoredBytes, _dataSize);
  if (result != kNkMAIDResult_NoError) {
    debugmsgint("Error getting kNkMAIDCapability_StoredBytes on data object: %d", result);
  }
  std::int32_t status = 0;
  result = getIntCapability(kNkMAIDCapability_RawJpegImageStatus, status);
  if (result != kNkMAIDResult_NoError) {
    debugmsgint("Error getting kNkMAIDCapability_RawJpegImageStatus on data object: %d", result);
  }
  _rawPlusJpeg = status != 0;
  std::string name;
  getStringCapability(kNkMAIDCapability_Name, name);
  debugmsgstr("created data for item %s", name.c_str());
  openGate();
}

CContentData::~CContentData() {
  closeGate();
  reportFinishedFile();  // the wait may have ended between the last delivery and the completion
  const std::lock_guard guard(deliveryLock());
  giveFileUp();
}

// A transfer that did not come to its end leaves its file as it is, empty.
void CContentData::giveFileUp() {
  if (!_file) return;
  const std::lock_guard guard(unfinishedFile().lock);
  unfinishedFile().path.clear();
  // The room that was kept for it would stay with the empty file.
  if (ftruncate(fileno(_file.get()), 0) != 0) debugmsgstr("cannot shorten %s", _path.c_str());
  _file.reset();
  keptBuffer().keep(std::move(_buffer));
}

void CContentData::startDownload(const std::string& name) {
  {
    // A delivery may have come already, or be coming on another thread.
    const std::lock_guard guard(deliveryLock());
    if (!_file) _fileName = name;
  }
  // From here on the download thread waits for this object: a delivery carried to it would wait for it, and it for the
  // delivery.
  setDownloadThread(nullptr);
  issueCommand(kNkMAIDCapability_Acquire, this, nullptr);
}

// Deliveries.

std::int32_t CContentData::dataCallback_thread(void* dataInfo, void* data) {
  if (dataInfo == nullptr) return 0;
  tagNkMAIDFileInfo info{};
  std::memcpy(&info, dataInfo, sizeof info);
  if ((info.dataType & kNkMAIDDataObjType_File) == 0) return 0;
  // No file is that long: the numbers are wrong.
  if (endOf(info) > UINT32_MAX) return 0;

  const std::lock_guard guard(deliveryLock());
  if (_finished || _abandoned) return 0;
  if (!_file) beginFile(info);
  if (_abandoned) return 0;
  store(info, data);
  if (endOf(info) >= info.totalLength) finishFile();
  return 0;
}

void CContentData::beginFile(const tagNkMAIDFileInfo& info) {
  // Without a size of its own the object has the one that comes with its bytes.
  if (_dataSize == 0) _dataSize = static_cast<std::int32_t>(info.totalLength);
  if (_fileName.empty()) makeFileName(info.fileDataType);
  if (!openFile()) {
    platform::log("Could not create a file for %s: %s", _fileName.c_str(), std::strerror(errno));
    _abandoned = true;
    return;
  }
  if (!takeBuffer()) {
    giveFileUp();
    platform::FileManager::remove(_path);
    _abandoned = true;
    return;
  }
  debugmsgstr("path for downloaded file: %s", _path.c_str());
  _captureId = NikonTetherService::getSingleton()->contentIsReadyToDownload(_fileName, _dataSize, _rawPlusJpeg);
}

void CContentData::makeFileName(std::uint32_t fileDataType) {
  std::string& base = gDownloadIdToNameMap[_downloadId];
  if (base.empty()) {
    char text[32];
    std::snprintf(text, sizeof text, "Capture%04d", _fileNumber);
    ++_fileNumber;
    base = text;
  }
  _fileName = base + extensionOf(fileDataType);
}

bool CContentData::openFile() {
  const std::string& directory = NikonTetherService::getSingleton()->getTemporaryDirectoryPath();
  UnfinishedFile& unfinished = unfinishedFile();
  const std::lock_guard guard(unfinished.lock);
  errno = ECANCELED;
  if (unfinished.processEnds) return false;
  for (int tries = 0; tries < kMostNameTries; ++tries) {
    _path = MakeUniqueFilePath(directory, _fileName);
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

// The buffer and the room on the disk: what is missing had better be known before the host is told of the picture.
bool CContentData::takeBuffer() {
  const std::size_t size = static_cast<std::uint32_t>(_dataSize);
  const int error = size < kLeastReserved ? 0 : platform::FileManager::reserve(fileno(_file.get()), size);
  if (error != 0) {
    platform::log("No room for the %zu bytes of %s: %s", size, _fileName.c_str(), std::strerror(error));
    return false;
  }
  _buffer = std::move(keptBuffer().block);
  if (_buffer.size() < size) {
    _buffer = {};  // before there is another one
    _buffer = platform::MemoryBlock(size);
  }
  if (_buffer.size() >= size) return true;
  platform::log("No memory for the %zu bytes of %s", size, _fileName.c_str());
  return false;
}

void CContentData::store(const tagNkMAIDFileInfo& info, const void* data) {
  if (data == nullptr || info.ulLength == 0 || endOf(info) > static_cast<std::uint32_t>(_dataSize)) return;
  zeroUpTo(info.ulStart);
  std::memcpy(_buffer.data() + info.ulStart, data, info.ulLength);
  _known = std::max(_known, static_cast<std::size_t>(endOf(info)));
}

// What no delivery brought is zero, not what the picture before had there.
void CContentData::zeroUpTo(std::size_t end) {
  if (end <= _known) return;
  std::memset(_buffer.data() + _known, 0, end - _known);
  _known = end;
}

void CContentData::finishFile() {
  const std::size_t size = static_cast<std::uint32_t>(_dataSize);
  zeroUpTo(size);
  const std::size_t written = writeWhole(_buffer.data(), size, _file.get());
  int error = errno;
  const bool closed = std::fclose(_file.release()) == 0;
  if (written == size) error = errno;
  {
    const std::lock_guard guard(unfinishedFile().lock);
    _finished = written == size && closed && !unfinishedFile().processEnds;
    unfinishedFile().path.clear();
  }
  keptBuffer().keep(std::move(_buffer));
  if (_finished) return;
  platform::log("Writing %s failed: %s", _path.c_str(), std::strerror(error));
  platform::FileManager::remove(_path);
  _abandoned = true;
}

void CContentData::giveRestedBufferBack() {
  platform::MemoryBlock rested;  // given back after the lock: it takes a while
  const std::lock_guard guard(deliveryLock());
  if (std::chrono::steady_clock::now() - keptBuffer().since >= kBufferRest) rested = std::move(keptBuffer().block);
}

// The end.

void CContentData::reportFinishedFile() {
  {
    const std::lock_guard guard(deliveryLock());
    if (!_finished || std::exchange(_reported, true)) return;
  }
  NikonTetherService::getSingleton()->fileDownloadComplete(_captureId, _path);
}

void CContentData::completionCallback_thread(std::int32_t command, std::int32_t result, void* /*context*/) {
  debugmsgstr("CContentData completionCallback: %s", commandToName(command));
  bool finished = false;
  {
    const std::lock_guard guard(deliveryLock());
    finished = _finished;
    if (!finished) {
      debugmsgint("CContentData completionCallback,failed to finish data transfer, err=%ld", result);
      giveFileUp();
      _abandoned = true;
    }
  }
  if (finished) reportFinishedFile();
  closeNikonObject();
  if (auto* const container = dynamic_cast<CContentContainer*>(parent())) container->contentFinishedDownloading(this);
}
