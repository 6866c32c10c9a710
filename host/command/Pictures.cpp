#include "Pictures.h"

#include <filesystem>
#include <system_error>

#include "FileManager.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr auto kBriefly = 5s;

std::string withCount(std::size_t count, const std::string& noun) {
  return std::to_string(count) + " " + noun + (count == 1 ? "" : "s");
}

}  // namespace

Pictures::Pictures(const std::string& folder, Console& console) : _console(console), _mover(folder) {
  std::error_code error;
  std::filesystem::create_directories(folder, error);
  if (!platform::FileManager::isDirectory(folder)) {
    throw Failure{kNotSaved, "cannot make the folder " + folder + (error ? ": " + error.message() : "")};
  }
}

void Pictures::take(const Event& event, const std::optional<Camera>& camera) {
  if (const auto* const added = std::get_if<ObjectWasAdded>(&event)) announced(*added, camera);
  if (const auto* const complete = std::get_if<FileDownloadComplete>(&event)) completed(*complete, camera);
}

void Pictures::shutterReleased() { _shutters.push_back(Clock::now()); }

Clock::time_point Pictures::takeShutterTime() {
  if (_shutters.empty()) return Clock::now();
  const auto time = _shutters.front();
  _shutters.pop_front();
  return time;
}

void Pictures::announced(const ObjectWasAdded& object, const std::optional<Camera>& camera) {
  _lastProgress = Clock::now();
  Picture picture{object, camera, nullptr, _lastProgress, _lastProgress};
  pairUp(picture);
  _underWay[object.capture_id] = std::move(picture);
}

// Finds the picture's place in a pair, and the time from which it counts.
void Pictures::pairUp(Picture& picture) {
  const std::string_view name = platform::lastPathComponent(picture.object.file_name);
  const std::string_view base = platform::deletingPathExtension(name);
  const std::string_view extension = platform::pathExtension(name);
  const bool second = picture.object.has_sidecar && _openPair && _openPair->announced == base &&
                      _openPair->extension != extension && _openPair->files == 1;
  if (second) {
    _openPair->files = 2;
    picture.pair = _openPair;
    picture.since = _openPair->since;
    return;
  }
  closePair();
  picture.since = takeShutterTime();
  if (!picture.object.has_sidecar) return;
  _openPair = std::make_shared<Pair>();
  _openPair->announced = base;
  _openPair->extension = extension;
  _openPair->since = picture.since;
  picture.pair = _openPair;
}

// Whatever the pair has, nothing more belongs to it.
void Pictures::closePair() {
  const auto pair = std::exchange(_openPair, nullptr);
  if (!pair || pair->closed) return;
  pair->closed = true;
  if (pair->files == 1) _console.say("the other file of " + pair->announced + "." + pair->extension + " did not come");
  if (pair->finished == pair->files) ++_done;
}

void Pictures::completed(const FileDownloadComplete& complete, const std::optional<Camera>& camera) {
  _lastProgress = Clock::now();
  Picture picture;
  const auto found = _underWay.find(complete.capture_id);
  if (found != _underWay.end()) {
    picture = std::move(found->second);
    _underWay.erase(found);
  } else {
    picture.object.capture_id = complete.capture_id;
    picture.object.file_name = complete.file_path;
    picture.camera = camera;
    picture.since = takeShutterTime();
    picture.announced = _lastProgress;
  }
  const bool first = picture.pair && !picture.pair->base;
  const MovedFile moved = _mover.move(complete.file_path, picture.object.file_name, first,
                                      picture.pair ? picture.pair->base : std::nullopt);
  if (moved.moved && first) picture.pair->base = moved.base;
  // A slow copy is no silence of the camera: what came meanwhile has not been looked at.
  _lastProgress = Clock::now();
  report(picture, moved);
  finish(picture);
}

void Pictures::finish(const Picture& picture) {
  if (!picture.pair) {
    ++_done;
    return;
  }
  Pair& pair = *picture.pair;
  ++pair.finished;
  if (pair.closed ? pair.finished != pair.files : pair.finished != 2) return;
  ++_done;
  pair.closed = true;
  if (_openPair == picture.pair) _openPair.reset();
}

void Pictures::report(const Picture& picture, const MovedFile& moved) {
  const std::chrono::duration<double> time = Clock::now() - picture.since;
  const std::string name(platform::lastPathComponent(moved.path));
  Json object = {{"event", moved.moved ? "saved" : "not_saved"},
                 {"capture_id", picture.object.capture_id},
                 {"name", name},
                 {"path", moved.path},
                 {"size", moved.size},
                 {"seconds", time.count()},
                 {"pair", picture.pair != nullptr}};
  if (picture.camera) {
    object["device_id"] = picture.camera->id;
    object["camera"] = picture.camera->name;
  }
  if (!moved.description.empty()) object["description"] = moved.description;
  if (!moved.moved) {
    ++_notSaved;
    _console.result("", object);
    _console.say("could not save " + picture.object.file_name + " in " + _mover.folder() + ": " + moved.description +
                 "; it stays at " + moved.path);
    return;
  }
  const std::string camera = picture.camera ? "  " + picture.camera->name : "";
  _console.result(name + "  " + sizeText(moved.size) + "  " + secondsText(time) + camera, object);
  if (!moved.description.empty()) _console.say(moved.description);
}

void Pictures::giveUp(const std::string& reason) {
  for (const auto& [id, picture] : _underWay) {
    _console.result("", {{"event", "not_received"}, {"capture_id", id}, {"name", picture.object.file_name}});
    _console.say(picture.object.file_name + " was not received: " + reason);
  }
  _underWay.clear();
  _openPair.reset();
  _shutters.clear();
}

std::string Pictures::status() const {
  if (_underWay.empty()) return {};
  const Picture& picture = _underWay.begin()->second;
  return picture.object.file_name + " " + sizeText(picture.object.file_size) + " receiving " +
         secondsText(Clock::now() - picture.announced);
}

// What the camera still owes, announced or not: released shutters, and the other file of a pair.
std::size_t Pictures::expected() const {
  return _underWay.size() + _shutters.size() + (_openPair && _openPair->files == 1 ? 1 : 0);
}

// Until nothing is expected, or nothing more comes in time.
void Pictures::takeUntil(Clock::time_point until, Link& link) {
  while (const auto event = link.next(until)) {
    if (std::holds_alternative<HelperLost>(*event)) return;
    take(*event, std::nullopt);
    if (expected() == 0 && Clock::now() < until) return;
  }
}

void Pictures::waitBriefly(Link& link) {
  link.finishing();
  try {
    // What has been announced by now counts as under way.
    takeUntil(Clock::now(), link);
    if (expected() == 0) return;
    _console.say("waiting up to 5 seconds for " + withCount(expected(), "picture") +
                 " under way; Ctrl-C again to leave");
    takeUntil(Clock::now() + kBriefly, link);
  } catch (const Failure&) {
    // Asked again: no more waiting.
    link.finishing();
  }
}

}  // namespace tether::command
