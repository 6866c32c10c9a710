#include "Model.h"

#include <algorithm>
#include <stdexcept>

namespace tether {
namespace {

namespace fs = std::filesystem;

constexpr int kModule = 1;
constexpr std::size_t kSettings = 7;
constexpr int kAny = -1;

void requireOf(const Message& message, bool met, const std::string& what) {
  if (met) return;
  std::string text = what + ": " + message.name + " " + std::to_string(message.id);
  for (const char* key : {"device_id", "capture_id", "file_size", "has_sidecar", "error_code"})
    if (message.value(key) != nullptr) text += std::string(" ") + key + " " + std::to_string(message.number(key));
  for (const char* key : {"name", "file_name", "file_path", "error_description"})
    if (message.value(key) != nullptr) text += " " + message.text(key);
  require(false, text);
}

}  // namespace

void require(bool met, const std::string& what) {
  if (!met) throw std::runtime_error(what);
}

void Camera::expect(Picture picture) {
  const bool half = picture.sidecar && picture.knownPair;
  if (picture.opens && pairPending && !half) ++downloadId;  // the other half never came
  picture.downloadId = downloadId;
  if (picture.opens) pairPending = half && !pairPending;
  if (picture.opens && !pairPending) ++downloadId;
  ++items;
  due.push_back(std::move(picture));
}

Model::Model(const Helper& helper) : helper_(helper) {
  for (const auto& [id, name] : {std::pair(1, "Studio"), std::pair(2, "Field"), std::pair(255, "Attic")}) {
    Camera& camera = cameras.emplace_back();
    camera.device = kModule * 256 + id;
    camera.folder = std::to_string(id) + "-" + name;
  }
}

fs::path Model::folderOf(const Camera& camera) const {
  return (camera.plugged ? helper_.cameras() : helper_.folder() / "drawer") / camera.folder;
}

void Model::see(const Message& message) {
  if (message.id != 0) {
    answered(message);
  } else if (message.name == "heartbeat") {
    requireOf(message, message.data->getType() == kKtLuaTypeNil, "data");
  } else if (message.name == "deviceAdded" || message.name == "deviceRemoved") {
    comesOrGoes(message, message.name == "deviceAdded");
  } else if (message.name == "cameraSettingsChanged") {
    requireOf(message, --settingsAllowed_ >= 0 && message.entries() == kSettings, "not due");
    settingsOwed_ = false;
  } else if (message.name == "objectWasAdded") {
    begins(message);
  } else {
    requireOf(message, message.name == "fileDownloadComplete", "unknown");
    completes(message);
  }
}

// Requests.

std::string Model::ask(const std::string& name, double device, bool busy) {
  Answer& answer = awaited_[++lastAsked] = expected(name, device);
  if (busy && name == "getCameraSettings") answer.must = false;
  if (busy && answer.battery) answer.battery = kAny;
  ++figures.requests;
  return request(name.c_str(), lastAsked, device);
}

// They are carried out one after the other, and while no camera comes or goes.
Model::Answer Model::expected(const std::string& name, double device) {
  const bool connects = name == "connectDevice";
  if (static_cast<int>(device) / 256 != kModule) return {};
  if (name == "getCameraSettings") {
    if (!everConnected_) return {"error", "Module specified was not connected"};
    if (connected == nullptr) return {"error", "No camera is connected"};
    if (connected->device != device) return {"error", "Camera specified was not connected"};
    return {"ok", "", connected->battery};
  }
  if (!connects && name != "disconnectDevice") return {};
  if (connects && connected != nullptr && connected->device == device) return {};
  disconnect();
  if (!connects) return {};
  everConnected_ = true;
  for (Camera& camera : cameras)
    if (camera.device == device && camera.seen) connected = &camera;
  if (connected == nullptr) return {"error"};
  settingsOwed_ = true;
  ++settingsAllowed_;
  return {"ok"};
}

void Model::disconnect() {
  connected = nullptr;
  settingsOwed_ = false;
}

void Model::answered(const Message& message) {
  const auto found = awaited_.find(message.id);
  requireOf(message, found != awaited_.end(), "out of turn, or twice");
  for (auto before = awaited_.begin(); before != found; ++before)
    require(before->second.name.empty() || !before->second.must, "no answer to " + std::to_string(before->first));
  const Answer& answer = found->second;
  requireOf(message, message.name == answer.name, "expected '" + answer.name + "'");
  if (answer.name == "error") {
    const bool told = !answer.text.empty();
    requireOf(message, message.entries() == (told ? 2 : 1) && message.number("error_code") == (told ? 65535 : -1),
              "code");
    requireOf(message, !told || message.text("error_description") == answer.text, "expected " + answer.text);
  } else if (answer.battery) {
    const bool right = *answer.battery == kAny || message.number("batteryLevel") == *answer.battery;
    requireOf(message, right && message.entries() == kSettings, "other settings");
  } else {
    requireOf(message, message.data->getType() == kKtLuaTypeNil, "data");
  }
  awaited_.erase(awaited_.begin(), std::next(found));
  lastAnswered = message.id;
}

// Cameras.

void Model::comesOrGoes(const Message& message, bool comes) {
  const auto camera = std::find_if(cameras.begin(), cameras.end(),
                                   [&](const Camera& c) { return c.device == message.number("device_id"); });
  requireOf(message, camera != cameras.end() && camera->plugged == comes && camera->seen != comes, "not due");
  requireOf(message, !comes || camera->folder.ends_with("-" + message.text("name")), "another name");
  camera->seen = comes;
  ++figures.plugs;
  if (connected == &*camera) disconnect();
}

void Model::forget(Camera& camera) {
  if (source_ == &camera) {
    left_.insert(currentName_);
    if (current_.fate == Fate::whole) ++figures.failures;
    source_ = nullptr;
  }
  camera.due.clear();
  camera.pairPending = false;
  camera.items = 0;
  camera.downloadId = 1;
}

// Pictures: one at a time, and those of a camera in their order. Of one that was pulled out any may fail.

bool Model::nothingDue() const {
  const bool drained = std::all_of(cameras.begin(), cameras.end(), [](const Camera& c) { return c.due.empty(); });
  return drained && source_ == nullptr && !settingsOwed_;
}

std::string Model::whatIsDue() const {
  const auto shown = [](const Picture& picture) { return " " + picture.file + " " + picture.fault; };
  std::string text = source_ == nullptr ? "" : "the end of " + currentName_ + "," + shown(current_);
  for (const Camera& camera : cameras)
    if (!camera.due.empty()) text += "; " + std::to_string(camera.due.size()) + " from" + shown(camera.due.front());
  return text;
}

bool Model::takeDue(Camera& camera, std::size_t size) {
  for (auto next = camera.due.begin(); next != camera.due.end(); ++next) {
    if (next->fate == Fate::unseen) continue;
    if (next->size == size) {
      current_ = *next;
      source_ = &camera;
      camera.due.erase(camera.due.begin(), std::next(next));
      return true;
    }
    if (camera.plugged) return false;
  }
  return false;
}

void Model::begins(const Message& message) {
  if (source_ != nullptr) {
    require(current_.fate != Fate::whole || !source_->plugged, "not completed: " + whatIsDue());
    left_.insert(currentName_);
  }
  const auto size = static_cast<std::size_t>(message.number("file_size"));
  requireOf(message, std::any_of(cameras.begin(), cameras.end(), [&](Camera& c) { return takeDue(c, size); }),
            "not due");
  requireOf(message, message.number("capture_id") == ++announced, "another id");
  requireOf(message, message.number("has_sidecar") == (current_.sidecar ? 1 : 0), "another sidecar");
  currentName_ = message.text("file_name");
  const fs::path name = currentName_;
  requireOf(message, name.extension() == fs::path(current_.file).extension(), "another type");
  if (!names_.contains(current_.downloadId))
    for (const auto& [id, base] : names_) requireOf(message, base != name.stem(), "a name for two shots");
  const std::string& known = names_.try_emplace(current_.downloadId, name.stem()).first->second;
  requireOf(message, known == name.stem(), "expected " + known);
}

void Model::completes(const Message& message) {
  const bool due = source_ != nullptr && current_.fate == Fate::whole && message.number("capture_id") == announced;
  requireOf(message, due, "not due");
  const fs::path path = message.text("file_path");
  const fs::path plain = helper_.temporary() / currentName_;
  const bool numbered = path.string().starts_with((plain.parent_path() / plain.stem()).string() + "-");
  requireOf(message, path == plain || (numbered && path.extension() == plain.extension()), "another path");
  std::string bytes = pattern(current_.size, current_.seed);
  std::fill_n(bytes.begin() + static_cast<std::ptrdiff_t>(current_.hole.first), current_.hole.second, '\0');
  requireOf(message, readFile(path) == bytes, "other bytes");
  fs::remove(path);
  fs::remove(folderOf(*source_) / current_.file);
  source_->held.erase(current_.file);
  source_ = nullptr;
  ++figures.pictures;
  figures.bytes += current_.size;
}

void Model::checkFolder() {
  for (const auto& entry : fs::directory_iterator(helper_.temporary())) {
    const fs::path path = entry.path();
    const bool known = std::any_of(left_.begin(), left_.end(), [&](const fs::path& name) {
      return path.extension() == name.extension() && path.filename().string().starts_with(name.stem().string());
    });
    require(known && fs::file_size(path) == 0, path.filename().string() + " stays");
    fs::remove(path);
  }
  left_.clear();
}

}  // namespace tether
