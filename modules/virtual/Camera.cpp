#include "VirtualCamera.h"

#include <utility>

namespace virtualcamera {

using camerakit::Exposure;
using camerakit::Guard;

namespace {

constexpr uint64_t kDefaultPictureBytes = 100'000;

Shot shotOf(Picture first) {
  Shot shot;
  shot.push_back(std::move(first));
  return shot;
}

}  // namespace

std::vector<Capability> defaultSettings() {
  return {
      Capability::unsigneds(kNkMAIDCapability_Sensitivity, {100, 200, 400, 800, 1600, 3200, 6400}, 2),
      Capability::integer(kNkMAIDCapability_BatteryLevel, 85),
      Capability::unsignedInteger(kNkMAIDCapability_FreeBytes, 842),
      Capability::packedStrings(kNkMAIDCapability_ExposureMode,
                                {"Program", "Aperture priority", "Shutter priority", "Manual"}, 3),
      Capability::packedStrings(kNkMAIDCapability_Aperture, {"f/1.8", "f/2.8", "f/4", "f/5.6", "f/8", "f/11"}, 3),
      Capability::packedStrings(kNkMAIDCapability_ShutterSpeed, {"1/1000", "1/500", "1/250", "1/125", "1/60", "1"}, 3),
      Capability::strings(kNkMAIDCapability_WBMode, {"Auto", "Incandescent", "Fluorescent", "Direct sunlight"}, 0),
      Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 0),
  };
}

Camera::Camera(const camerakit::Model& model, uint32_t id, const std::string& name)
    : camerakit::Camera(model, id, name) {
  for (Capability& setting : defaultSettings()) set(std::move(setting));
}

uint32_t Camera::shoot(Picture picture) { return add(shotOf(std::move(picture))).front(); }

std::vector<uint32_t> Camera::shoot(Shot shot) { return add(std::move(shot)); }

std::vector<uint32_t> Camera::shootPair(Picture raw, Picture jpeg) {
  Shot shot = shotOf(std::move(raw));
  shot.push_back(std::move(jpeg));
  return add(std::move(shot));
}

void Camera::load(Shot shot) {
  const Guard guard(_mutex);
  _roll.push_back(std::move(shot));
}

void Camera::load(Picture picture) { load(shotOf(std::move(picture))); }

void Camera::setMaker(ShotMaker maker) {
  auto shared = std::make_shared<const ShotMaker>(std::move(maker));
  const Guard guard(_mutex);
  _maker.swap(shared);
}

void Camera::setCapture(const CaptureOptions& options) {
  const Guard guard(_mutex);
  _options = options;
}

int32_t Camera::fire(const Exposure& exposure) {
  const Guard guard(_mutex);
  if (_options.answer == kNkMAIDResult_NoError || _options.answer == kNkMAIDResult_Pending)
    _captures.push_back({exposure});
  return _options.answer;
}

int32_t Camera::change(uint32_t /*capability*/, uint32_t /*value*/) { return kNkMAIDResult_NoError; }

void Camera::transferred(uint32_t /*item*/, const Picture& picture, int32_t /*result*/) { rest(picture); }

void Camera::polled() {
  std::vector<Exposure> due;
  {
    const Guard guard(_mutex);
    for (Capture& capture : _captures)
      if (++capture.polls >= _options.polls) due.push_back(capture.exposure);
    std::erase_if(_captures, [most = _options.polls](const Capture& capture) { return capture.polls >= most; });
  }
  for (const Exposure& exposure : due)
    if (exposure.isAwaited()) expose(exposure);
}

void Camera::expose(const Exposure& exposure) {
  if (exposure.start().outcome != kNkMAIDResult_NoError) return exposure.end();
  Shot shot = nextShot();
  if (shot.empty()) return exposure.end(kNkMAIDResult_CaptureFailure);
  add(std::move(shot));
  bool tells = false;
  {
    const Guard guard(_mutex);
    tells = _options.completeEvent;
  }
  if (tells) raise(kNkMAIDEvent_CaptureComplete, 0);
  exposure.end();
}

Shot Camera::nextShot() {
  std::shared_ptr<const ShotMaker> maker;
  uint32_t number = 0;
  {
    const Guard guard(_mutex);
    number = ++_shots;
    if (!_roll.empty()) {
      Shot shot = std::move(_roll.front());
      _roll.pop_front();
      return shot;
    }
    maker = _maker;
  }
  if (!maker || !*maker) return shotOf(patternPicture(kNkMAIDFileDataType_JPEG, kDefaultPictureBytes));
  try {
    return (*maker)(number);
  } catch (...) {  // no picture, then
    return {};
  }
}

}  // namespace virtualcamera
