// Carries out what the host asks of the cameras, drives the SDK from its idle pass, and joins the camera side to the
// download thread.
//
// One object, on the main thread; what other threads may call says so. Requests come with the id that an answer must
// carry, and with their payload, which may be null or of any kind and stays the caller's.
#pragma once

#include <atomic>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "CameraEvents.h"
#include "KtLuaTableMarshalling.h"
#include "NikonDownloadThread.h"
#include "NikonModule.h"
#include "Thread.h"

class NikonTetherService : public CameraEvents {
 public:
  // The one service, made with the first call: loads the modules and starts the download thread. The caller of the
  // first call owns it. Throws std::system_error when the thread cannot be started. Any thread afterwards, also after
  // the end of a service that had to leave its modules behind.
  static NikonTetherService* getSingleton();
  // Closes every SDK object, once a transfer in progress has ended, for which it waits 30 seconds; after that it leaves
  // the modules to the end of the process, with no callback of theirs getting through any more. Items still queued are
  // given up. The process ends right after.
  ~NikonTetherService() override;
  // The memory of a service that left its modules behind is not used again: a callback that was in progress may still
  // use it.
  static void* operator new(std::size_t size);
  static void operator delete(void* memory);

  void doInitialCameraScan();
  void idle();

  void listDevices(int messageId, KtLuaTE* data);
  void connectDevice(int messageId, KtLuaTE* data);
  void disconnectDevice(int messageId, KtLuaTE* data);
  void getCameraSettings(int messageId, KtLuaTE* data);
  void doCapture(int messageId, KtLuaTE* data);

  void doCameraScanOnIdle() override;
  void addItemToDownloadQueue(CContentContainer* item) override;
  std::int32_t contentIsReadyToDownload(const std::string& fileName, std::int32_t fileSize, bool hasSidecar) override;
  void fileDownloadComplete(std::int32_t captureId, const std::string& path) override;
  std::string& getTemporaryDirectoryPath() const override;

 private:
  NikonTetherService();
  void loadModules();
  CNikonModule* getModuleById(std::int32_t moduleId) const;
  static std::int32_t deviceIdFromTable(KtLuaTE* data);
  void deleteRemovedCameras(CNikonModule& module);
  bool remove(CCamera* camera);

  static NikonTetherService* _singleton;
  static NikonDownloadThread* _downloadThreadObj;  // lives for the rest of the process
  static bool _modulesLeftBehind;

  std::vector<std::unique_ptr<CNikonModule>> _modules;
  CNikonModule* _connectedModule = nullptr;  // the last one that a connect request named
  std::int32_t _captureId = 0;               // the last one handed out
  bool _scanOnIdle = false;                  // the main thread's
  std::atomic<bool> _scanRequested{false};   // by another thread, for the next pass
  std::shared_ptr<platform::Thread> _thread;
  const std::thread::id _mainThread = std::this_thread::get_id();
};
