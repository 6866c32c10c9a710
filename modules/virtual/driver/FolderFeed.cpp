#include "FolderFeed.h"

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <set>
#include <sstream>
#include <stdexcept>

#include "OwnPicture.h"

namespace virtualcamera {
namespace {

constexpr std::chrono::milliseconds kLookInterval{50};

void complain(const std::string& path, const std::string& message) {
  std::string line = "virtual camera: " + path + ": " + message;
  std::replace(line.begin(), line.end(), '\n', ' ');
  std::fprintf(stderr, "%s\n", line.c_str());
}

struct CameraName {
  uint32_t id;
  std::string name;
};

// "12-Studio left" is camera 12, "Studio left".
std::optional<CameraName> parseFolderName(const std::string& folder) {
  const size_t dash = folder.find('-');
  if (dash == 0 || dash > 9 || folder.find_first_not_of("0123456789") != dash || dash + 1 == folder.size())
    return std::nullopt;
  return CameraName{static_cast<uint32_t>(std::stoul(folder)), folder.substr(dash + 1)};
}

bool isFolder(const std::string& path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

const Capability* find(const std::vector<Capability>& settings, uint32_t id) {
  const auto found = std::find_if(settings.begin(), settings.end(), [id](const Capability& s) { return s.id == id; });
  return found != settings.end() ? &*found : nullptr;
}

}  // namespace

void Shutter::configure(const FileTypes& types, bool pairs) {
  const std::lock_guard lock(mutex_);
  types_ = types;
  pairs_ = pairs;
}

Shot Shutter::take(uint32_t number) {
  const std::lock_guard lock(mutex_);
  if (Shot shot = roll_.next(types_); !shot.empty()) return shot;
  Shot shot;
  if (pairs_) shot.push_back(Picture::raw(ownRaw(number)));
  shot.push_back(Picture::jpeg(ownJpeg(number, name_, std::time(nullptr))));
  return shot;
}

CameraFolder::CameraFolder(Model& model, uint32_t id, const std::string& name, const std::string& path)
    : model_(model), id_(id), filePath_(path + "/camera.json"), pictures_(path) {
  const CameraFile file = readFile().value_or(CameraFile{});
  const std::string shown = file.name.value_or(name);
  shutter_ = std::make_shared<Shutter>(shown, path + "/roll");
  Camera& camera = model_.addCamera(id_, shown);
  camera.setMaker([shutter = shutter_](uint32_t number) { return shutter->take(number); });
  apply(file);
}

CameraFolder::~CameraFolder() {
  for (const FaultPlan::Id fault : faults_) model_.faults().remove(fault);
  model_.removeCamera(id_);
}

void CameraFolder::look() {
  if (fileChanged())
    if (std::optional<CameraFile> file = readFile()) apply(std::move(*file));
  Camera* camera = model_.camera(id_);
  for (Shot& shot : pictures_.look(types_, file_.pairs)) camera->shoot(std::move(shot));
}

bool CameraFolder::fileChanged() {
  struct stat status {};
  stat(filePath_.c_str(), &status);  // all zero where there is none
  return !sameTime(modificationTime(status), modificationTime(fileStatus_)) || status.st_size != fileStatus_.st_size ||
         status.st_ino != fileStatus_.st_ino;
}

// Nothing where the file has an error; no file is the same as one that says nothing.
std::optional<CameraFile> CameraFolder::readFile() {
  fileStatus_ = {};
  if (stat(filePath_.c_str(), &fileStatus_) != 0) {
    fileStatus_ = {};
    return CameraFile{};
  }
  try {
    std::ifstream stream(filePath_);
    if (!stream) throw std::runtime_error("cannot be read");
    std::stringstream text;
    text << stream.rdbuf();
    return parseCameraFile(text.str(), id_);
  } catch (const std::exception& error) {
    complain(filePath_, error.what());
    return std::nullopt;
  }
}

void CameraFolder::apply(CameraFile file) {
  Camera& camera = *model_.camera(id_);
  camera.setAlive(file.alive);
  camera.setTransfer(file.transfer);
  camera.setCapture(file.capture);
  applySettings(camera, file);
  for (const FaultPlan::Id fault : faults_) model_.faults().remove(fault);
  faults_.clear();
  for (const Fault& fault : file.faults) faults_.push_back(model_.faults().add(fault));
  types_.further = file.fileTypes;
  shutter_->configure(types_, file.pairs);
  file_ = std::move(file);
}

// Only what differs from before: what a client has set since stays, and only true changes raise events.
void CameraFolder::applySettings(Camera& camera, const CameraFile& file) {
  for (const Capability& setting : file.settings) {
    const Capability* before = find(file_.settings, setting.id);
    if (before == nullptr || !(*before == setting)) camera.set(setting);
  }
  for (const Capability& before : file_.settings)
    if (find(file.settings, before.id) == nullptr) camera.remove(before.id);
  for (const uint32_t id : file.withoutCapabilities)
    if (find(file_.settings, id) == nullptr) camera.remove(id);
  for (const uint32_t id : file_.withoutCapabilities)
    if (std::find(file.withoutCapabilities.begin(), file.withoutCapabilities.end(), id) ==
        file.withoutCapabilities.end())
      camera.restore(id);
}

FolderFeed::FolderFeed(Model& model, std::string folder) : model_(model), watch_(std::move(folder)) {
  if (!isFolder(watch_.path())) complain(watch_.path(), "is not a folder");
}

void FolderFeed::look() {
  const std::unique_lock lock(mutex_, std::try_to_lock);
  if (!lock) return;
  const Clock::time_point now = Clock::now();
  if (now < nextLook_) return;
  nextLook_ = now + kLookInterval;
  try {
    if (watch_.changed()) listCameras();
    for (const auto& [folder, camera] : cameras_) camera->look();
  } catch (const std::exception& error) {  // out of memory, chiefly; the next look tries again
    complain(watch_.path(), error.what());
  }
}

void FolderFeed::listCameras() {
  const std::optional<std::vector<FolderEntry>> entries = entriesOf(watch_.path());
  if (!entries) return watch_.retry();
  std::map<std::string, CameraName> listed;
  std::set<uint32_t> ids;
  for (const FolderEntry& entry : *entries) {
    const std::optional<CameraName> name = parseFolderName(entry.name);
    if (name && isFolder(watch_.path() + "/" + entry.name) && ids.insert(name->id).second)
      listed.emplace(entry.name, *name);
  }
  std::erase_if(cameras_, [&listed](const auto& camera) { return !listed.contains(camera.first); });
  for (const auto& [folder, name] : listed)
    if (!cameras_.contains(folder))
      cameras_.emplace(folder,
                       std::make_unique<CameraFolder>(model_, name.id, name.name, watch_.path() + "/" + folder));
}

}  // namespace virtualcamera
