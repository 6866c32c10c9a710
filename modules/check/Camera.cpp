#include "Camera.h"

#include <algorithm>

#include "Names.h"

namespace modulecheck {
namespace {

constexpr uint32_t kSettings[] = {kNkMAIDCapability_Sensitivity, kNkMAIDCapability_BatteryLevel,
                                  kNkMAIDCapability_FreeBytes,   kNkMAIDCapability_ExposureMode,
                                  kNkMAIDCapability_Aperture,    kNkMAIDCapability_ShutterSpeed,
                                  kNkMAIDCapability_WBMode};

}  // namespace

Camera::Camera(Object& module, uint32_t id, HandOver handOver)
    : Object(module.context(), &module, id, "camera", "camera " + std::to_string(id)), _handOver(std::move(handOver)) {}

bool Camera::meet() {
  if (!mustAnnounce(kNkMAIDCapability_Name, {kNkMAIDCapType_String}, "Name, without which there is no camera")) {
    return false;
  }
  mustAnnounce(kNkMAIDCapability_IsAlive, {kNkMAIDCapType_Boolean},
               "IsAlive, without which it is removed when cameras come or go");
  if (canCapture()) {
    mustAnnounce(kNkMAIDCapability_Capture, {kNkMAIDCapType_Process}, "");
    mustAnnounce(kNkMAIDCapability_EventProc, {kNkMAIDCapType_Process}, "EventProc, without which no picture is told");
  }
  if (announces(kNkMAIDCapability_SaveMedia)) mustAnnounce(kNkMAIDCapability_SaveMedia, {kNkMAIDCapType_Unsigned}, "");
  const auto shown = text(kNkMAIDCapability_Name);
  if (shown && shown->empty()) note("its name is empty");
  return shown.has_value();
}

void Camera::connect() {
  constexpr uint32_t kToCard = 0;
  constexpr uint32_t kToComputer = 1;
  if (number(kNkMAIDCapability_SaveMedia, Reading::kMay) != kToCard) return;
  const int32_t result = set(kNkMAIDCapability_SaveMedia, kNkMAIDDataType_Unsigned, kToComputer);
  if (result != kNkMAIDResult_NoError) {
    fault("CapSet SaveMedia to 1 answered " + resultText(result), "NoError to a SaveMedia that reads 0");
  }
}

void Camera::checkSettings() {
  for (const uint32_t capability : kSettings) checkSetting(capability);
}

bool Camera::isAlive() {
  return announces(kNkMAIDCapability_IsAlive) && flag(kNkMAIDCapability_IsAlive).value_or(false);
}

bool Camera::capture() {
  const Outcome outcome = perform(kNkMAIDCapability_Capture);
  const bool started = outcome.answer == kNkMAIDResult_NoError || outcome.answer == kNkMAIDResult_Pending;
  if (!started) note("CapStart Capture answered " + resultText(outcome.answer) + ": no picture to check");
  if (outcome.result.value_or(kNkMAIDResult_NoError) != kNkMAIDResult_NoError) {
    note("Capture completed with " + resultText(*outcome.result) + ": no picture to check");
  }
  return started && outcome.result == kNkMAIDResult_NoError;
}

void Camera::onEvent(uint32_t event, uint64_t data) {
  noteProgress();
  if (event == kNkMAIDEvent_AddChild) addItem(static_cast<uint32_t>(data));
}

void Camera::addItem(uint32_t id) {
  Item* item = nullptr;
  {
    const platform::Guard guard(_lock);
    for (const auto& known : _items) {
      if (known->id() != id || !known->isOpen()) continue;
      return fault("AddChild announced item " + std::to_string(id) + ", which is announced and open already",
                   "every picture announced once");
    }
    _items.push_back(std::make_unique<Item>(*this, id));
    item = _items.back().get();
  }
  ++_announced;
  if (!item->openAll()) return;
  pairUp(*item);
  _handOver(*item);
}

void Camera::pairUp(const Item& item) {
  const platform::Guard guard(_lock);
  if (_half != nullptr && !item.isHalf()) {
    item.fault("it comes after " + _half->name() + ", a half of a pair, and is none itself",
               "the two halves of a pair one after the other");
    _half = nullptr;
  } else if (item.isHalf()) {
    _half = _half == nullptr ? &item : nullptr;
  }
}

void Camera::checkPairs() {
  const platform::Guard guard(_lock);
  if (_half == nullptr) return;
  _half->fault("the other half of its pair never came",
               "two pictures of a pair, with RawJpegImageStatus not 0 in both");
}

std::vector<Object*> Camera::below() const {
  const platform::Guard guard(_lock);
  std::vector<Object*> all;
  for (const auto& item : _items) all.push_back(item.get());
  return all;
}

void Module::examine() {
  mustAnnounce(kNkMAIDCapability_Children, {kNkMAIDCapType_Enum}, "Children, which lists the cameras");
  if (!announces(kNkMAIDCapability_EventProc)) {
    note("it does not announce EventProc: cameras that come or go later are not noticed");
  }
}

std::vector<uint32_t> Module::cameras() {
  constexpr uint32_t kLargestId = 255;
  if (!announces(kNkMAIDCapability_Children)) return {};
  std::vector<uint32_t> ids = children().value_or(std::vector<uint32_t>());
  const auto isWrong = [&](uint32_t id) {
    if (id >= 1 && id <= kLargestId) return false;
    fault("Children lists the id " + std::to_string(static_cast<int32_t>(id)), "ids of cameras from 1 to 255");
    return true;
  };
  ids.erase(std::remove_if(ids.begin(), ids.end(), isWrong), ids.end());
  std::sort(ids.begin(), ids.end());
  if (const auto twice = std::adjacent_find(ids.begin(), ids.end()); twice != ids.end()) {
    fault("Children lists the id " + std::to_string(*twice) + " twice", "every camera once");
    ids.erase(std::unique(ids.begin(), ids.end()), ids.end());
  }
  return ids;
}

void Module::onEvent(uint32_t event, uint64_t /*data*/) {
  if (event == kNkMAIDEvent_AddChild || event == kNkMAIDEvent_RemoveChild) _hasNews = true;
}

}  // namespace modulecheck
