#include "Link.h"

#include <algorithm>
#include <cstdlib>
#include <system_error>

#include "Report.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr const char* kVirtualCameras = "TETHER_VIRTUAL_CAMERAS";
constexpr auto kDefaultTimeout = 30s;
constexpr auto kSilenceBeyondTimeout = std::chrono::milliseconds(10s);
// A module may find its cameras only when it is first polled, a second after the start.
constexpr auto kCameraPatience = 3s;
// The first look at the cameras is due a second after the start, which was before the first answer; a request takes
// another 0.1 seconds to be carried out.
constexpr auto kFirstPass = 950ms;
// The part of a device's id that names the camera within its module; no camera has 0 there.
constexpr std::int32_t kCameraBits = 0xff;
constexpr std::size_t kMostLosses = 3;
constexpr auto kLossWindow = 60s;
constexpr auto kEndGrace = 2s;

void dropEvent(const Event&) {}

}  // namespace

Link::Link(const Options& options, Console& console, std::shared_ptr<Wakeup> wakeup)
    : _options(options), _console(console), _wakeup(std::move(wakeup)) {
  if (options.helperLog == "-") return;
  try {
    _log = openForLog(options.helperLog.empty() ? "/dev/null" : options.helperLog);
  } catch (const std::system_error& problem) {
    throw Failure{statusWithoutFile(problem.code().value()), std::string("cannot write ") + problem.what()};
  }
}

Link::~Link() {
  end(kEndGrace, dropEvent);
  tidy();
}

std::chrono::milliseconds Link::timeout() const { return _options.timeout.value_or(kDefaultTimeout); }

void Link::start() {
  _cameras.clear();
  _onlyCamera.reset();
  _hadAny = false;
  _probed.reset();
  SessionOptions options;
  options.helper = _options.helper;
  options.errorDescriptor = _log.get();
  options.wakeup = _wakeup;
  options.folder = _options.output;
  // What came while nobody watched is for a command that saves it.
  if (!_options.savesPictures) options.environment.emplace_back("TETHER_STATE=");
  if (_options.virtualCamera && std::getenv(kVirtualCameras) == nullptr) {
    options.environment.push_back(std::string(kVirtualCameras) + "=");
  }
  // Who expects exposures that long expects a helper to be busy with them that long.
  options.silence = std::max(options.silence, timeout() + kSilenceBeyondTimeout);
  _startedAt = Clock::now();
  try {
    _session = std::make_unique<Session>(options);
  } catch (const HelperNotStarted& problem) {
    throw Failure{kHelperLost, problem.what()};
  } catch (const std::system_error& problem) {
    throw Failure{kHelperLost, std::string("cannot start the helper: ") + problem.what()};
  }
}

void Link::restart(const HelperLost& lost) {
  const auto now = Clock::now();
  while (!_losses.empty() && now - _losses.front() > kLossWindow) _losses.pop_front();
  _losses.push_back(now);
  if (_losses.size() > kMostLosses) {
    throw Failure{kHelperLost, lost.description + ", too often within a minute; giving up"};
  }
  _console.say(lost.description + "; starting it again");
  start();
  _console.result("", eventJson("helper_started"));
}

void Link::end(std::chrono::milliseconds grace, const Take& take) {
  if (!_session) return;
  _session->end(grace);
  for (auto event = _session->nextEvent(Clock::now()); event && !std::holds_alternative<HelperLost>(*event);
       event = _session->nextEvent(Clock::now())) {
    note(*event);
    take(*event);
  }
  _ended.push_back(_session->directory());
  _session.reset();
}

void Link::tidy(const std::set<std::string>& known) {
  for (const auto& directory : std::exchange(_ended, {})) {
    for (const std::string& path : directory->tidy()) {
      if (known.count(path) > 0) continue;
      Report::leftover(_console, "left", path, path, "");
      _console.say("left where it is: " + path);
    }
  }
}

void Link::finishing() {
  _finishing = true;
  _wakeup->acknowledge();
}

void Link::throwIfStopped() const {
  if (_wakeup->interrupted()) throw Failure{kInterrupted, "interrupted"};
  if (_console.closed() && !_finishing) throw Failure{kUnwritable, ""};
}

std::optional<Event> Link::next(Clock::time_point until) {
  throwIfStopped();
  if (!_session) return {};
  auto event = _session->nextEvent(until);
  if (event) {
    note(*event);
  } else {
    throwIfStopped();
  }
  return event;
}

