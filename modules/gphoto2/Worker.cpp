#include "Worker.h"

#include <algorithm>
#include <array>
#include <thread>

#include "Card.h"
#include "Log.h"
#include "Signals.h"
#include "Trouble.h"

namespace gphoto2camera {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

// Each failed attempt on a network leaves memory behind.
constexpr std::array<milliseconds, 8> kPauses{seconds{0}, milliseconds{250}, milliseconds{500}, seconds{1},
                                              seconds{2}, seconds{5},        seconds{10},       seconds{30}};
constexpr seconds kLookedFor{5};
constexpr milliseconds kBetweenOpenings{500};  // where a camera is lost again at once

}  // namespace

Worker::Worker(camerakit::Model& model, Roster& roster, Address address)
    : _model(model), _roster(roster), _device(std::move(address)), _name(_device.address().port), _reader(_name) {}

void Worker::start() {
  std::thread([self = shared_from_this()] {
    blockSignals();
    self->run();
    self->_hasEnded = true;
  }).detach();
}

void Worker::stop() {
  _stopping = true;
  _bell->ring();
}

void Worker::run() {
  while (!_stopping) {
    if (_device.isOpen() || connect())
      step();
    else
      waitForNextAttempt();
  }
  unplug();
  _device.close();
}

bool Worker::connect() {
  if (Clock::now() < _nextAttempt) return false;
  std::vector<File> added;
  if (const int result = open(added); result != GP_OK) {
    failed(result);
    return false;
  }
  if (!_place) {
    _device.close();
    _nextAttempt = Clock::now() + kPauses.back();
    return false;
  }
  _attempts = _lastFailure = 0;
  _lostAt.reset();
  _openedAt = _lastHeard = Clock::now();
  if (_camera) {
    _reader.reconnected();
    _settings.mark(_lastHeard);
  } else {
    _camera = std::make_shared<RealCamera>(_model, _place->id, _name, _shutter, _place->memory);
    if (!_device.canCapture()) _camera->remove(kNkMAIDCapability_Capture);
    readSettings();
    _model.plug(_camera);
  }
  catchUp(added);
  return true;
}

// Everything that has to be asked before the camera is shown.
int Worker::open(std::vector<File>& added) {
  if (const int result = _device.open(); result != GP_OK) return result;
  _settings.connect(_device);
  if (!identify()) return GP_OK;
  if (_device.isBroken()) return GP_ERROR_TIMEOUT;
  _settings.keepOnCard(_device, _name);
  _pairing.setQuality(_settings.quality(_device));
  return look(_device, *_place->memory, added);
}

// Who it is, which may be another one than before at the same port.
bool Worker::identify() {
  std::string model = address().model;
  if (address().isNetwork()) {
    model = _device.value("cameramodel").value_or("");
    if (model.empty()) model = _device.summary("Model");
    if (model.empty()) model = address().port;
  }
  std::string serial = _device.value("serialnumber").value_or("");
  if (serial.empty()) serial = _device.summary("Serial Number");
  if (_place && (model != _name || serial != _serial)) unplug();
  if (!_place) _place = _roster.enter(model, serial, address());
  _name = model;
  _serial = serial;
  _reader.setCamera(_name);
  if (!_place) log(_name, "is one camera too many");
  return _place.has_value();
}

void Worker::failed(int result) {
  const std::string words = _device.words(result);
  _device.close();
  if (!_camera && result != _lastFailure)
    log(_name, "cannot be opened: " + explain(address(), result, words) + "; tried again until it can");
  _lastFailure = _camera ? 0 : result;
  _attempts = std::min<int>(_attempts + 1, kPauses.size() - 1);
  _nextAttempt = Clock::now() + kPauses[static_cast<size_t>(_attempts)];
}

void Worker::lost(const std::string& why) {
  log(_name, "lost the connection: " + why);
  _device.close();
  _lostAt = Clock::now();
  _nextAttempt = std::max(*_lostAt, _openedAt + kBetweenOpenings);
}

void Worker::waitForNextAttempt() {
  if (_shutter->take()) _shutter->end(kNkMAIDResult_SessionFailure);
  if (_camera && (!_lostAt || Clock::now() - *_lostAt > kLookedFor)) unplug();
  const auto left = std::chrono::ceil<milliseconds>(_nextAttempt - Clock::now());
  _bell->rest(std::clamp(left, milliseconds{1}, milliseconds{1000}));
}

void Worker::unplug() {
  if (_camera) _model.unplug(_camera->id());
  if (_place) _roster.leave(_place->id);
  _camera.reset();
  _place.reset();
  _reader.clear();
  _pairing = {};
  _items.clear();
  _isDeaf = false;
}

}  // namespace gphoto2camera
