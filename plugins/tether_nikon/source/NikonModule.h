// One loaded SDK module: the root of its object tree, and the registry of the cameras that it reports. Main thread,
// but for its events.
#pragma once

#include <list>
#include <map>
#include <memory>
#include <string>

#include "NikonCamera.h"
#include "NikonObject.h"

class CNikonModule : public CNikonObject {
 public:
  // Opens the module. Throws the SDK's result when that fails. The id is a multiple of 256.
  CNikonModule(NkMAIDEntryPoint* entryPoint, const std::string& name, std::int32_t moduleId);
  // A settings update that was put off is cancelled.
  ~CNikonModule() override;

  // At the end, in place of the destruction, where a transfer keeps the SDK: no callback of the module or of anything
  // below it gets through any more.
  void leaveBehind();

  // A camera that came or went sets the service's scan flag. Any thread.
  void eventNotification(std::int32_t event, void* data) override;

  std::int32_t getModuleId() const { return _moduleId; }
  // Removed cameras that wait to be deleted, in order of removal; whoever deletes one takes it off the list.
  std::list<CCamera*>& getCamerasToDelete() { return _camerasToDelete; }
  // 0 for none.
  std::int32_t getConnectedCameraId() const { return _connectedCamera == nullptr ? 0 : _connectedCamera->getId(); }
  CCamera* cameraById(std::int32_t cameraId) const;

  // Announces every listed camera that is not known yet.
  void doInitialCameraScan();
  // Announces what came, in listed order, and then what went, in order of id.
  void scanAndInformHostOfCameraChanges();

  // Answers the request of that id.
  void connectCamera(std::int32_t messageId, std::int32_t cameraId);
  void disconnectCamera();
  void getCameraSettings(std::int32_t messageId, std::int32_t cameraId);
  void doCapture();
  // Sends the connected camera's settings, or puts that off when the last ones are not half a second old.
  void updateHostOnCameraSettings();

  // The payload of "deviceAdded".
  std::unique_ptr<KtLuaTETable> cameraInfo(const CCamera* camera) const;

 private:
  CCamera* addCamera(std::int32_t cameraId);
  void markListedCameras();
  void removeCamera(CCamera* camera);
  std::unique_ptr<KtLuaTETable> deviceTable(const CCamera* camera) const;

  std::map<std::int32_t, CCamera*> _cameras;  // the objects are children of this one
  CCamera* _connectedCamera = nullptr;        // null, or one of _cameras
  std::int32_t _moduleId;
  double _lastSettingsUpdate = 0;  // in seconds of currentTime
  std::list<CCamera*> _camerasToDelete;
};

// Runs DoUpdateHost for the module after the delay, in seconds, in place of a call that is still pending.
void DelayUpdateHost(CNikonModule* module, double delay);
void DoUpdateHost(void* module);
