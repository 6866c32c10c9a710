// One camera: a device object opened as a child of its module.
#pragma once

#include <string>

#include "NikonObject.h"

class CContentContainer;

class CCamera : public CNikonObject {
 public:
  // Opens the device, enters it into the module and reads its name. Throws the SDK's result when that fails.
  CCamera(CNikonObject* module, std::int32_t cameraId);
  ~CCamera() override { closeGate(); }

  void completionCallback(std::int32_t command, std::int32_t result, void* context) override;
  // A new item is queued for the download thread, whether the camera is connected or not.
  void eventNotification(std::int32_t event, void* data) override;

  std::string getName() const { return _name; }
  std::int32_t getId() const { return _id; }

  // The rescan's mark.
  void touch() { _touched = true; }
  void resetTouch() { _touched = false; }
  bool isTouched() const { return _touched; }

  // Whether the camera says that it is there; a failed question counts as no.
  bool isAlive();
  // Prepares the camera for saving to the computer. Always 0.
  std::int32_t connect();
  // Changes nothing on the camera. Always 0.
  std::int32_t disconnect() { return 0; }
  // Fires the shutter, where there is one to fire, and drives the SDK on this thread until that is completed.
  void doCapture();
  // Makes a new table of the settings, owned by the caller, with nil for each that cannot be read. Always 0; what is
  // thrown leaves no table.
  std::int32_t makeCameraSettingsMessage(KtLuaTETable*& table);

 private:
  void setCamera(std::int32_t cameraId);
  void handleNewContainer(std::int32_t itemId);
  void logShutter(std::int32_t result) const;
  std::int32_t nextDownloadId();
  // Gives the item, opened with that id, its final one and counts it.
  void number(CContentContainer& container, std::int32_t given);

  std::string _name;
  std::int32_t _id = 0;
  bool _touched = false;
  platform::Mutex _numberLock;                               // a module may announce items on threads of its own
  bool _rawPlusJpegPending GUARDED_BY(_numberLock) = false;  // the first file of a pair has come, its partner not yet
  std::int32_t _downloadId GUARDED_BY(_numberLock) = 1;      // the next item's
};
