#include "NikonTetherService.h"

#include <chrono>
#include <limits>
#include <mutex>

#include "ContentContainer.h"
#include "DebugTrace.h"
#include "FileManager.h"
#include "HostMessages.h"
#include "MessageNames.h"
#include "ModuleLoading.h"

namespace {

using namespace std::chrono_literals;

const char* const kModuleNames[] = {
    "Type0001Module", "Type0002Module", "Type0003Module", "Type0004Module", "Type0005Module", "Type0006Module",
    "Type0007Module", "Type0008Module", "Type0009Module", "Type0010Module", "Type0011Module", "Type0012Module",
    "Type0013Module", "Type0014Module", "Type0015Module", "Type0016Module", "Type0017Module", nullptr};

// A device id: the module's id in the upper byte, the camera's in the lower.
constexpr std::int32_t kModuleIdStep = 0x100;
constexpr std::int32_t kModuleIdMask = 0xFF00;
constexpr std::int32_t kCameraIdMask = 0x00FF;

constexpr int kSettingsError = 0xFFFF;
constexpr auto kSettingsLockWait = 100ms;
constexpr auto kEndLockWait = 30s;
constexpr auto kRemovalWait = 2s;

std::string gTemporaryDirectoryPath;

}  // namespace

NikonTetherService* NikonTetherService::_singleton = nullptr;
NikonDownloadThread* NikonTetherService::_downloadThreadObj = nullptr;
bool NikonTetherService::_modulesLeftBehind = false;

NikonTetherService* NikonTetherService::getSingleton() {
  if (_singleton == nullptr) new NikonTetherService;
  return _singleton;
}

NikonTetherService::NikonTetherService() {
  _singleton = this;  // already now: a module may report an event while it is opened
  loadModules();
  gTemporaryDirectoryPath = platform::temporaryDirectory();
  _downloadThreadObj = new NikonDownloadThread;
  _thread = platform::Thread::make([] { _downloadThreadObj->threadMain(); });
  _thread->start();
}

void NikonTetherService::loadModules() {
  std::int32_t moduleId = 0;
  for (const char* const* name = kModuleNames; *name != nullptr; ++name) {
    moduleId += kModuleIdStep;
    std::string path;
    if (FindNikonModulePath(*name, path) != 0) {
      debugmsgstr("Nikon library %s could not be found", *name);
      continue;
    }
    NkMAIDEntryPoint* const entryPoint = LoadNikonModule(path);
    if (entryPoint == nullptr) {
      debugmsgstr("Nikon library %s could not be loaded", *name);
      continue;
    }
    try {
      _modules.push_back(std::make_unique<CNikonModule>(entryPoint, *name, moduleId));
    } catch (std::int32_t) {
      debugmsgstr("Nikon library %s could not be opened", *name);
    }
  }
}

NikonTetherService::~NikonTetherService() {
  const std::unique_lock access(getAsyncLock(), kEndLockWait);
  for (auto& module : _modules) {
    if (access) {
      module.reset();
    } else {
      _modulesLeftBehind = true;
      _thread->cancel();  // what is queued is not begun any more
      module.release()->leaveBehind();
    }
  }
}

// Not inlined: the compiler would take the pair for a mismatched one.
[[gnu::noinline]] void* NikonTetherService::operator new(std::size_t size) { return ::operator new(size); }

[[gnu::noinline]] void NikonTetherService::operator delete(void* memory) {
  if (!_modulesLeftBehind) ::operator delete(memory);
}

CNikonModule* NikonTetherService::getModuleById(std::int32_t moduleId) const {
  for (const auto& module : _modules) {
    if (module->getModuleId() == moduleId) return module.get();
  }
  return nullptr;
}

std::int32_t NikonTetherService::deviceIdFromTable(KtLuaTE* data) {
  const auto* const table = dynamic_cast<KtLuaTETable*>(data);
  KtLuaTE* const value = table == nullptr ? nullptr : table->elementForKey(std::string(kKeyDeviceId));
  const double number = value == nullptr ? 0.0 : static_cast<double>(*value);
  // A number that does not fit, or is none, is no device's.
  const bool fits = number > std::numeric_limits<std::int32_t>::min() - 1.0 &&
                    number < std::numeric_limits<std::int32_t>::max() + 1.0;
  return fits ? static_cast<std::int32_t>(number) : 0;
}

// Requests.

void NikonTetherService::doInitialCameraScan() {
  for (const auto& module : _modules) module->doInitialCameraScan();
}

void NikonTetherService::listDevices(int /*messageId*/, KtLuaTE* /*data*/) {
  debugmsg("listDevices");
  doInitialCameraScan();
}

void NikonTetherService::connectDevice(int messageId, KtLuaTE* data) {
  debugmsg("connectDevice");
  const std::int32_t deviceId = deviceIdFromTable(data);
  const std::int32_t moduleId = deviceId & kModuleIdMask;
  const std::int32_t cameraId = deviceId & kCameraIdMask;
  CNikonModule* const module = getModuleById(moduleId);
  if (module == nullptr) {
    debugmsgint("could not find module id %ld", moduleId);
    return;
  }
  if (_connectedModule != nullptr) {
    if (_connectedModule->getModuleId() == moduleId && _connectedModule->getConnectedCameraId() == cameraId) {
      debugmsgint("camera was already connected - id: %d", deviceId);
      return;
    }
    _connectedModule->disconnectCamera();
  }
  module->connectCamera(messageId, cameraId);
  _connectedModule = module;
}

