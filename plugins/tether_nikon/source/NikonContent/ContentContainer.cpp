#include "ContentContainer.h"

#include <memory>

#include "DebugTrace.h"
#include "Exception.h"
#include "Log.h"
#include "NameTables.h"

CContentContainer::CContentContainer(CNikonObject* camera, std::int32_t itemId, std::int32_t downloadId)
    : ContentDataOwner(camera, static_cast<std::uint32_t>(itemId), "CContentContainer") {
  init(downloadId);
  camera->addChild(itemId, this);
  openGate();
}

CContentContainer::~CContentContainer() {
  closeGate();
  if (inUse()) {
    platform::failAssertion("!_inUse", "~CContentContainer", "plugins/tether_nikon/source/NikonContent", 63);
  }
  const platform::Guard guard(holderLock());
  if (_holder != nullptr) _holder->forgetItem();
}

platform::Mutex& CContentContainer::holderLock() {
  static auto* const lock = new platform::Mutex;
  return *lock;
}

void CContentContainer::init(std::int32_t downloadId) {
  setInUse(false);
  _downloadId = downloadId;
  getIntCapability(kNkMAIDCapability_DataTypes, _dataTypes);
  debugDumpCapabilities();
  debugmsgstr("created container for item %s", _name.c_str());
  openDataType(kNkMAIDDataObjType_Image);
}

std::int32_t CContentContainer::openDataType(std::int32_t dataType) {
  if ((_dataTypes & dataType) == 0) return kNotOpen;
  std::unique_ptr<CContentData> data;
  try {
    data = std::make_unique<CContentData>(this, dataType, _downloadId);
  } catch (std::int32_t result) {
    debugmsgint("CContentContainer::openDataType - could not open data type: %d", dataType);
    return result;
  }
  data->setDownloadThread(downloadThread());
  if (dataType != kNkMAIDDataObjType_Image) return kNotOpen;
  _dataObject = data.release();
  return kNkMAIDResult_NoError;
}

std::int32_t CContentContainer::beginDownload() {
  const std::int32_t result = _dataObject == nullptr ? openDataType(kNkMAIDDataObjType_Image) : 0;
  if (_dataObject == nullptr) {
    platform::log("No image data of %s: %s", description().c_str(),
                  result == kNotOpen ? "it has none" : errorToName(result));
    return kNotOpen;
  }
  _dataObject->startDownload(_name);
  return kNkMAIDResult_NoError;
}

void CContentContainer::contentFinishedDownloading(CContentData* /*data*/) { closeNikonObject(); }

bool CContentContainer::isRawPlusJPEG() const { return _dataObject != nullptr && _dataObject->isRawPlusJPEG(); }

std::string CContentContainer::description() const {
  return "item " + std::to_string(id()) + " of camera " + std::to_string(parent()->id()) + " (" + _cameraName + ")";
}

void CContentContainer::setDownloadId(std::int32_t downloadId) {
  _downloadId = downloadId;
  if (_dataObject != nullptr) _dataObject->setDownloadId(downloadId);
}

void CContentContainer::completionCallback_thread(std::int32_t /*command*/, std::int32_t /*result*/,
                                                  void* /*context*/) {}
