#include "NikonModule.h"

#include <cstdio>
#include <exception>
#include <vector>

#include "CameraEvents.h"
#include "DebugTrace.h"
#include "DeferredCalls.h"
#include "HostMessages.h"
#include "MessageNames.h"
#include "NameTables.h"

namespace {

constexpr double kSettingsInterval = 0.5;  // seconds
constexpr int kNoCameraError = -1;
constexpr int kSettingsError = 0xFFFF;

// The part of a device id that is the camera's.
constexpr std::int32_t kSmallestCameraId = 1;
constexpr std::int32_t kLargestCameraId = 255;

}  // namespace

CNikonModule::CNikonModule(NkMAIDEntryPoint* entryPoint, const std::string& name, std::int32_t moduleId)
    : CNikonObject(entryPoint, name), _moduleId(moduleId) {
  openGate();
}

CNikonModule::~CNikonModule() {
  closeGate();
  CallDelay::cancelCallsToProc(DoUpdateHost, this);
}

void CNikonModule::leaveBehind() {
  shutGates();
  CallDelay::cancelCallsToProc(DoUpdateHost, this);
}

void CNikonModule::eventNotification(std::int32_t event, void* /*data*/) {
  debugmsgstr("Service event notification: %s", eventToName(event));
  if (event == kNkMAIDEvent_AddChild || event == kNkMAIDEvent_RemoveChild) {
    CameraEvents::current().doCameraScanOnIdle();
  }
}

// The registry.

CCamera* CNikonModule::cameraById(std::int32_t cameraId) const {
  const auto found = _cameras.find(cameraId);
  return found == _cameras.end() ? nullptr : found->second;
}

void CNikonModule::doInitialCameraScan() {
  std::vector<std::int32_t> ids;
  listChildren(ids);
  for (const std::int32_t cameraId : ids) addCamera(cameraId);
}

CCamera* CNikonModule::addCamera(std::int32_t cameraId) {
  debugmsgint("addCamera(): id: %d", cameraId);
  if (CCamera* const known = cameraById(cameraId)) return known;
  if (cameraId < kSmallestCameraId || cameraId > kLargestCameraId) {
    debugmsgint("addCamera(): id is outside 1 to 255: %d", cameraId);
    return nullptr;
  }
  CCamera* camera = nullptr;
  try {
    camera = std::make_unique<CCamera>(this, cameraId).release();  // now the tree's
  } catch (std::int32_t result) {
    debugmsgint("Error caught while creating camera: %d", result);
    return nullptr;
  } catch (...) {
    debugmsg("Unknown exception caught while creating camera");
    return nullptr;
  }
  _cameras[cameraId] = camera;
  debugmsgstr("addCamera() - sending message back to host: %s\n", camera->getName().c_str());
  SendMessageToClient(0, kMessageDeviceAdded, cameraInfo(camera).get());
  return camera;
}

std::unique_ptr<KtLuaTETable> CNikonModule::deviceTable(const CCamera* camera) const {
  auto table = std::make_unique<KtLuaTETable>();
  table->Set(kKeyDeviceId, new KtLuaTENumber(_moduleId | camera->getId()));
  return table;
}

std::unique_ptr<KtLuaTETable> CNikonModule::cameraInfo(const CCamera* camera) const {
  auto table = deviceTable(camera);
  table->Set(kKeyName, new KtLuaTEString(camera->getName()));
  return table;
}

void CNikonModule::scanAndInformHostOfCameraChanges() {
  debugmsg("scanAndInformHostOfCameraChanges begin");
  for (const auto& [cameraId, camera] : _cameras) camera->resetTouch();
  markListedCameras();
  for (auto entry = _cameras.begin(); entry != _cameras.end();) {
    CCamera* const camera = entry->second;
    if (camera->isTouched() && camera->isAlive()) {
      ++entry;
    } else {
      removeCamera(camera);
      entry = _cameras.erase(entry);
    }
  }
}

