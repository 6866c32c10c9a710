// What a camera's thread does while the camera is there.
#include "Log.h"
#include "Worker.h"

namespace gphoto2camera {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

constexpr int kWait = 50;                // for events, where nothing else is to be done
constexpr milliseconds kRest{10};        // between two such waits
constexpr milliseconds kLookEvery{100};  // for events, while pictures are read
constexpr int kMostEvents = 64;          // in one look
constexpr seconds kAskEvery{10};         // whether an idle camera on a network is still there
constexpr seconds kBusyFor{1};

int32_t resultOf(int result, const std::string& words) {
  if (result == GP_ERROR_CAMERA_BUSY) return kNkMAIDResult_DeviceBusy;
  if (words.find("Full") != std::string::npos) return kNkMAIDResult_MediaFull;
  if (words.find("ocus") != std::string::npos) return kNkMAIDResult_OutOfFocus;
  return kNkMAIDResult_CaptureFailure;
}

}  // namespace

void Worker::step() {
  if (_device.isBroken()) return lost("the camera did not answer in time");
  if (_shutter->take()) shoot();
  if (!_device.isOpen()) return;
  const Reader::Outcome outcome = _reader.step(_device);
  if (outcome == Reader::Outcome::Lost) return lost(_reader.why());
  const bool reads = outcome == Reader::Outcome::Read;
  const Time now = Clock::now();
  if (reads) _lastHeard = now;
  if (reads && now - _lastLook < kLookEvery) return;
  if (!lookForEvents(reads ? 0 : kWait)) return;
  for (std::vector<File> shot = _pairing.next(now); !shot.empty(); shot = _pairing.next(now)) announce(shot);
  if (!_device.isBroken() && _settings.isDue(now) && !readSettings()) return lost("settings cannot be read");
  if (address().isNetwork() && now - _lastHeard >= kAskEvery && !isThere()) return lost("the camera does not answer");
  if (!reads) _bell->rest(kRest);
}

// False: the connection is given up. An error may be all that is heard of a picture.
bool Worker::lookForEvents(int milliseconds) {
  _lastLook = Clock::now();
  for (int i = 0; i < kMostEvents && !_isDeaf; ++i) {
    Event event;
    const int result = _device.wait(i == 0 ? milliseconds : 0, event);
    if (result == GP_ERROR_NOT_SUPPORTED) {
      log(_name, "does not tell of its pictures; only those that it is told to take are noticed");
      _isDeaf = true;
      return true;
    }
    if (result != GP_OK) return lost("waiting for events: " + _device.words(result)), false;
    if (event.kind == Event::Kind::None) return true;
    if (event.kind == Event::Kind::Added && !arrive(std::move(event.file))) return false;
    if (event.kind == Event::Kind::Changed) _settings.mark(Clock::now());
  }
  return true;
}

bool Worker::isThere() {
  const int result = _device.ask();
  _lastHeard = Clock::now();
  return !_device.isBroken() && (result == GP_OK || Device::isAnswer(result));
}

void Worker::shoot() {
  const Time until = Clock::now() + kBusyFor;
  bool waited = false;
  int result = _device.trigger(waited);
  while (result == GP_ERROR_CAMERA_BUSY && Clock::now() < until && !_stopping) {
    _bell->rest(kLookEvery);
    result = _device.trigger(waited);
  }
  const std::string words = _device.words(result);
  if (result != GP_OK) log(_name, "did not take a picture: " + words);
  _shutter->end(result == GP_OK ? int32_t{kNkMAIDResult_NoError} : resultOf(result, words));
  waited = waited || (result == GP_OK && _isDeaf);
  if (waited || (result != GP_OK && !isThere())) lost(waited ? "it is opened anew to see what it took" : words);
}

// A file that was just shot. False: what the camera said of it makes no sense, and the connection is given up.
bool Worker::arrive(File file) {
  if (const int result = _device.describe(file); result != GP_OK || file.name.starts_with('<')) {
    lost("asking for " + file.path() + ": " + _device.words(result));
    return false;
  }
  if (file.kind() == File::Kind::Other) {
    log(_name, file.path() + " is no picture and stays on the card");
    return true;
  }
  if (file.size == 0 || file.size > UINT32_MAX) {
    log(_name, file.path() + " stays on the card: it has " + std::to_string(file.size) + " bytes");
    return true;
  }
  if (!_place->memory->isNew(file)) return true;
  _place->memory->announce(file);
  _settings.noteSize(file.size);
  _settings.mark(Clock::now());
  _pairing.add(std::move(file), Clock::now());
  return true;
}

void Worker::announce(const std::vector<File>& files) {
  camerakit::Shot shot;
  std::vector<std::shared_ptr<Transfer>> transfers;
  for (const File& file : files) {
    transfers.push_back(std::make_shared<Transfer>(_name, file, _bell));
    shot.push_back({.fileDataType = file.dataType(),
                    .name = file.name,
                    .source = std::make_shared<RemotePicture>(transfers.back())});
  }
  const std::vector<uint32_t> ids = _camera->add(std::move(shot));
  for (size_t i = 0; i < ids.size(); ++i) {
    _items[files[i].path()] = ids[i];
    _reader.add(std::move(transfers[i]));
  }
}

// What nobody took to its end, and what was shot meanwhile.
void Worker::catchUp(const std::vector<File>& added) {
  Pairing shots;
  const Time now = Clock::now();
  Memory& memory = *_place->memory;
  for (const File& file : memory.owed()) {
    File there = file;
    if (_reader.holds(file) || _pairing.holds(file)) continue;
    if (const auto item = _items.find(file.path()); item != _items.end()) _camera->removeItem(item->second);
    const bool gone = _device.describe(there) != GP_OK || there.size != file.size;
    if (gone) log(_name, file.path() + " was announced and is not on the camera any more");
    const bool again = !gone && memory.announce(file);
    if (!gone && !again) log(_name, file.path() + " stays on the card: its transfer has failed too often");
    if (again)
      shots.add(file, now);
    else
      memory.finish(file);
  }
  for (const File& file : added) {
    if (file.kind() == File::Kind::Other || file.size == 0 || file.size > UINT32_MAX) continue;
    memory.announce(file);
    shots.add(file, now);
  }
  for (std::vector<File> shot = shots.next(Time::max()); !shot.empty(); shot = shots.next(Time::max())) announce(shot);
}

bool Worker::readSettings() {
  if (!_settings.read(_device, *_camera) && !isThere()) return false;
  _pairing.setQuality(_settings.quality(_device));
  _lastHeard = Clock::now();
  return true;
}

}  // namespace gphoto2camera
