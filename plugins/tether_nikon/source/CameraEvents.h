// What the camera side tells upwards. The service implements it and puts itself here; modules, cameras and pictures
// know nothing else of it.
#pragma once

#include <cstdint>
#include <string>

class CContentContainer;

class CameraEvents {
 public:
  // The one there is. Set before the first module is opened; stays for the rest of the process. Any thread.
  static CameraEvents& current() { return *_current; }

  // The next idle pass rescans the modules. Any thread.
  virtual void doCameraScanOnIdle() = 0;
  // Takes the item over and queues it for the download thread, without waiting. Any thread.
  virtual void addItemToDownloadQueue(CContentContainer* item) = 0;

  // From the one delivery of the process that is being handled, whatever its thread:
  // announces a file and returns its capture id;
  virtual std::int32_t contentIsReadyToDownload(const std::string& fileName, std::int32_t fileSize,
                                                bool hasSidecar) = 0;
  // announces that the file is complete.
  virtual void fileDownloadComplete(std::int32_t captureId, const std::string& path) = 0;
  // Where captured files are written. Any thread.
  virtual std::string& getTemporaryDirectoryPath() const = 0;

  CameraEvents(const CameraEvents&) = delete;
  CameraEvents& operator=(const CameraEvents&) = delete;

 protected:
  CameraEvents() { _current = this; }
  virtual ~CameraEvents() = default;

 private:
  inline static CameraEvents* _current = nullptr;
};
