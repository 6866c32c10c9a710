#include "Link.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <system_error>

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr auto kDefaultTimeout = 30s;
constexpr auto kSilenceBeyondTimeout = std::chrono::milliseconds(10s);
// A module may find its cameras only when it is first polled, a second after the start.
constexpr auto kCameraPatience = 3s;
constexpr std::size_t kMostLosses = 3;
constexpr auto kLossWindow = 60s;
constexpr auto kEndGrace = 2s;

void dropEvent(const Event&) {}

}  // namespace

Link::Link(const Options& options, Console& console, std::shared_ptr<Wakeup> wakeup)
    : _options(options), _console(console), _wakeup(std::move(wakeup)) {
  if (options.helperLog == "-") return;
  const std::string path = options.helperLog.empty() ? "/dev/null" : options.helperLog;
  _log = Descriptor(open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666));
  if (!_log) throw Failure{kUsage, "cannot write " + path + ": " + std::strerror(errno)};
}

Link::~Link() { end(kEndGrace, dropEvent); }

std::chrono::milliseconds Link::timeout() const { return _options.timeout.value_or(kDefaultTimeout); }

void Link::start() {
  _cameras.clear();
  _session.reset();
  SessionOptions options;
  options.helper = _options.helper;
  options.errorDescriptor = _log.get();
  options.wakeup = _wakeup;
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
  _console.result("", {{"event", "helper_lost"}, {"description", lost.description}});
  if (_losses.size() > kMostLosses) {
    throw Failure{kHelperLost, lost.description + ", too often within a minute; giving up"};
  }
  _console.say(lost.description + "; starting it again");
  end(0s, dropEvent);
  start();
  _console.result("", {{"event", "helper_started"}});
}

void Link::end(std::chrono::milliseconds grace, const Take& take) {
  if (!_session) return;
  _session->end(grace);
  while (const auto message = _session->nextMessage(Clock::now())) take(eventFrom(*message));
  for (const std::string& path : _session->directory().tidy()) _console.say("left where it is: " + path);
  _session.reset();
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
  auto event = _session->nextEvent(until);
  if (event) {
    note(*event);
  } else {
    throwIfStopped();
  }
  return event;
}

void Link::note(const Event& event) {
  if (const auto* const added = std::get_if<DeviceAdded>(&event)) _cameras[added->device_id] = added->name;
  if (const auto* const removed = std::get_if<DeviceRemoved>(&event)) _cameras.erase(removed->device_id);
}

bool Link::isWanted(const Camera& camera) const {
  if (_options.camera.empty() || camera.name == _options.camera) return true;
  return std::to_string(camera.id) == _options.camera || (!_chosenName.empty() && camera.name == _chosenName);
}

// The one of that id before one of that name, and the one that was chosen before, or its like, before any.
std::optional<Camera> Link::wanted() const {
  std::optional<Camera> found;
  for (const auto& [id, name] : _cameras) {
    const Camera camera{id, name};
    if (std::to_string(id) == _options.camera) return camera;
    if (!isWanted(camera)) continue;
    const bool known = name == _chosenName && found && found->name != _chosenName;
    if (!found || known) found = camera;
  }
  return found;
}

Camera Link::choose(const Take& take) {
  Reply reply;
  reply.kind = _session->awaitListing(Clock::now() + timeout());
  if (reply.kind != Reply::Kind::kOk) fail(reply, "the list of cameras");
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
  if (_cameras.empty()) throw Failure{kNoCamera, "there is no camera"};
  std::string known;
  for (const auto& [id, name] : _cameras) {
    known += (known.empty() ? "" : ", ") + std::to_string(id) + " (" + name + ")";
  }
  throw Failure{kNoCamera, "there is no camera " + _options.camera + "; there is " + known};
}

void Link::connect(const Camera& camera) {
  const Reply reply = _session->connect(camera.id, Clock::now() + timeout());
  if (reply.kind != Reply::Kind::kOk) fail(reply, "connecting " + camera.name);
  _chosenName = camera.name;
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
