#include <algorithm>
#include <set>

#include "Commands.h"
#include "Link.h"
#include "Pictures.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr auto kEndGrace = 5s;
constexpr auto kStatusStep = 200ms;
// A camera that would not connect is asked again after this.
constexpr auto kConnectAgain = 5s;
constexpr auto kFirstCameraPatience = 3s;

// One run of the command.
class Watch {
 public:
  Watch(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup)
      : _options(options), _console(console), _pictures(options.output, console), _link(options, console, wakeup) {}

  int run() {
    try {
      _link.start();
      while (!isDone()) step();
    } catch (const Failure& failure) {
      finish(failure.status);
      throw;
    }
    finish(kSuccess);
    if (_pictures.notSaved() > 0) return kNotSaved;
    if (_stuck) return kTimeout;
    return _console.closed() ? kUnwritable : kSuccess;
  }

 private:
  bool isDone() const { return _options.count && _pictures.done() >= *_options.count; }

  void step() {
    connectOne();
    auto until = Clock::time_point::max();
    if (!_waiting.empty()) until = _connectAgain;
    const auto stuckAt = _pictures.lastProgress() + _link.timeout();
    if (_pictures.underWay() > 0) until = std::min(until, stuckAt);
    const auto patience = _link.startedAt() + kFirstCameraPatience;
    if (!_saidNoCamera) until = std::min(until, patience);
    if (_console.live()) {
      showStatus();
      until = std::min(until, Clock::now() + kStatusStep);
    }
    if (const auto event = _link.next(until)) handle(*event);

    if (_pictures.underWay() > 0 && Clock::now() >= _pictures.lastProgress() + _link.timeout()) {
      _stuck = true;
      _pictures.giveUp("nothing came for " + secondsText(_link.timeout()));
    }
    if (!_saidNoCamera && Clock::now() >= patience) sayNoCamera();
  }

  void sayNoCamera() {
    _saidNoCamera = true;
    if (_connected.empty() && _waiting.empty()) {
      _console.say(_options.camera.empty() ? "no camera yet; waiting for one"
                                           : "no camera " + _options.camera + " yet; waiting for it");
    }
  }

  // Takes the first of the cameras that wait to be connected. The helper connects one at a time; a camera keeps sending
  // its pictures when another is connected after it.
  void connectOne() {
    if (_waiting.empty() || Clock::now() < _connectAgain) return;
    const std::int32_t id = *_waiting.begin();
    const Camera camera{id, _link.cameras().at(id)};
    try {
      _link.connect(camera);
    } catch (const Failure& failure) {
      if (failure.status != kNoCamera && failure.status != kTimeout) {
        // A lost helper is told by the event that follows.
        if (failure.status == kHelperLost) return;
        throw;
      }
      _connectAgain = Clock::now() + kConnectAgain;
      if (_refused.insert(id).second) _console.say(failure.text + "; trying again");
      return;
    }
    _waiting.erase(id);
    _refused.erase(id);
    _connected.insert(id);
    _console.result(camera.name + " (" + std::to_string(id) + ") connected",
                    {{"event", "connected"}, {"device_id", id}, {"name", camera.name}});
  }

  void handle(const Event& event) {
    _pictures.take(event, onlyCamera());
    if (const auto* const added = std::get_if<DeviceAdded>(&event)) {
      _console.result(_options.json ? "" : added->name + " (" + std::to_string(added->device_id) + ") is there",
                      {{"event", "camera_added"}, {"device_id", added->device_id}, {"name", added->name}});
      if (_link.isWanted({added->device_id, added->name})) _waiting.insert(added->device_id);
    } else if (const auto* const removed = std::get_if<DeviceRemoved>(&event)) {
      _console.result("camera " + std::to_string(removed->device_id) + " has gone",
                      {{"event", "camera_removed"}, {"device_id", removed->device_id}});
      forget(removed->device_id);
    } else if (const auto* const lost = std::get_if<HelperLost>(&event)) {
      _pictures.giveUp(lost->description);
      _waiting.clear();
      _connected.clear();
      _refused.clear();
      _connectAgain = {};
      _link.restart(*lost);
    }
  }

  void forget(std::int32_t id) {
    _waiting.erase(id);
    _connected.erase(id);
    _refused.erase(id);
  }

  // Announcements do not say which camera they are from: it is known only where there is one.
  std::optional<Camera> onlyCamera() const {
    const auto& cameras = _link.cameras();
    if (cameras.size() != 1) return {};
    return Camera{cameras.begin()->first, cameras.begin()->second};
  }

  void showStatus() {
    std::string text = _pictures.status();
    if (text.empty()) text = _connected.empty() ? "Waiting for a camera" : "Waiting for pictures";
    _console.status(text);
  }

  void finish(int status) {
    if (status == kInterrupted || status == kUnwritable) _pictures.waitBriefly(_link);
    _link.finishing();
    _link.end(kEndGrace, [this](const Event& event) { _pictures.take(event, std::nullopt); });
    _pictures.giveUp("the helper has ended");
  }

  const Options& _options;
  Console& _console;
  Pictures _pictures;
  Link _link;
  std::set<std::int32_t> _waiting;    // wanted, to be connected
  std::set<std::int32_t> _connected;  // at least once since it came
  std::set<std::int32_t> _refused;    // and the user has been told
  Clock::time_point _connectAgain;
  bool _saidNoCamera = false;
  bool _stuck = false;
};

}  // namespace

int runWatch(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  return Watch(options, console, wakeup).run();
}

}  // namespace tether::command