void NikonTetherService::disconnectDevice(int /*messageId*/, KtLuaTE* data) {
  debugmsg("disconnectDevice");
  const std::int32_t deviceId = deviceIdFromTable(data);
  const std::int32_t moduleId = deviceId & kModuleIdMask;
  if (getModuleById(moduleId) == nullptr) {
    debugmsgint("could not find module id %ld", moduleId);
    return;
  }
  if (_connectedModule == nullptr) return;
  const std::int32_t connectedId = _connectedModule->getConnectedCameraId();
  if (connectedId == 0) {
    debugmsg("disconnectDevice message received, but no camera is currently connected (this is probably OK)");
    return;
  }
  if (_connectedModule->getModuleId() != moduleId || connectedId != (deviceId & kCameraIdMask)) {
    debugmsgint(
        "disconnectDevice message received, but the id (%d) did not match that of the currently connected camera",
        deviceId);
    debugmsgint("connected camera id is: %d", connectedId);
  }
  _connectedModule->disconnectCamera();
}

void NikonTetherService::getCameraSettings(int messageId, KtLuaTE* data) {
  const std::int32_t deviceId = deviceIdFromTable(data);
  const std::int32_t moduleId = deviceId & kModuleIdMask;
  CNikonModule* const module = getModuleById(moduleId);
  if (module == nullptr) {
    debugmsgint("could not find module id %ld", moduleId);
    return;
  }
  if (module != _connectedModule) {
    SendErrorMessage(messageId, kSettingsError, "Module specified was not connected");
    return;
  }
  const std::unique_lock access(getAsyncLock(), kSettingsLockWait);
  if (access) module->getCameraSettings(messageId, deviceId & kCameraIdMask);
}

void NikonTetherService::doCapture(int /*messageId*/, KtLuaTE* /*data*/) {
  if (_connectedModule != nullptr) _connectedModule->doCapture();
}

// The idle pass.

// A request of another thread comes at any place of a pass; a whole pass of its own is what makes sure of it.
void NikonTetherService::doCameraScanOnIdle() {
  if (std::this_thread::get_id() == _mainThread) {
    _scanOnIdle = true;
  } else {
    _scanRequested = true;
  }
}

void NikonTetherService::idle() {
  if (_scanRequested.exchange(false)) _scanOnIdle = true;
  for (const auto& module : _modules) {
    module->async();
    if (_scanOnIdle) module->scanAndInformHostOfCameraChanges();
  }
  for (const auto& module : _modules) deleteRemovedCameras(*module);
  _scanOnIdle = false;
}

void NikonTetherService::deleteRemovedCameras(CNikonModule& module) {
  // One with pictures in transfer or queued is deleted in a later pass: they come first, and this thread, which may be
  // the one that brings their deliveries, does not stand still meanwhile.
  module.getCamerasToDelete().remove_if([this](CCamera* camera) { return !camera->hasChildren() && remove(camera); });
}

// Between two polls, where the download thread waits for another camera's transfer. False when it did not get to it.
bool NikonTetherService::remove(CCamera* camera) {
  const auto wrapper = CameraWrapper::wrapperForCamera(camera);
  if (_thread->runLoop()->performUrgently([&] { _downloadThreadObj->removeAllCameraContent(*wrapper); },
                                          kRemovalWait)) {
    return true;
  }
  wrapper->setCamera(nullptr);  // still the module's
  return false;
}

// Pictures.

void NikonTetherService::addItemToDownloadQueue(CContentContainer* item) {
  item->setDownloadThread(_downloadThreadObj);
  _downloadThreadObj->homeThread()->runLoop()->post([wrapper = ContentContainerWrapper::wrapperForContentContainer(
                                                         item)] { _downloadThreadObj->addToDownloadQueue(wrapper); });
}

std::int32_t NikonTetherService::contentIsReadyToDownload(const std::string& fileName, std::int32_t fileSize,
                                                          bool hasSidecar) {
  ++_captureId;
  KtLuaTETable table;
  table.Set(kKeyCaptureId, new KtLuaTENumber(_captureId));
  table.Set(kKeyHasSidecar, new KtLuaTENumber(hasSidecar ? 1 : 0));
  table.Set(kKeyFileName, new KtLuaTEString(fileName));
  table.Set(kKeyFileSize, new KtLuaTENumber(fileSize));
  debugmsgint("sending objectWasAdded message with capture ID: %d", _captureId);
  SendMessageToClient(0, kMessageObjectWasAdded, &table);
  return _captureId;
}

void NikonTetherService::fileDownloadComplete(std::int32_t captureId, const std::string& path) {
  KtLuaTETable table;
  table.Set(kKeyCaptureId, new KtLuaTENumber(captureId));
  table.Set(kKeyFilePath, new KtLuaTEString(path));
  SendMessageToClient(0, kMessageFileDownloadComplete, &table);
}

std::string& NikonTetherService::getTemporaryDirectoryPath() const { return gTemporaryDirectoryPath; }
