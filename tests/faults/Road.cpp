#include "Road.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <climits>
#include <system_error>
#include <utility>

#include "ContentContainer.h"
#include "Files.h"

namespace {

using namespace std::chrono_literals;
using testkit::Deed;
using virtualcamera::Call;
using virtualcamera::Level;
using virtualcamera::Picture;
using Bytes = std::vector<std::uint8_t>;

constexpr std::uint32_t kModuleId = 0x300;
constexpr auto kIdlePause = 1ms;
constexpr int kLongestHoldUp = 50;  // pauses
// How many polls of an object there are is the threads' business: only the first are places.
constexpr std::uint32_t kPolls = 4;

std::atomic<Road*> current{nullptr};

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

// As a truth value, a number, or which fields of a record and what they become.
testkit::Input nonsense(int way) {
  static const std::array<std::array<std::uint8_t, 64>, 7> kinds = [] {
    std::array<std::array<std::uint8_t, 64>, 7> made{};
    made[0].fill(0xFF);
    made[1] = {0xF2, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF};
    made[2] = {0xF4, 0xFF, 0xFF, 0xFF, 0x7F};
    made[3] = {0xF8, 0x00, 0x00, 0x00, 0x80};
    made[4] = {0x01, 0x63};
    made[6] = {0x64, 0x04};
    return made;
  }();
  const auto& bytes = kinds[static_cast<std::size_t>(std::clamp(way - kNonsense, 0, 6))];
  return {bytes.data(), bytes.size()};
}

// Those of 3 are so large that room is reserved for them.
std::uint32_t pictureSize(std::uint32_t camera) { return camera == 3 ? 1'100'000 : 10'000; }

}  // namespace

Road* currentRoad() { return current; }

// What the forwarding module calls.
extern "C" __attribute__((visibility("default"))) std::int32_t testEntryPoint(
    tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType, std::uint64_t data,
    NkMAIDCompletionProc* completion, void* reference) {
  return testkit::FaultyModule::entryPoint(object, command, parameter, dataType, data, completion, reference);
}

Road::Road(const std::string& folder, Course course, std::optional<Place> place, Way way)
    : _folder(folder), _course(course), _place(place), _way(way), _nonsense(nonsense(way)) {
  _module =
      std::make_unique<testkit::FaultyModule>([this](const Call& call) { return decide(call); },
                                              [](const char* promise) { ADD_FAILURE() << "broken: " << promise; });
  current = this;
  if (_place && _place->command == kDelivery) breakDelivery();
  for (const std::uint32_t camera : {1U, 2U}) plugIn(camera);
}

Road::~Road() { current = nullptr; }

void Road::run() {
  try {
    _service.reset(NikonTetherService::getSingleton());
  } catch (const std::system_error&) {
    EXPECT_TRUE(_place && _place->command == kThread);
    return;
  }
  _elsewhere = std::make_unique<SpyObject>(emptyModule);
  _service->doInitialCameraScan();
  _service->idle();
  if (_course == Course::kShooting) shooting();
  if (_course == Course::kUnplugging) unplugging();
  expectUnhurtCamerasToWork();
  if (_course == Course::kShutdown) leaveQueued();
  _service.reset();
  storm();
  endStorms();
  {
    const std::lock_guard access(getAsyncLock());  // a fence of it may be in use
    _elsewhere.reset();
  }
  verify();
}

// Places.

std::vector<Place> Road::places() {
  const std::lock_guard guard(_lock);
  return _places;
}

bool Road::arrive(Place& place) {
  const std::lock_guard guard(_lock);
  place.nth = ++_counts[place.kind()];
  if (place.command != kNkMAIDCommand_Async || place.nth <= kPolls) _places.push_back(place);
  if (_place != place) return false;
  _reached = true;
  return true;
}

std::optional<Way> Road::systemCall(SystemCall which) {
  Place place{{}, which};
  return arrive(place) ? std::optional(_way) : std::nullopt;
}

Deed Road::decide(const Call& call) {
  if (const std::uint32_t camera = _toUnplug.exchange(0)) {
    const std::lock_guard plugging(_plugLock);
    _module->model.removeCamera(camera);
  }
  Place at{call.target, call.command, call.parameter};
  const bool here = arrive(at);
  std::unique_lock guard(_lock);
  if (_holdUpAt == at) {
    _heldUp = true;
    _changed.notify_all();
    // The main thread may wait for this one, once it has told of a removal or to have a callback carried.
    for (int pause = 0; pause < kLongestHoldUp && _holdUpAt; ++pause) {
      if (_recorder.names().find("deviceRemoved") != std::string::npos) break;
      _changed.wait_for(guard, kIdlePause);
    }
  }
  guard.unlock();
  if (!here) return {};
  // A completion that never comes is waited for as long as the camera is there.
  if (_way == kNothingDone && at.command == kNkMAIDCommand_CapStart) _toUnplug = at.target.camera;
  const Deed deeds[] = {{.done = false, .answer = kNkMAIDResult_UnexpectedError},
                        {.done = false, .answer = kNkMAIDResult_DeviceBusy},
                        {.done = false, .answer = kNkMAIDResult_BufferSize},
                        {.answer = kNkMAIDResult_UnexpectedError},
                        {.done = false},
                        {.nonsense = &_nonsense},
                        {.nonsense = &_nonsense},
                        {.nonsense = &_nonsense},
                        {.nonsense = &_nonsense},
                        {.answer = kNkMAIDResult_OrphanedChildren, .nonsense = &_nonsense},
                        {.answer = INT_MIN, .nonsense = &_nonsense},
                        {.answer = 99, .nonsense = &_nonsense},
                        {.before = [this] { storm(); }},
                        {.after = [this] { storm(); }},
                        {.before = [this] { startStorm(); }}};
  return deeds[_way];
}

// A transfer is told at its start how its deliveries go.
void Road::breakDelivery() {
  const auto [target, command, parameter, nth] = *_place;
  virtualcamera::Fault fault{.level = target.level,
                             .camera = target.camera,
                             .item = target.item,
                             .command = kNkMAIDCommand_CapStart,
                             .times = 1};
  fault.delivery.first = nth - 1;
  fault.delivery.drop = _way == kRefused;
  fault.delivery.twice = _way == kBusy;
  if (_way == kBufferSize) fault.delivery.cutTo = 5;
  fault.delivery.edit = [this](tagNkMAIDFileInfo& info) {
    _reached = true;
    if (_way == kDoneButRefused) info.totalLength = info.ulLength;
    if (_way == kNothingDone) info.ulLength = 0;
    if (_way >= kNonsense && _way < kStormBefore) testkit::FaultyModule::scribble(_nonsense, info);
    if (_way == kStormElsewhere) return startStorm();
    if (_way >= kStormBefore) storm(true);
  };
  _module->model.faults().add(std::move(fault));
}

// Storms: whatever was ever registered or waited for is called back, whether it is still there or not. From a delivery,
// which the download thread may wait for, nothing that is carried to it.

void Road::storm(bool fromDelivery) {
  const auto all = _module->callbacks();
  for (const auto& procedure : all.events) {
    if (fromDelivery && procedure.level >= Level::Item) continue;
    for (const std::uint64_t child : {1, 999}) procedure.event(kNkMAIDEvent_AddChild, child);
    procedure.event(kNkMAIDEvent_RemoveChild, 1);
    procedure.event(kNkMAIDEvent_CapChange, 9);
  }
  for (const auto& procedure : all.deliveries) {
    if (fromDelivery && procedure.level == Level::Item) continue;
    tagNkMAIDFileInfo info{kNkMAIDDataObjType_Image | kNkMAIDDataObjType_File, kNkMAIDFileDataType_JPEG, 10'000, 0, 0};
    procedure.deliver(&info, nullptr);
  }
  for (const auto& completion : all.completions) completion(kNkMAIDResult_UnexpectedError);
}

void Road::startStorm() {
  std::thread thread([this] { storm(); });
  const std::lock_guard guard(_lock);
  _storms.push_back(std::move(thread));
}

void Road::endStorms() {
  std::unique_lock guard(_lock);
  auto storms = std::exchange(_storms, {});
  guard.unlock();
  for (auto& thread : storms) thread.join();
}

// The courses.

void Road::shooting() {
  request(&NikonTetherService::connectDevice, 1);
  request(&NikonTetherService::getCameraSettings, 1);
  _module->model.camera(1)->load(picture(1));  // nothing has been started yet that would have it unplugged
  request(&NikonTetherService::doCapture, 1, false);
  shoot(1, true);
  shoot(2);
  settle();
  plugIn(3);
  _service->idle();
  shoot(3);
  request(&NikonTetherService::disconnectDevice, 1, false);
  request(&NikonTetherService::connectDevice, 2);
}

void Road::unplugging() {
  for (int shot = 0; shot < 3; ++shot) shoot(1);
  shoot(2);
  holdUpAt({{Level::Data, 1, 1}, kNkMAIDCommand_Async, 0, 2});
  _module->model.removeCamera(1);
  for (int pass = 0; pass < 3; ++pass) _service->idle();
  goOn();
  settle();
}

void Road::leaveQueued() {
  for (int shot = 0; shot < 3; ++shot) shoot(2);
  holdUpAt({{Level::Data, 2, 2}, kNkMAIDCommand_Async, 0, 2});
  goOn();
}

// What is wrong with one camera, or was wrong for a moment, is not wrong with the others, or later.
void Road::expectUnhurtCamerasToWork() {
  endStorms();
  settle();
  for (const std::uint32_t camera : {1U, 2U}) {
    if (_module->model.camera(camera) == nullptr) plugIn(camera);
  }
  _module->model.raise(kNkMAIDEvent_AddChild, 0);
  _service->idle();
  request(&NikonTetherService::listDevices, 0, false);
  const bool before = _reached;
  endStorms();  // one that these calls brought: pictures may be lost to it
  std::map<std::uint32_t, std::size_t> last;
  for (const std::uint32_t camera : {1U, 2U}) {
    last[camera] = _sent.size();
    shoot(camera);
  }
  settle();
  const auto files = completeFiles();
  // A call of the system that was interrupted, or had a name that was taken, is made again.
  const bool nothingFailed =
      !_place || (_place->isOfSystem() && (_place->command == kFwrite ? kBufferSize : kBusy) <= _way);
  EXPECT_TRUE(_course != Course::kShooting || !nothingFailed || files.size() == _sent.size()) << "something is lost";
  // What the system refused may have been one of these; a storm spares none that is under way.
  bool mayLack = _place && _place->isOfSystem();
  if (_way >= kStormBefore && !before && _reached) return;
  for (const auto& [camera, number] : last) {
    const bool complete = std::find(files.begin(), files.end(), _sent[number]) != files.end();
    EXPECT_TRUE(complete || isHurt(camera) || std::exchange(mayLack, false)) << "lost to camera " << camera;
  }
}

bool Road::isHurt(std::uint32_t camera) const {
  if (!_place || _place->isOfSystem()) return false;
  if (_place->target.level != Level::Module) return _place->target.camera == camera;
  const std::uint32_t command = _place->command;
  // That it goes is not heard of then, nor that it comes again.
  const bool deaf = command == kNkMAIDCommand_CapSet && _place->parameter == kNkMAIDCapability_EventProc;
  if (deaf && _course == Course::kUnplugging) return camera == 1;
  return command == kNkMAIDCommand_Open || command == kNkMAIDCommand_GetCapCount ||
         command == kNkMAIDCommand_GetCapInfo;
}

// What must hold in the end.

std::vector<Bytes> Road::completeFiles() {
  std::vector<Bytes> files;
  for (const Message& message : _recorder.messages()) {
    if (message.name != "fileDownloadComplete") continue;
    files.push_back(testkit::readFile<Bytes>(message.strings.at("file_path")));
  }
  return files;
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
  const bool opened = !_place || _place->target.level != Level::Module || _place->command != kNkMAIDCommand_Open;
  EXPECT_TRUE(_asked.empty() || !opened) << "without an answer: " << *_asked.begin();

  const bool lied = _place && _way < kStormBefore &&
                    (_place->command == kDelivery || (_place->target.level >= Level::Item && _way >= kNothingDone));
  const auto files = completeFiles();
  const auto others = std::count_if(files.begin(), files.end(), [this](const Bytes& file) {
    return std::find(_sent.begin(), _sent.end(), file) == _sent.end();
  });
  EXPECT_LE(others, lied ? 1 : 0) << "complete, but not what was sent";

  for (const std::string& path : left) {
    const std::filesystem::path file(path);
    const auto announced = std::find_if(unfinished.begin(), unfinished.end(), [&](const auto& entry) {
      const std::filesystem::path name(entry.second);
      return name.extension() == file.extension() && file.stem().string().starts_with(name.stem().string());
    });
    EXPECT_TRUE(announced != unfinished.end()) << "left behind unannounced: " << path;
    EXPECT_EQ(std::filesystem::file_size(file), 0U) << path;
    if (announced != unfinished.end()) unfinished.erase(announced);
  }
}

// Means.

void Road::settle() {
  for (int round = 0; round < 2; ++round) {
    _service->idle();
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
    _service->idle();
    guard.lock();
  }
}

void Road::plugIn(std::uint32_t camera) {
  _module->model.addCamera(camera, "Camera")
      .setTransfer({.deliveryBytes = pictureSize(camera) / kDeliveries, .inModulePolls = _course == Course::kShutdown});
}

void Road::request(Operation operation, std::uint32_t camera, bool answered) {
  ++_lastRequest;
  if (answered) _asked.insert(_lastRequest);
  KtLuaTETable table;
  table.Set("device_id", new KtLuaTENumber(kModuleId | camera));
  (*_service.*operation)(_lastRequest, &table);
}

Picture Road::picture(std::uint32_t camera, std::uint32_t fileDataType) {
  Bytes bytes(pictureSize(camera), static_cast<std::uint8_t>(_sent.size()));
  for (std::size_t at = 0; at < bytes.size(); at += 99) bytes[at] = static_cast<std::uint8_t>(at / 99 + _sent.size());
  _sent.push_back(bytes);
  return Picture::memory(fileDataType, std::move(bytes));
}

// Where there is no such camera (any more), nothing is shot.
void Road::shoot(std::uint32_t id, bool pair) {
  const std::lock_guard plugging(_plugLock);
  virtualcamera::Camera* const camera = _module->model.camera(id);
  if (camera == nullptr) return;
  Picture first = picture(id, pair ? kNkMAIDFileDataType_NEF : kNkMAIDFileDataType_JPEG);
  if (pair) {
    camera->shootPair(std::move(first), picture(id));
  } else {
    camera->shoot(std::move(first));
  }
}

void Road::holdUpAt(const Place& at) {
  std::unique_lock guard(_lock);
  _holdUpAt = at;
  guard.unlock();
  _service->idle();
  const auto gone = queueFence();
  idleUntil([&] { return _heldUp || *gone; });
}

void Road::goOn() {
  const std::lock_guard guard(_lock);
  _holdUpAt.reset();
  _changed.notify_all();
}
