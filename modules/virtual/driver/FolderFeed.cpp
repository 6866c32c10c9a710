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

using camerakit::Guard;

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
  const Guard guard(_mutex);
  _name = name;
}

void Shutter::configure(const FileTypes& types, bool pairs) {
  const Guard guard(_mutex);
  _roll.configure(types, false);
  _pairs = pairs;
}

void Shutter::look() {
  const Guard guard(_mutex);
  _roll.look();
}

void Shutter::leave() {
  const Guard guard(_mutex);
  _roll.leave();
}

Shot Shutter::take(uint32_t number) {
  const Guard guard(_mutex);
  _roll.look(true);
  if (std::vector<Shot> shots = _roll.take(1); !shots.empty()) return std::move(shots.front());
  return ownShot(number, _name, _pairs);
}

CameraFolder::CameraFolder(Model& model, const FeedOptions& options, uint32_t id, std::string name,
                           const std::string& path)
    : _model(model),
      _id(id),
      _name(std::move(name)),
      _path(path),
      _filePath(path + "/camera.json"),
      _shutter(std::make_shared<Shutter>(path + "/roll", options.events)),
      _pictures(path, options.events, options.rest, PictureFolder::First::Known) {}

CameraFolder::~CameraFolder() { unplug(); }

void CameraFolder::plugIn() {
  if (_plugged) return;
  _plugged = true;
  const CameraFile file = readFile().value_or(CameraFile{});
  const std::string shown = file.name.value_or(_name);
  Camera& camera = _model.addCamera(_id, shown);
  _shutter->setName(shown);
  camera.setMaker([shutter = _shutter](uint32_t number) { return shutter->take(number); });
  _file = {};
  apply(file);
  for (Shot& shot : _left) {
    // What has been removed or changed; but not all of it, where the folder is just being moved away again.
    std::erase_if(shot, [this](const Picture& picture) { return !isThere(picture) && isFolder(_path); });
    if (!shot.empty()) camera.shoot(std::move(shot));
  }
  _left.clear();
}

void CameraFolder::unplug() {
  if (!_plugged) return;
  _plugged = false;
  for (const FaultPlan::Id fault : _faults) _model.faults().remove(fault);
  _faults.clear();
  _left = _model.removeCamera(_id);
  _pictures.leave();
  _shutter->leave();
}

void CameraFolder::look() {
  if (!_plugged) return;
  _pictures.look();
  if (_pictures.wasAway()) return unplug();
  _shutter->look();
  if (fileChanged())
    if (std::optional<CameraFile> file = readFile()) apply(std::move(*file));
  Camera* camera = _model.camera(_id);
  for (Shot& shot : _pictures.take(SIZE_MAX)) camera->shoot(std::move(shot));
}

bool CameraFolder::fileChanged() const { return !(stateOf(_filePath) == _fileState); }

// Nothing where the file has an error; no file is the same as one that says nothing.
std::optional<CameraFile> CameraFolder::readFile() {
  _fileState = stateOf(_filePath);
  try {
    const std::optional<std::string> text = textOf(_filePath);
    return text ? parseCameraFile(*text, _id) : CameraFile{};
  } catch (const std::exception& error) {
    complain(_filePath, error.what());
    return std::nullopt;
  }
}

void CameraFolder::apply(CameraFile file) {
  Camera& camera = *_model.camera(_id);
  camera.setAlive(file.alive);
  camera.setTransfer(file.transfer);
  camera.setCapture(file.capture);
  applySettings(camera, file);
  for (const FaultPlan::Id fault : _faults) _model.faults().remove(fault);
  _faults.clear();
  for (const Fault& fault : file.faults) _faults.push_back(_model.faults().add(fault));
  FileTypes types;
  types.further = file.fileTypes;
  _shutter->configure(types, file.pairs);
  _pictures.configure(std::move(types), file.pairs);
  _file = std::move(file);
}

// Only what differs from before: what a client has set since stays, and only true changes raise events.
void CameraFolder::applySettings(Camera& camera, const CameraFile& file) {
  for (const Capability& setting : file.settings) {
    const Capability* before = find(_file.settings, setting.id);
    if (before == nullptr || !(*before == setting)) camera.set(setting);
  }
  for (const Capability& before : _file.settings)
    if (find(file.settings, before.id) == nullptr) camera.remove(before.id);
  for (const uint32_t id : file.withoutCapabilities)
    if (find(_file.settings, id) == nullptr) camera.remove(id);
  for (const uint32_t id : _file.withoutCapabilities)
    if (std::find(file.withoutCapabilities.begin(), file.withoutCapabilities.end(), id) ==
        file.withoutCapabilities.end())
      camera.restore(id);
}

FolderFeed::FolderFeed(Model& model, std::string folder, FeedOptions options)
    : _model(model), _options(std::move(options)), _watch(std::move(folder)) {
  if (!isFolder(_watch.path())) complain(_watch.path(), "is not a folder");
}

void FolderFeed::look() {
  if (!_mutex.tryLock()) return;
  const Guard guard(_mutex, camerakit::Adopt());
  const Clock::time_point now = Clock::now();
  if (now < _nextLook) return;
  _nextLook = now + kLookInterval;
  try {
    if (_watch.changed()) listCameras();
    for (const auto& [folder, camera] : _cameras) {
      if (!camera->isPlugged()) continue;
      camera->look();
      if (!camera->isPlugged()) _watch.retry();
    }
  } catch (const std::exception& error) {  // out of memory, chiefly; the next look tries again
    complain(_watch.path(), error.what());
  }
}

void FolderFeed::listCameras() {
  const std::optional<std::vector<FolderEntry>> entries = entriesOf(_watch.path());
  if (!entries && isFolder(_watch.path())) return _watch.retry();
  std::map<std::string, CameraName> listed;
  std::set<uint32_t> ids;
  for (const auto& [folder, status] : entries.value_or(std::vector<FolderEntry>())) {
    const std::optional<CameraName> name = parseFolderName(folder);
    if (name && S_ISDIR(status.st_mode) && ids.insert(name->id).second) listed.emplace(folder, *name);
  }
  bool unplugged = false;
  for (const auto& [folder, camera] : _cameras) {
    if (listed.contains(folder) || !camera->isPlugged()) continue;
    camera->unplug();
    unplugged = true;
  }
  // Nobody pulls one cable and puts the next one in at the same moment; a client may not expect it either.
  if (unplugged) return _watch.retry();
  for (const auto& [folder, name] : listed) {
    std::unique_ptr<CameraFolder>& camera = _cameras[folder];
    if (!camera)
      camera = std::make_unique<CameraFolder>(_model, _options, name.id, name.name, _watch.path() + "/" + folder);
    camera->plugIn();
  }
}

}  // namespace virtualcamera
