// The camera side against a module whose answers are any bytes: the registry's road from the scan to a picture, and
// every reader of every value. Nothing crashes or waits for ever, everything opened is closed, and a picture that is
// announced as complete is there in the size that was announced.
#include <sys/resource.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "ContentContainer.h"
#include "ContentData.h"
#include "FaultyModule.h"
#include "FrameWriter.h"
#include "HostMessages.h"
#include "KtNSDataStreamBuf.h"
#include "Log.h"
#include "NikonModule.h"
#include "NikonTetherService.h"

using testkit::check;
using testkit::Deed;
using testkit::Input;
namespace fs = std::filesystem;

namespace {

constexpr std::int32_t kModuleId = 0x100;
constexpr std::size_t kMostCameras = 3;
constexpr std::size_t kMostItems = 2;
// A module may announce 4 GiB. So much is not written; more of it is a disk that is full.
constexpr rlim_t kLargestFile = 1 << 18;

constexpr std::int32_t kCapabilities[] = {
    kNkMAIDCapability_Name,         kNkMAIDCapability_IsAlive,      kNkMAIDCapability_DataTypes,
    kNkMAIDCapability_StoredBytes,  kNkMAIDCapability_BatteryLevel, kNkMAIDCapability_FreeBytes,
    kNkMAIDCapability_ExposureMode, kNkMAIDCapability_Aperture,     kNkMAIDCapability_Sensitivity,
    kNkMAIDCapability_WBMode,       kNkMAIDCapability_SaveMedia,    kNkMAIDCapability_Children};

std::map<double, double> announcedSizes;  // by capture id

// A module whose answers the input of a run changes. After some polls it answers no more of them, so that no wait goes
// on for ever.
class FuzzedModule {
 public:
  explicit FuzzedModule(Input& input) : _input(input), _talksAtAnyTime(input.onceIn(2)) {
    for (const std::uint32_t id : {1, 2}) {
      auto& camera = _module.model.addCamera(id, "Fuzzed");
      camera.setTransfer({.deliveryBytes = 256U + _input.word(), .deliveriesPerPoll = 8});
      for (const std::uint32_t type : {1, 4})
        camera.shoot(virtualcamera::patternPicture(type + _input.byte(), _input.number()));
    }
    // What the record of an enumeration was changed to is filled, and what that of a delivery was is readable.
    _module.model.faults().add({.command = kNkMAIDCommand_CapGetArray, .anyArraySize = true});
    const auto edit = [this](tagNkMAIDFileInfo& info) {
      if (_input.onceIn(8)) testkit::FaultyModule::scribble(_input, info);
    };
    _module.model.faults().add({.command = kNkMAIDCommand_CapStart, .delivery = {.count = UINT32_MAX, .edit = edit}});
  }

 private:
  static constexpr int kMostCalls = 200000;
  static constexpr int kMostPolls = 16;
  static constexpr int kDeepestCallback = 3;

  Deed decide(const virtualcamera::Call& call) {
    check(++_calls < kMostCalls, "a run comes to its end");
    const bool polls = call.command == kNkMAIDCommand_Async;
    if (polls && ++_polls > kMostPolls) return {.done = false, .answer = kNkMAIDResult_HardwareError};
    Deed deed;
    const bool fails = call.command != kNkMAIDCommand_Close && _input.onceIn(polls ? 32 : 12);
    // An object is open where the caller is told so, and nowhere else.
    if (fails) deed.answer = call.command == kNkMAIDCommand_Open ? -1 - _input.byte() : result();
    if (fails) deed.done = call.command != kNkMAIDCommand_Open && _input.onceIn(2);
    // Events are the input's alone. A new picture of a camera goes to another thread, where no run is like the other.
    if (call.command == kNkMAIDCommand_CapSet && call.parameter == kNkMAIDCapability_EventProc) deed.done = false;
    if (deed.done && _input.onceIn(4)) deed.nonsense = &_input;
    if (polls || _talksAtAnyTime) {
      deed.after = [this] {
        for (int left = _input.byte() & 3; left > 0; --left) talk();
      };
    }
    return deed;
  }

  std::int32_t result() { return _input.onceIn(4) ? static_cast<std::int32_t>(_input.dword()) : 0 - _input.byte(); }

  // A callback at a time of its own: a completion, an event or a piece of a file; of closed objects too.
  void talk() {
    const std::uint8_t kind = _input.byte();
    if (_depth >= kDeepestCallback) return;
    ++_depth;
    const auto all = _module.callbacks();
    const auto oneOf = [this](const auto& list) { return list[_input.byte() % list.size()]; };
    if (kind >= 170 && !all.completions.empty()) {
      oneOf(all.completions)(result());
    } else if (kind >= 85 && !all.events.empty()) {
      const auto target = oneOf(all.events);
      const std::uint32_t event = _input.onceIn(4) ? _input.number() : _input.byte() % 8;
      if (target.level != virtualcamera::Level::Camera || event != kNkMAIDEvent_AddChild)
        target.event(event, _input.number());
    } else if (!all.deliveries.empty()) {
      const auto target = oneOf(all.deliveries);
      tagNkMAIDFileInfo info{kNkMAIDDataObjType_File | kNkMAIDDataObjType_Image, _input.byte(), _input.number(),
                             _input.number(), _input.number()};
      // As many bytes as the record says, or none.
      std::vector<std::uint8_t> bytes(info.ulLength <= UINT16_MAX ? info.ulLength : 0);
      target.deliver(_input.onceIn(32) ? nullptr : &info, bytes.empty() ? nullptr : bytes.data());
    }
    --_depth;
  }

