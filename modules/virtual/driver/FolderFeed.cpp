#include "FolderFeed.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <set>
#include <stdexcept>

#include "OwnPicture.h"

namespace virtualcamera {
namespace {

constexpr std::chrono::milliseconds kLookInterval{50};
constexpr off_t kMostFileBytes = off_t{1} << 20;
constexpr size_t kMostMessageBytes = 500;

// In one piece, and not where it would have to wait for the reader.
void complain(const std::string& path, const std::string& message) {
  std::string line = "virtual camera: " + path + ": " + message.substr(0, kMostMessageBytes);
  std::replace_if(
      line.begin(), line.end(), [](unsigned char c) { return c < ' '; }, ' ');
  line += '\n';
  pollfd ready{STDERR_FILENO, POLLOUT, 0};
  if (poll(&ready, 1, 0) == 1 && write(STDERR_FILENO, line.data(), line.size()) < 0) return;
}

// All zero where there is nothing.
FileState stateOf(const std::string& path) {
  struct stat status {};
  if (stat(path.c_str(), &status) != 0 && lstat(path.c_str(), &status) != 0) return {};
  return {status.st_ino, status.st_size, modificationTime(status)};
}

// Nothing where there is no such file. Throws std::runtime_error.
std::optional<std::string> textOf(const std::string& path) {
  const auto check = [](bool good, const char* what) {
    if (!good) throw std::runtime_error(what);
  };
  // A pipe would keep everybody waiting.
  const int descriptor = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
  if (descriptor < 0 && errno == ENOENT) return std::nullopt;
  check(descriptor >= 0, std::strerror(errno));
  const std::shared_ptr<void> closing(nullptr, [descriptor](void*) { close(descriptor); });
  const std::optional<FileState> file = FileState::of(descriptor);
  check(file.has_value(), "is no regular file");
  check(file->size <= kMostFileBytes, "is larger than 1 MiB");
  std::string text(static_cast<size_t>(file->size), '\0');
  for (size_t done = 0; done < text.size();) {
    const ssize_t got = ::read(descriptor, text.data() + done, text.size() - done);
    check(got >= 0 || errno == EINTR, std::strerror(errno));
    check(got != 0, "was cut while it was read");
    done += static_cast<size_t>(std::max<ssize_t>(got, 0));
  }
  return text;
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

void Shutter::setName(const std::string& name) {
  const std::lock_guard lock(mutex_);
  name_ = name;
}

void Shutter::configure(const FileTypes& types, bool pairs) {
  const std::lock_guard lock(mutex_);
  roll_.configure(types, false);
  pairs_ = pairs;
}

void Shutter::look() {
  const std::lock_guard lock(mutex_);
  roll_.look();
}

void Shutter::leave() {
  const std::lock_guard lock(mutex_);
  roll_.leave();
}

Shot Shutter::take(uint32_t number) {
  const std::lock_guard lock(mutex_);
  roll_.look(true);
  if (std::vector<Shot> shots = roll_.take(1); !shots.empty()) return std::move(shots.front());
  return ownShot(number, name_, pairs_);
}

CameraFolder::CameraFolder(Model& model, const FeedOptions& options, uint32_t id, std::string name,
                           const std::string& path)
    : model_(model),
      id_(id),
      name_(std::move(name)),
      path_(path),
      filePath_(path + "/camera.json"),
      shutter_(std::make_shared<Shutter>(path + "/roll", options.events)),
      pictures_(path, options.events, options.rest, PictureFolder::First::Known) {}

CameraFolder::~CameraFolder() { unplug(); }

void CameraFolder::plugIn() {
  if (plugged_) return;
  plugged_ = true;
  const CameraFile file = readFile().value_or(CameraFile{});
  const std::string shown = file.name.value_or(name_);
  Camera& camera = model_.addCamera(id_, shown);
  shutter_->setName(shown);
  camera.setMaker([shutter = shutter_](uint32_t number) { return shutter->take(number); });
  file_ = {};
  apply(file);
  for (Shot& shot : left_) {
    // What has been removed or changed; but not all of it, where the folder is just being moved away again.
    std::erase_if(shot, [this](const Picture& picture) { return !picture.source->isThere() && isFolder(path_); });
    if (!shot.empty()) camera.shoot(std::move(shot));
  }
  left_.clear();
}

void CameraFolder::unplug() {
  if (!plugged_) return;
  plugged_ = false;
  for (const FaultPlan::Id fault : faults_) model_.faults().remove(fault);
  faults_.clear();
  left_ = model_.removeCamera(id_);
  for (const Shot& shot : left_)
    for (const Picture& picture : shot) picture.source->rest();
  pictures_.leave();
  shutter_->leave();
}

void CameraFolder::look() {
  if (!plugged_) return;
  pictures_.look();
  if (pictures_.wasAway()) return unplug();
  shutter_->look();
  if (fileChanged())
    if (std::optional<CameraFile> file = readFile()) apply(std::move(*file));
  Camera* camera = model_.camera(id_);
  for (Shot& shot : pictures_.take(SIZE_MAX)) camera->shoot(std::move(shot));
}

bool CameraFolder::fileChanged() const { return !(stateOf(filePath_) == fileState_); }

// Nothing where the file has an error; no file is the same as one that says nothing.
std::optional<CameraFile> CameraFolder::readFile() {
  fileState_ = stateOf(filePath_);
  try {
    const std::optional<std::string> text = textOf(filePath_);
    return text ? parseCameraFile(*text, id_) : CameraFile{};
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
  FileTypes types;
  types.further = file.fileTypes;
  shutter_->configure(types, file.pairs);
  pictures_.configure(std::move(types), file.pairs);
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

FolderFeed::FolderFeed(Model& model, std::string folder, FeedOptions options)
    : model_(model), options_(std::move(options)), watch_(std::move(folder)) {
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
    for (const auto& [folder, camera] : cameras_) {
      if (!camera->isPlugged()) continue;
      camera->look();
      if (!camera->isPlugged()) watch_.retry();
    }
  } catch (const std::exception& error) {  // out of memory, chiefly; the next look tries again
    complain(watch_.path(), error.what());
  }
}

void FolderFeed::listCameras() {
  const std::optional<std::vector<FolderEntry>> entries = entriesOf(watch_.path());
  if (!entries && isFolder(watch_.path())) return watch_.retry();
  std::map<std::string, CameraName> listed;
  std::set<uint32_t> ids;
  for (const auto& [folder, status] : entries.value_or(std::vector<FolderEntry>())) {
    const std::optional<CameraName> name = parseFolderName(folder);
    if (name && S_ISDIR(status.st_mode) && ids.insert(name->id).second) listed.emplace(folder, *name);
  }
  bool unplugged = false;
  for (const auto& [folder, camera] : cameras_) {
    if (listed.contains(folder) || !camera->isPlugged()) continue;
    camera->unplug();
    unplugged = true;
  }
  // Nobody pulls one cable and puts the next one in at the same moment; a client may not expect it either.
  if (unplugged) return watch_.retry();
  for (const auto& [folder, name] : listed) {
    std::unique_ptr<CameraFolder>& camera = cameras_[folder];
    if (!camera)
      camera = std::make_unique<CameraFolder>(model_, options_, name.id, name.name, watch_.path() + "/" + folder);
    camera->plugIn();
  }
}

}  // namespace virtualcamera
