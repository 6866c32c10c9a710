#include "Roster.h"

#include <algorithm>

namespace gphoto2camera {

constexpr size_t kMostCameras = 255;

Roster::Entry* Roster::find(const std::string& model, const std::string& serial, const Address& address) {
  std::vector<Entry*> absent;
  for (const auto& entry : _entries) {
    if (entry->present || entry->model != model || entry->serial != serial) continue;
    if (entry->port == address.port) return entry.get();
    absent.push_back(entry.get());
  }
  const bool isSure = !serial.empty() || (!address.isNetwork() && absent.size() == 1);
  return isSure && !absent.empty() ? absent.front() : nullptr;
}

std::optional<Place> Roster::enter(const std::string& model, const std::string& serial, const Address& address) {
  const camerakit::Guard guard(_mutex);
  Entry* entry = find(model, serial, address);
  if (entry == nullptr) {
    uint32_t id = static_cast<uint32_t>(_entries.size()) + 1;
    if (_entries.size() == kMostCameras) {
      const auto oldest =
          std::find_if(_entries.begin(), _entries.end(), [](const auto& known) { return !known->present; });
      if (oldest == _entries.end()) return std::nullopt;
      id = (*oldest)->place.id;
      _entries.erase(oldest);
    }
    // Two that say the same of themselves must not share a file.
    const bool alone = std::none_of(_entries.begin(), _entries.end(), [&](const auto& known) {
      return known->model == model && known->serial == serial;
    });
    auto memory = std::make_shared<Memory>(model, alone ? serial : std::string());
    _entries.push_back(std::make_unique<Entry>(Entry{model, serial, address.port, {id, std::move(memory)}}));
    entry = _entries.back().get();
  }
  entry->port = address.port;
  entry->present = true;
  return entry->place;
}

void Roster::leave(uint32_t id) {
  const camerakit::Guard guard(_mutex);
  for (const auto& entry : _entries)
    if (entry->place.id == id) entry->present = false;
}

}  // namespace gphoto2camera
