#include "ContentData.h"

#include <cstring>
#include <utility>

#include "CameraEvents.h"
#include "DebugTrace.h"
#include "Log.h"
#include "NameTables.h"

namespace {

// Deliveries share the map, the number and the service's count. Not held while calling into the SDK.
platform::Mutex& deliveryLock() {
  static auto* const lock = new platform::Mutex;
  return *lock;
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

std::uint64_t endOf(const tagNkMAIDFileInfo& info) { return std::uint64_t{info.ulStart} + info.ulLength; }

}  // namespace

std::map<std::int32_t, std::string>& gDownloadIdToNameMap = *new std::map<std::int32_t, std::string>;

std::int32_t CContentData::_fileNumber = 1;

CContentData::CContentData(ContentDataOwner* container, std::int32_t dataType, std::int32_t downloadId)
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
  const platform::Guard guard(deliveryLock());
  _file.giveUp();
}

void CContentData::setDownloadId(std::int32_t downloadId) {
  const platform::Guard guard(deliveryLock());  // a delivery may be using it
  _downloadId = downloadId;
}

void CContentData::startDownload(const std::string& name) {
  {
    // A delivery may have come already, or be coming on another thread.
    const platform::Guard guard(deliveryLock());
    if (!_file.isOpen()) _fileName = name;
  }
  // From here on the download thread waits for this object: a delivery carried to it would wait for it, and it for the
  // delivery.
  setDownloadThread(nullptr);
  const std::int32_t result = issueCommand(kNkMAIDCapability_Acquire, this, nullptr);
  logEndWithoutCompletion(hasCapability(kNkMAIDCapability_Acquire) ? result : kNotAnnounced);
}

void CContentData::logEndWithoutCompletion(std::int32_t startResult) {
  const platform::Guard guard(deliveryLock());
  if (_completed || _finished || _abandoned) return;  // what there is to say of these is said
  if (startResult == kNotAnnounced) {
    logFailure("was refused", "it cannot be asked for");
  } else if (startResult != kNkMAIDResult_NoError) {
    logFailure("was refused", errorToName(startResult));
  } else if (const std::int32_t polled = lastPollResult();
             polled != kNkMAIDResult_NoError && polled != kNkMAIDResult_Pending) {
    logFailure("broke off", std::string(polled == kNotOpen ? "its object was closed" : errorToName(polled)));
  } else {
    logFailure("broke off", "nothing came any more of a camera that has gone");
  }
}

void CContentData::logFailure(const char* how, const std::string& reason) const {
  platform::log("Transfer of %s %s: %s", _container->description().c_str(), how, reason.c_str());
}

// Deliveries.

std::int32_t CContentData::dataCallback_thread(void* dataInfo, void* data) {
  if (dataInfo == nullptr) return 0;
  tagNkMAIDFileInfo info{};
  std::memcpy(&info, dataInfo, sizeof info);
  if ((info.dataType & kNkMAIDDataObjType_File) == 0) return 0;
  // No file is that long: the numbers are wrong.
  if (endOf(info) > UINT32_MAX) return 0;

  const platform::Guard guard(deliveryLock());
  if (_finished || _abandoned) return 0;
  noteDelivery();
  if (!_file.isOpen()) beginFile(info);
  if (_abandoned) return 0;
  _file.store(info.ulStart, data, info.ulLength);
  noteDelivery();  // the host, or the disk, may have taken its time
  if (endOf(info) < info.totalLength) return 0;
  _finished = _file.finish();
  _abandoned = !_finished;
  return 0;
}

void CContentData::beginFile(const tagNkMAIDFileInfo& info) {
  // Without a size of its own the object has the one that comes with its bytes.
  if (_dataSize == 0) _dataSize = static_cast<std::int32_t>(info.totalLength);
  if (_fileName.empty()) makeFileName(info.fileDataType);
  std::string& directory = CameraEvents::current().getTemporaryDirectoryPath();
  if (!_file.begin(directory, _fileName, static_cast<std::uint32_t>(_dataSize))) {
    _abandoned = true;
    return;
  }
  debugmsgstr("path for downloaded file: %s", _file.path().c_str());
  _captureId = CameraEvents::current().contentIsReadyToDownload(_fileName, _dataSize, _rawPlusJpeg);
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

// The end.

void CContentData::reportFinishedFile() {
  {
    const platform::Guard guard(deliveryLock());
    if (!_finished || std::exchange(_reported, true)) return;
  }
  CameraEvents::current().fileDownloadComplete(_captureId, _file.path());
}

void CContentData::completionCallback_thread(std::int32_t command, std::int32_t result, void* /*context*/) {
  debugmsgstr("CContentData completionCallback: %s", commandToName(command));
  bool finished = false;
  {
    const platform::Guard guard(deliveryLock());
    finished = _finished;
    _completed = true;
    if (!finished) {
      debugmsgint("CContentData completionCallback,failed to finish data transfer, err=%ld", result);
      if (!_abandoned) {
        logFailure("broke off",
                   result == kNkMAIDResult_NoError ? "it ended before all was there" : errorToName(result));
      }
      _file.giveUp();
      _abandoned = true;
    }
  }
  if (finished) reportFinishedFile();
  closeNikonObject();
  _container->contentFinishedDownloading(this);
}
