#include "Road.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <system_error>
#include <utility>

#include "ContentContainer.h"

namespace {

using namespace std::chrono_literals;
using virtualcamera::Level;
using virtualcamera::Picture;

constexpr std::uint32_t kModuleId = 0x300;
constexpr auto kIdlePause = 1ms;
constexpr int kLongestHoldUp = 50;  // pauses

std::int32_t emptyModule(tagNkMAIDObject*, std::uint32_t, std::uint32_t, std::uint32_t, std::uint64_t,
                         NkMAIDCompletionProc*, void*) {
  return kNkMAIDResult_NoError;
}

// An item without a picture, which tells when the download thread is through with it.
struct Fence : CContentContainer {
  Fence(CNikonObject& root, std::function<void()> tell) : CContentContainer(&root, 1, 1), gone(std::move(tell)) {}
  ~Fence() override { gone(); }
  const std::function<void()> gone;
};

std::vector<std::uint8_t> read(const std::string& path) {
  std::ifstream in(path, std::ios::binary | std::ios::ate);
  std::vector<std::uint8_t> bytes(in ? static_cast<std::size_t>(in.tellg()) : 0);
  in.seekg(0).read(reinterpret_cast<char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
  return bytes;
}

}  // namespace

Road::Road(const std::string& folder, Course course, std::optional<Place> place, Way way)
    : module(model, place, way), _folder(folder), _course(course), _place(place), _way(way) {
  module.beforeCall = [this](const Place& at) { beforeCall(at); };
  for (const std::uint32_t camera : {1U, 2U}) plugIn(camera);
}

void Road::run() {
  try {
    _service.reset(NikonTetherService::getSingleton());
  } catch (const std::system_error&) {
    EXPECT_TRUE(_place && _place->command == kThread);
    module.expectAllClosed();
    return;
  }
  _elsewhere = std::make_unique<SpyObject>(emptyModule);
  _service->doInitialCameraScan();
  idle();
  if (_course == Course::kShooting) shooting();
  if (_course == Course::kUnplugging) unplugging();
  expectUnhurtCamerasToWork();
  if (_course == Course::kShutdown) leaveQueued();
  _service.reset();
  module.storm();
  module.endStorms();
  {
    const std::lock_guard access(getAsyncLock());  // a fence of it may be in use
    _elsewhere.reset();
  }
  module.expectAllClosed();
  verify();
}

// The courses.

void Road::shooting() {
  request(&NikonTetherService::connectDevice, 1);
  request(&NikonTetherService::getCameraSettings, 1);
  model.camera(1)->load(picture());  // nothing has been started yet that would have it unplugged
  request(&NikonTetherService::doCapture, 1, false);
  shoot(1, true);
  shoot(2);
  settle();
  plugIn(3);
  idle();
  request(&NikonTetherService::disconnectDevice, 1, false);
  request(&NikonTetherService::connectDevice, 2);
}

void Road::unplugging() {
  for (int shot = 0; shot < 3; ++shot) shoot(1);
  shoot(2);
  holdUpAt({Level::Data, 1, 1, kNkMAIDCommand_Async, 0, 2});
  model.removeCamera(1);
  for (int pass = 0; pass < 3; ++pass) idle();
  goOn();
  settle();
}

void Road::leaveQueued() {
  for (int shot = 0; shot < 3; ++shot) shoot(2);
  holdUpAt({Level::Data, 2, 2, kNkMAIDCommand_Async, 0, 2});
  goOn();
}

// What is wrong with one camera, or was wrong for a moment, is not wrong with the others, or later.
void Road::expectUnhurtCamerasToWork() {
  module.endStorms();
  settle();
  for (const std::uint32_t camera : {1U, 2U}) {
    if (model.camera(camera) == nullptr) plugIn(camera);
  }
  model.raise(kNkMAIDEvent_AddChild, 0);
  idle();
  request(&NikonTetherService::listDevices, 0, false);
  const bool before = module.reached();
  module.endStorms();  // one that these calls brought
  std::map<std::uint32_t, std::size_t> last;
  for (const std::uint32_t camera : {1U, 2U}) {
    last[camera] = _sent.size();
    shoot(camera);
  }
  settle();
  const auto files = completeFiles();
  // What the system refused may have been one of these; a storm spares none that is under way.
  bool mayLack = _place && _place->level == Level::Any;
  if (_way >= kStormBefore && !before && module.reached()) return;
  for (const auto& [camera, number] : last) {
    const bool complete = std::find(files.begin(), files.end(), _sent[number]) != files.end();
    EXPECT_TRUE(complete || isHurt(camera) || std::exchange(mayLack, false)) << "lost to camera " << camera;
  }
}

bool Road::isHurt(std::uint32_t camera) const {
  if (!_place || _place->level == Level::Any) return false;
  if (_place->level != Level::Module) return _place->camera == camera;
  const std::uint32_t command = _place->command;
  // That it goes is not heard of then, nor that it comes again.
  const bool deaf = command == kNkMAIDCommand_CapSet && _place->parameter == kNkMAIDCapability_EventProc;
  if (deaf && _course == Course::kUnplugging) return camera == 1;
  return command == kNkMAIDCommand_Open || command == kNkMAIDCommand_GetCapCount ||
         command == kNkMAIDCommand_GetCapInfo;
}

// What must hold in the end.

std::vector<std::vector<std::uint8_t>> Road::completeFiles() {
  std::vector<std::vector<std::uint8_t>> files;
  for (const Message& message : _recorder.messages()) {
    if (message.name == "fileDownloadComplete") files.push_back(read(message.strings.at("file_path")));
  }
  return files;
}

bool Road::liesAboutAPicture() const {
  if (!_place || _way >= kStormBefore) return false;
  return _place->command == kDelivery || (_place->level >= Level::Item && _way >= kNothingDone);
}

std::string Road::history() {
  std::string all;
  for (const Message& message : _recorder.messages()) {
    all += "\n  " + message.name;
    for (const auto& [key, value] : message.numbers) all += " " + key + "=" + std::to_string(static_cast<int>(value));
    for (const auto& [key, value] : message.strings) all += " " + key + "=" + value;
  }
  return all;
}

void Road::verify() {
  std::set<double> devices;
  std::map<double, std::string> unfinished;
  std::set<std::string> left;
  for (const auto& entry : std::filesystem::directory_iterator(_folder)) left.insert(entry.path());
  for (const Message& message : _recorder.messages()) {
    if (message.id != 0) {
      EXPECT_EQ(_asked.erase(message.id), 1U) << "answered twice: " << message.id;
    } else if (message.name == "deviceAdded") {
      EXPECT_TRUE(devices.insert(message.numbers.at("device_id")).second);
    } else if (message.name == "deviceRemoved") {
      EXPECT_EQ(devices.erase(message.numbers.at("device_id")), 1U);
    } else if (message.name == "objectWasAdded") {
      const double id = message.numbers.at("capture_id");
      EXPECT_TRUE(unfinished.emplace(id, message.strings.at("file_name")).second);
    } else if (message.name == "fileDownloadComplete") {
      EXPECT_EQ(unfinished.erase(message.numbers.at("capture_id")), 1U) << "complete, but not announced";
      EXPECT_EQ(left.erase(message.strings.at("file_path")), 1U) << "complete, but not there";
    }
  }
  const bool opened = !_place || _place->level != Level::Module || _place->command != kNkMAIDCommand_Open;
  EXPECT_TRUE(_asked.empty() || !opened) << "without an answer: " << *_asked.begin();

  std::size_t others = 0;
  for (const auto& file : completeFiles()) {
    others += std::find(_sent.begin(), _sent.end(), file) == _sent.end() ? 1 : 0;
  }
  EXPECT_LE(others, liesAboutAPicture() ? 1U : 0U) << "complete, but not what was sent";

  for (const std::string& path : left) {
    const std::filesystem::path file(path);
    const auto announced = std::find_if(unfinished.begin(), unfinished.end(), [&](const auto& entry) {
      const std::filesystem::path name(entry.second);
      return name.extension() == file.extension() && file.stem().string().starts_with(name.stem().string());
    });
    EXPECT_TRUE(announced != unfinished.end()) << "left behind unannounced: " << path << history();
    EXPECT_EQ(std::filesystem::file_size(file), 0U) << path;
    if (announced != unfinished.end()) unfinished.erase(announced);
  }
}

// Means.

void Road::idle() { _service->idle(); }

void Road::settle() {
  for (int round = 0; round < 2; ++round) {
    idle();
    const auto gone = queueFence();
    idleUntil([&] { return *gone; });
  }
}

std::shared_ptr<bool> Road::queueFence() {
  auto gone = std::make_shared<bool>(false);
  _service->addItemToDownloadQueue(new Fence(*_elsewhere, [this, gone] {
    const std::lock_guard guard(_lock);
    *gone = true;
    _changed.notify_all();
  }));
  return gone;
}

void Road::idleUntil(const std::function<bool()>& condition) {
  std::unique_lock guard(_lock);
  while (!_changed.wait_for(guard, kIdlePause, condition)) {
    guard.unlock();
    idle();
    guard.lock();
  }
}

void Road::plugIn(std::uint32_t camera) {
  model.addCamera(camera, "Camera")
      .setTransfer({.deliveryBytes = kPictureBytes / 4, .inModulePolls = _course == Course::kShutdown});
}

void Road::request(Operation operation, std::uint32_t camera, bool answered) {
  ++_lastRequest;
  if (answered) _asked.insert(_lastRequest);
  KtLuaTETable table;
  table.Set("device_id", new KtLuaTENumber(kModuleId | camera));
  (*_service.*operation)(_lastRequest, &table);
}

Picture Road::picture(std::uint32_t fileDataType) {
  std::vector<std::uint8_t> bytes(kPictureBytes);
  for (std::size_t at = 0; at < bytes.size(); ++at) {
    bytes[at] = static_cast<std::uint8_t>(at * 7 + at / 250 + _sent.size());
  }
  _sent.push_back(bytes);
  return Picture::memory(fileDataType, std::move(bytes));
}

// Where there is no such camera (any more), nothing is shot.
void Road::shoot(std::uint32_t id, bool pair) {
  const std::lock_guard plugging(_plugLock);
  virtualcamera::Camera* const camera = model.camera(id);
  if (camera == nullptr) return;
  Picture first = picture(pair ? kNkMAIDFileDataType_NEF : kNkMAIDFileDataType_JPEG);
  if (pair) {
    camera->shootPair(std::move(first), picture());
  } else {
    camera->shoot(std::move(first));
  }
}

void Road::beforeCall(const Place& at) {
  if (const std::uint32_t camera = module.toUnplug.exchange(0)) {
    const std::lock_guard plugging(_plugLock);
    model.removeCamera(camera);
  }
  std::unique_lock guard(_lock);
  if (_holdUpAt != at) return;
  _heldUp = true;
  _changed.notify_all();
  // The main thread may wait for this one, once it has told of a removal or to have a callback carried.
  for (int pause = 0; pause < kLongestHoldUp && _holdUpAt; ++pause) {
    if (_recorder.names().find("deviceRemoved") != std::string::npos) break;
    _changed.wait_for(guard, kIdlePause);
  }
}

void Road::holdUpAt(const Place& at) {
  std::unique_lock guard(_lock);
  _holdUpAt = at;
  guard.unlock();
  idle();
  const auto gone = queueFence();
  idleUntil([&] { return _heldUp || *gone; });
}

void Road::goOn() {
  const std::lock_guard guard(_lock);
  _holdUpAt.reset();
  _changed.notify_all();
}