void Link::note(const Event& event) {
  if (const auto* const added = std::get_if<DeviceAdded>(&event)) {
    _cameras[added->device_id] = added->name;
    const bool known = _onlyCamera && _onlyCamera->id == added->device_id && _onlyCamera->name == added->name;
    if (!known) _onlyCamera.reset();
    if (!_hadAny) _onlyCamera = Camera{added->device_id, added->name};
    _hadAny = true;
  }
  if (const auto* const removed = std::get_if<DeviceRemoved>(&event)) {
    const auto found = _cameras.find(removed->device_id);
    const std::string number = std::to_string(removed->device_id);
    _lastRemoved = {removed->device_id, found == _cameras.end() ? "camera " + number : found->second};
    _cameras.erase(removed->device_id);
  }
}

// Digits are an id, and never a name: another camera of the same name is none of this user's.
bool Link::isWanted(const Camera& camera) const {
  const std::string& asked = _options.camera;
  if (asked.empty()) return true;
  if (asked.find_first_not_of("0123456789") != std::string::npos) return camera.name == asked;
  const std::size_t zeros = std::min(asked.find_first_not_of('0'), asked.size() - 1);
  return std::to_string(camera.id) == asked.substr(zeros);
}

std::optional<Camera> Link::wanted() const {
  std::vector<Camera> found;
  std::vector<Camera> alike;
  for (const auto& [id, name] : _cameras) {
    const Camera camera{id, name};
    if (!isWanted(camera)) continue;
    if (_chosen && id == _chosen->id && name == _chosen->name) return camera;
    if (_chosen && name == _chosen->name) alike.push_back(camera);
    found.push_back(camera);
  }
  // Another of its name may be the same one under another id, if there never was but one.
  if (_chosen) return alike.size() == 1 && !_hadNamesake ? std::optional(alike.front()) : std::nullopt;
  return found.empty() ? std::nullopt : std::optional(found.front());
}

Camera Link::choose(const Take& take) {
  Reply reply;
  reply.kind = _session->awaitListing(Clock::now() + timeout());
  if (reply.kind != Reply::Kind::kOk) fail(reply, "the list of cameras");
  _firstPassBy = Clock::now() + kFirstPass;
  const auto patience = _startedAt + kCameraPatience;
  const auto takeNext = [&](Clock::time_point until) {
    const auto event = next(until);
    if (!event) return false;
    if (const auto* const lost = std::get_if<HelperLost>(&*event)) throw Failure{kHelperLost, lost->description};
    take(*event);
    return true;
  };
  for (;;) {
    // What the listing brought is taken before anything is chosen from it.
    while (takeNext(Clock::now())) {
    }
    if (const auto camera = wanted()) return *camera;
    if (Clock::now() >= patience) failWithoutCamera();
    takeNext(patience);
  }
}

void Link::failWithoutCamera() const {
  if (_cameras.empty()) throw Failure{kNoCamera, "there is no camera (with --virtual there is one to try things out)"};
  if (_chosen) throw Failure{kNoCamera, _chosen->name + " has not come back"};
  std::string known;
  for (const auto& [id, name] : _cameras) {
    known += (known.empty() ? "" : ", ") + std::to_string(id) + " (" + name + ")";
  }
  throw Failure{kNoCamera, "there is no camera " + _options.camera + "; there is " + known};
}

void Link::connect(const Camera& camera) {
  _probed.reset();
  const auto isNamesake = [&](const auto& other) { return other.first != camera.id && other.second == camera.name; };
  _hadNamesake = _hadNamesake || std::any_of(_cameras.begin(), _cameras.end(), isNamesake);
  const Reply reply = _session->connect(camera.id, Clock::now() + timeout());
  // The helper turns to its module also where the camera refuses.
  const bool answered = reply.kind == Reply::Kind::kOk || reply.kind == Reply::Kind::kError;
  if (answered) _probed = camera.id & ~kCameraBits;
  if (reply.kind != Reply::Kind::kOk) fail(reply, "connecting " + camera.name);
  _chosen = camera;
}

std::optional<std::int32_t> Link::probe() {
  if (!canProbe()) return {};
  return _session->send("getCameraSettings", devicePayload(*_probed).get());
}

void Link::fail(const Reply& reply, const std::string& what) const {
  switch (reply.kind) {
    case Reply::Kind::kLost:
      throw Failure{kHelperLost, _session->lost()->description};
    case Reply::Kind::kInterrupted:
      throw Failure{kInterrupted, "interrupted"};
    case Reply::Kind::kError:
      throw Failure{kNoCamera,
                    what + " failed: " +
                        (reply.errorText.empty() ? "error " + std::to_string(reply.errorCode) : reply.errorText)};
    default:
      throw Failure{kTimeout, what + " took longer than " + secondsText(timeout())};
  }
}

}  // namespace tether::command
