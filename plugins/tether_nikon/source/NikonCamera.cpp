#include "NikonCamera.h"

#include <memory>

#include "CameraEvents.h"
#include "ContentContainer.h"
#include "DebugTrace.h"
#include "Log.h"
#include "MessageNames.h"
#include "NameTables.h"

namespace {

struct Setting {
  const char* key;
  std::int32_t capability;
};

constexpr Setting kSettings[] = {
    {kKeyIsoSpeed, kNkMAIDCapability_Sensitivity},     {kKeyBatteryLevel, kNkMAIDCapability_BatteryLevel},
    {kKeyAvailableShots, kNkMAIDCapability_FreeBytes}, {kKeyAeMode, kNkMAIDCapability_ExposureMode},
    {kKeyAperture, kNkMAIDCapability_Aperture},        {kKeyShutter, kNkMAIDCapability_ShutterSpeed},
    {kKeyWhiteBalance, kNkMAIDCapability_WBMode},
};

// Values of SaveMedia.
constexpr std::uint32_t kSaveToCard = 0;
constexpr std::uint32_t kSaveToComputer = 1;

}  // namespace

CCamera::CCamera(CNikonObject* module, std::int32_t cameraId)
    : CNikonObject(module, static_cast<std::uint32_t>(cameraId), "CCamera") {
  module->addChild(cameraId, this);
  setCamera(cameraId);
  openGate();
}

void CCamera::setCamera(std::int32_t cameraId) {
  _id = cameraId;
  const std::int32_t result = getStringCapability(kNkMAIDCapability_Name, _name);
  if (result != kNkMAIDResult_NoError) throw result;
}

bool CCamera::isAlive() {
  bool alive = false;
  if (getBoolCapability(kNkMAIDCapability_IsAlive, alive) != kNkMAIDResult_NoError) alive = false;
  debugmsg(alive ? "isAlive(): TRUE" : "isAlive(): FALSE");
  return alive;
}

std::int32_t CCamera::connect() {
  debugDumpCapabilities();
  std::uint32_t saveMedia = kSaveToCard;
  const std::int32_t result = getCapability(kNkMAIDCapability_SaveMedia, kNkMAIDDataType_UnsignedPtr,
                                            reinterpret_cast<std::uintptr_t>(&saveMedia));
  if (result == kNkMAIDResult_NoError && saveMedia == kSaveToCard) {
    setCapability(kNkMAIDCapability_SaveMedia, kNkMAIDDataType_Unsigned, kSaveToComputer);
  }
  return 0;
}

void CCamera::doCapture() { logShutter(issueCommand(kNkMAIDCapability_Capture, this, nullptr)); }

void CCamera::completionCallback(std::int32_t command, std::int32_t result, void* /*context*/) {
  debugmsgstr("CCamera completion callback for command %s", commandToName(command));
  logShutter(result);
}

// The host is told nothing of a shutter that failed: the log is all there is.
void CCamera::logShutter(std::int32_t result) const {
  if (result == kNkMAIDResult_NoError) return;
  platform::log("The shutter of camera %d (%s) failed: %s", _id, _name.c_str(), errorToName(result));
}

void CCamera::eventNotification(std::int32_t event, void* data) {
  debugmsgstr("Camera event notification: %s", eventToName(event));
  if (event == kNkMAIDEvent_AddChild) {
    handleNewContainer(static_cast<std::int32_t>(reinterpret_cast<std::uintptr_t>(data)));
  }
}

void CCamera::handleNewContainer(std::int32_t itemId) {
  std::unique_ptr<CContentContainer> container;
  const std::int32_t downloadId = nextDownloadId();
  try {
    container = std::make_unique<CContentContainer>(this, itemId, downloadId);
  } catch (std::int32_t result) {
    debugmsgint("CCamera::handleNewContainer - could not open item, error: %d", result);
    platform::log("Item %d of camera %d (%s) could not be opened: %s", itemId, _id, _name.c_str(), errorToName(result));
    return;
  }
  container->setCameraName(_name);
  number(*container, downloadId);
  CameraEvents::current().addItemToDownloadQueue(container.release());
}

std::int32_t CCamera::nextDownloadId() {
  const platform::Guard guard(_numberLock);
  return _downloadId;
}

void CCamera::number(CContentContainer& container, std::int32_t given) {
  const platform::Guard guard(_numberLock);
  if (_rawPlusJpegPending && !container.isRawPlusJPEG()) {
    // The pair's second file never came: that shot is done, this is another one.
    _rawPlusJpegPending = false;
    ++_downloadId;
  }
  // An item of another thread may have taken the id meanwhile, too.
  if (_downloadId != given) container.setDownloadId(_downloadId);
  if (_rawPlusJpegPending) {
    ++_downloadId;
    _rawPlusJpegPending = false;
  } else if (container.isRawPlusJPEG()) {
    _rawPlusJpegPending = true;
  } else {
    ++_downloadId;
  }
}

std::int32_t CCamera::makeCameraSettingsMessage(KtLuaTETable*& table) {
  auto made = std::make_unique<KtLuaTETable>();
  for (const Setting& setting : kSettings) {
    std::unique_ptr<KtLuaTE> value = getCapabilityAsTE(setting.capability);
    if (!value) value = std::make_unique<KtLuaTENil>();
    made->Set(setting.key, value.release());
  }
  table = made.release();
  return 0;
}
