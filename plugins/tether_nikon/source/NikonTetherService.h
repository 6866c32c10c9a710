// Carries out what the host asks of the cameras, drives the SDK from its idle pass, and joins the camera side to the
// download thread.
//
// One object, on the main thread; what other threads may call says so. Requests come with the id that an answer must
// carry, and with their payload, which may be null or of any kind and stays the caller's.
#pragma once

#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include "KtLuaTableMarshalling.h"
#include "NikonDownloadThread.h"
#include "NikonModule.h"
#include "Thread.h"

class NikonTetherService {
 public:
  // The one service, made with the first call: loads the modules and starts the download thread. The caller of the
  // first call owns it. Throws std::system_error when the thread cannot be started. Any thread afterwards.
  static NikonTetherService* getSingleton();
  NikonTetherService(const NikonTetherService&) = delete;
  NikonTetherService& operator=(const NikonTetherService&) = delete;
  // Closes every SDK object, once a transfer in progress has ended, for which it waits 30 seconds; after that it leaves
  // the modules to the end of the process. Items still queued are given up. The process ends right after.
  ~NikonTetherService();

  void doInitialCameraScan();
  void idle();

  void listDevices(int messageId, KtLuaTE* data);
  void connectDevice(int messageId, KtLuaTE* data);
  void disconnectDevice(int messageId, KtLuaTE* data);
  void getCameraSettings(int messageId, KtLuaTE* data);
  void doCapture(int messageId, KtLuaTE* data);

  // The next idle pass rescans the modules. Any thread.
  void doCameraScanOnIdle();
  // Takes the item over and queues it for the download thread, without waiting. Any thread.
  void addItemToDownloadQueue(CContentContainer* item);

  // From the one delivery of the process that is being handled, whatever its thread:
  // announces a file and returns its capture id;
  std::int32_t contentIsReadyToDownload(const std::string& fileName, std::int32_t fileSize, bool hasSidecar);
  // announces that the file is complete.
  void fileDownloadComplete(std::int32_t captureId, const std::string& path);
  // Where captured files are written. Any thread.
  const std::string& getTemporaryDirectoryPath() const;

 private:
  NikonTetherService();
  void loadModules();
  CNikonModule* getModuleById(std::int32_t moduleId) const;
  static std::int32_t deviceIdFromTable(KtLuaTE* data);
  void deleteRemovedCameras(CNikonModule& module);

  static NikonTetherService* _singleton;
  static NikonDownloadThread* _downloadThreadObj;  // lives for the rest of the process
  static std::int32_t _captureId;                  // the last one handed out in the life of the process

  std::vector<std::unique_ptr<CNikonModule>> _modules;
  CNikonModule* _connectedModule = nullptr;  // the last one that a connect request named
  std::atomic<bool> _scanOnIdle{false};
  std::atomic<bool> _scanOnNextIdle{false};  // asked for by another thread, perhaps behind this pass's test
  std::shared_ptr<platform::Thread> _thread;
  const std::shared_ptr<platform::Thread> _mainThread = platform::Thread::current();
};