  Input& _input;
  testkit::FaultyModule _module{[this](const auto& call) { return decide(call); },
                                [](const char* promise) { check(false, promise); }};
  const bool _talksAtAnyTime;
  int _polls = 0;
  int _calls = 0;
  int _depth = 0;  // callbacks inside each other
};

double numberIn(const KtLuaTETable& table, const char* key) {
  KtLuaTE* const value = table.elementForKey(key);
  check(value != nullptr && value->getType() == kKtLuaTypeNumber, "a message has its numbers");
  return static_cast<double>(*value);
}

// Everything that a run needs of the process: no log, a service without modules, an empty folder for the pictures.
const fs::path& pictureFolder() {
  static const auto* const folder = [] {
    platform::setLogSink([](const std::string&) {});
    std::signal(SIGXFSZ, SIG_IGN);
    std::string path = (fs::temp_directory_path() / "tether-fuzz-XXXXXX").string();
    check(mkdtemp(path.data()) != nullptr, "there is a folder for the pictures");
    setenv("TMPDIR", path.c_str(), 1);
    NikonTetherService::getSingleton();
    return new fs::path(path);
  }();
  static const struct Remover {
    ~Remover() {
      std::error_code ignored;
      fs::remove_all(*folder, ignored);
    }
  } remover;
  return *folder;
}

// The fuzzer writes files too.
void limitFiles(rlim_t most) {
  rlimit limit{};
  getrlimit(RLIMIT_FSIZE, &limit);
  limit.rlim_cur = most;
  setrlimit(RLIMIT_FSIZE, &limit);
}

void readEverything(CNikonObject& object) {
  object.debugDumpCapabilities();
  for (const std::int32_t id : kCapabilities) {
    std::int32_t number = 0;
    bool truth = false;
    std::string text;
    object.getCapabilityAsTE(id);
    object.getIntCapability(id, number);
    object.getEnumIntCapability(id, number);
    object.getBoolCapability(id, truth);
    object.getStringCapability(id, text);
    check(text.size() <= kNkMAIDStringSize, "a string ends with its buffer");
    object.getEnumStringCapability(id, text);
  }
}

void takePictures(CNikonObject& camera) {
  std::vector<std::int32_t> ids;
  camera.listChildren(ids);
  ids.resize(std::min(ids.size(), kMostItems));
  for (const std::int32_t id : ids) {
    try {
      auto item = std::make_unique<CContentContainer>(&camera, id, id & 3);
      CContentContainer& taken = *item.release();  // the camera's
      const std::lock_guard access(gNikonAsyncLock);
      taken.setInUse(true);
      taken.beginDownload();
      taken.setInUse(false);
    } catch (std::int32_t) {
      // It could not be opened.
    }
  }
}

void useCamera(CNikonModule& module, std::int32_t id) {
  CNikonObject* camera = module.cameraById(id);
  if (camera != nullptr) {
    if (module.getConnectedCameraId() == 0) module.connectCamera(1, id);
    module.getCameraSettings(2, id);
    module.doCapture();
  } else {
    camera = module.openChild(id, "camera");
  }
  if (camera == nullptr) return;
  readEverything(*camera);
  takePictures(*camera);
  camera->capStart(kNkMAIDCapability_Capture, camera, nullptr);
}

void useModule() {
  CNikonModule module(testkit::FaultyModule::entryPoint, "Fuzzed", kModuleId);
  readEverything(module);
  module.enumChildren();
  module.doInitialCameraScan();
  std::vector<std::int32_t> ids;
  module.listChildren(ids);
  ids.resize(std::min(ids.size(), kMostCameras));
  for (const std::int32_t id : ids) useCamera(module, id);
  module.async();
  module.scanAndInformHostOfCameraChanges();
  for (const CCamera* const camera : module.getCamerasToDelete()) delete camera;
  module.getCamerasToDelete().clear();
}

}  // namespace

void SendMessageToClient(long /*id*/, const char* name, KtLuaTETable* data) {
  if (data == nullptr) return;
  const std::string written = encodeElement(*data);
  KtNSDataReadStreamBuf buffer(std::make_shared<platform::Data>(std::vector<char>(written.begin(), written.end())));
  std::istream in(&buffer);
  const std::unique_ptr<KtLuaTE> read(KtLuaTE::createFromStream(in));
  check(read != nullptr && buffer.available() == 0, "the host can read every message");

  if (name == std::string("objectWasAdded"))
    announcedSizes[numberIn(*data, "capture_id")] = numberIn(*data, "file_size");
  if (name != std::string("fileDownloadComplete")) return;
  const auto announced = announcedSizes.find(numberIn(*data, "capture_id"));
  check(announced != announcedSizes.end(), "what is complete was announced");
  const auto size = static_cast<std::uint32_t>(static_cast<std::int64_t>(announced->second));
  KtLuaTE* const path = data->elementForKey("file_path");
  check(path != nullptr, "what is complete has a path");
  check(fs::file_size(static_cast<std::string>(*path)) == size, "what is complete has its size");
}

// A camera may announce a file of 4 GiB. There need not be memory for it, but there must be an answer.
#define OPTIONS "allocator_may_return_null=1:max_allocation_size_mb=256"
extern "C" {
[[gnu::visibility("default")]] const char* __asan_default_options();
[[gnu::visibility("default")]] const char* __tsan_default_options();
const char* __asan_default_options() { return OPTIONS; }
const char* __tsan_default_options() { return OPTIONS; }
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t count) {
  const fs::path& folder = pictureFolder();
  Input input(bytes, count);
  limitFiles(kLargestFile);
  {
    FuzzedModule module(input);
    try {
      useModule();
    } catch (std::int32_t) {
      // It could not be opened.
    }
  }
  limitFiles(RLIM_INFINITY);
  announcedSizes.clear();
  gDownloadIdToNameMap.clear();
  for (const auto& file : fs::directory_iterator(folder)) fs::remove(file.path());
  return 0;
}