void CNikonModule::markListedCameras() {
  std::vector<std::int32_t> ids;
  listChildren(ids);
  std::vector<std::int32_t> newIds;
  for (const std::int32_t cameraId : ids) {
    if (CCamera* const known = cameraById(cameraId)) {
      known->touch();
    } else {
      newIds.push_back(cameraId);
    }
  }
  for (const std::int32_t cameraId : newIds) {
    if (CCamera* const camera = addCamera(cameraId)) camera->touch();
  }
}

void CNikonModule::removeCamera(CCamera* camera) {
  if (camera == _connectedCamera) _connectedCamera = nullptr;
  char line[512];
  std::snprintf(line, sizeof line, "scanAndInformHostOfCameraChanges() - removed camera: %s - device id: %d",
                camera->getName().c_str(), camera->getId());
  debugmsg(line);
  SendMessageToClient(0, kMessageDeviceRemoved, deviceTable(camera).get());
  camera->abandonWaits();  // a transfer ends first, but one that never does must not keep the download thread
  _camerasToDelete.push_back(camera);
}

// The connected camera.

void CNikonModule::connectCamera(std::int32_t messageId, std::int32_t cameraId) {
  debugmsg("connectDevice");
  CCamera* const camera = cameraById(cameraId);
  if (camera == nullptr) {
    debugmsgint("ERROR: camera id could not be found: %d", cameraId);
    SendErrorMessage(messageId, kNoCameraError, nullptr);
    return;
  }
  const std::int32_t result = camera->connect();
  if (result != 0) {
    debugmsgint("ERROR: camera->connect returned an error: %d", result);
    SendErrorMessage(messageId, kNoCameraError, nullptr);
    return;
  }
  _connectedCamera = camera;
  SendMessageToClient(messageId, kMessageOk, nullptr);
  updateHostOnCameraSettings();
}

void CNikonModule::disconnectCamera() {
  debugmsg("disconnectCamera");
  if (_connectedCamera == nullptr) return;
  _connectedCamera->disconnect();
  _connectedCamera = nullptr;
}

void CNikonModule::doCapture() {
  if (_connectedCamera != nullptr) _connectedCamera->doCapture();
}

void CNikonModule::getCameraSettings(std::int32_t messageId, std::int32_t cameraId) {
  if (_connectedCamera == nullptr) {
    SendErrorMessage(messageId, kSettingsError, "No camera is connected");
    return;
  }
  if (_connectedCamera->getId() != cameraId) {
    SendErrorMessage(messageId, kSettingsError, "Camera specified was not connected");
    return;
  }
  KtLuaTETable* made = nullptr;
  const std::int32_t result = _connectedCamera->makeCameraSettingsMessage(made);
  const std::unique_ptr<KtLuaTETable> table(made);
  if (result == 0) {
    SendMessageToClient(messageId, kMessageOk, table.get());
  } else {
    SendErrorMessage(messageId, result, nullptr);
  }
}

void CNikonModule::updateHostOnCameraSettings() {
  if (_connectedCamera == nullptr) return;
  const double now = currentTime();
  if (now - _lastSettingsUpdate < 0) _lastSettingsUpdate = now;  // the clock was set back
  if (now - _lastSettingsUpdate < kSettingsInterval) {
    DelayUpdateHost(this, kSettingsInterval);
    return;
  }
  KtLuaTETable* made = nullptr;
  const std::int32_t result = _connectedCamera->makeCameraSettingsMessage(made);
  const std::unique_ptr<KtLuaTETable> table(made);
  if (result != 0) return;
  _lastSettingsUpdate = now;
  SendMessageToClient(0, kMessageCameraSettingsChanged, table.get());
}

void DelayUpdateHost(CNikonModule* module, double delay) { CallAfterDelay(DoUpdateHost, module, delay); }

void DoUpdateHost(void* module) { static_cast<CNikonModule*>(module)->updateHostOnCameraSettings(); }
