#include "Settings.h"

#include <algorithm>
#include <cctype>
#include <utility>
#include <vector>

#include "Log.h"

namespace gphoto2camera {
namespace {

using camerakit::Capability;

// Cameras report a turn of a wheel as several changes; readings in between would be of no use.
constexpr std::chrono::milliseconds kQuiet{50}, kBetweenReadings{500};

struct Setting {
  uint32_t capability;
  std::initializer_list<const char*> names;  // in the order to try
};

const Setting kSettings[] = {
    {kNkMAIDCapability_Sensitivity, {"iso"}},
    {kNkMAIDCapability_BatteryLevel, {"batterylevel"}},
    {kNkMAIDCapability_ExposureMode, {"expprogram", "autoexposuremodedial", "autoexposuremode", "exposuremode"}},
    {kNkMAIDCapability_Aperture, {"f-number", "aperture"}},
    {kNkMAIDCapability_ShutterSpeed, {"shutterspeed2", "shutterspeed"}},
    {kNkMAIDCapability_WBMode, {"whitebalance"}}};

void show(camerakit::Camera& camera, uint32_t capability, const std::optional<std::string>& text) {
  if (text)
    camera.set(Capability::string(capability, *text));
  else if (camera.get(capability))
    camera.remove(capability);
}

bool isCard(const std::string& target) {
  std::string lower = target;
  for (char& letter : lower) letter = static_cast<char>(std::tolower(static_cast<unsigned char>(letter)));
  return lower.find("card") != std::string::npos;
}

}  // namespace

void Settings::connect(Device& device) {
  _names.clear();
  for (std::string& name : device.names()) _names.insert(std::move(name));
  _marked.reset();
}

void Settings::mark(Time now) {
  if (!_marked) _marked = now;
}

bool Settings::isDue(Time now) const {
  return _marked && now - *_marked >= kQuiet && now - _lastRead >= kBetweenReadings;
}

bool Settings::read(Device& device, camerakit::Camera& camera) {
  std::vector<std::pair<uint32_t, std::optional<std::string>>> values;
  for (const Setting& setting : kSettings) values.emplace_back(setting.capability, first(device, setting.names));
  values.emplace_back(kNkMAIDCapability_FreeBytes, shotsLeft(device));
  _marked.reset();
  _lastRead = std::chrono::steady_clock::now();
  if (std::none_of(values.begin(), values.end(), [](const auto& value) { return value.second.has_value(); }))
    return false;
  for (const auto& [capability, text] : values) show(camera, capability, text);
  return true;
}

std::optional<std::string> Settings::quality(Device& device) const {
  return first(device, {"imagequality", "imageformat", "imageformatsd"});
}

void Settings::keepOnCard(Device& device, const std::string& name) const {
  const std::optional<std::string> target = first(device, {"capturetarget"});
  if (!target || isCard(*target)) return;
  const std::vector<std::string> choices = device.choices("capturetarget");
  const auto card = std::find_if(choices.begin(), choices.end(), isCard);
  if (card == choices.end()) return;
  const int result = device.set("capturetarget", *card);
  if (result == GP_OK)
    log(name, "its pictures went to \"" + *target + "\"; set to \"" + *card + "\"");
  else
    log(name, "cannot be set to store pictures on its card: " + device.words(result));
}

std::optional<std::string> Settings::first(Device& device, std::initializer_list<const char*> names) const {
  for (const char* name : names) {
    if (!_names.contains(name)) continue;
    if (std::optional<std::string> value = device.value(name)) return value;
  }
  return std::nullopt;
}

std::optional<std::string> Settings::shotsLeft(Device& device) const {
  if (std::optional<std::string> shots = first(device, {"availableshots"})) return shots;
  std::optional<uint64_t> pictures, bytes;
  device.space(pictures, bytes);
  if (!pictures && bytes && _lastSize > 0) pictures = *bytes / _lastSize;
  return pictures ? std::optional<std::string>(std::to_string(*pictures)) : std::nullopt;
}

}  // namespace gphoto2camera
