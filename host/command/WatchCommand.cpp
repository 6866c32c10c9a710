#include <algorithm>
#include <map>
#include <set>

#include "Commands.h"
#include "Pictures.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr auto kStatusStep = 200ms;
// A camera that would not connect is asked again after this.
constexpr auto kConnectAgain = 5s;
constexpr auto kFirstCameraPatience = 3s;

// One run of the command.
class Watch {
 public:
  Watch(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup)
      : _options(options),
        _console(console),
        _link(options, console, wakeup),
        _pictures(options, console, _link, wakeup, false) {}

  Outcome run() {
    Failure end{kSuccess, ""};
    try {
      _link.start();
      while (!isDone()) step();
    } catch (const Failure& failure) {
      end = failure;
    }
    Outcome outcome;
    outcome.status = _pictures.finish(end);
    outcome.error = end.text;
    outcome.details = countsJson(_pictures.shots().counts());
    if (outcome.status == kSuccess && _console.closed()) outcome.status = kUnwritable;
    return outcome;
  }

 private:
  bool isDone() const {
    const Shots::Tally& all = _pictures.shots().counts().others;
    return _options.count && all.saved + all.notSaved >= *_options.count;
  }

  void step() {
    connectOne();
    auto until = Clock::time_point::max();
    for (const auto& [id, time] : _toConnect) until = std::min(until, time);
    const auto patience = _link.startedAt() + kFirstCameraPatience;
    if (!_saidNoCamera) until = std::min(until, patience);
    if (_console.live()) {
      showStatus();
      until = std::min(until, Clock::now() + kStatusStep);
    }
    if (const auto event = _pictures.next(until)) handle(*event);
    if (!_saidNoCamera && Clock::now() >= patience) sayNoCamera();
  }

  void sayNoCamera() {
    _saidNoCamera = true;
    if (_connected.empty() && _toConnect.empty()) {
      _console.say(_options.camera.empty() ? "no camera yet; waiting for one"
                                           : "no camera " + _options.camera + " yet; waiting for it");
    }
  }

  // Connects the camera whose turn it is. The helper connects one at a time; a camera keeps sending its pictures when
  // another is connected after it.
  void connectOne() {
    const auto next = std::min_element(_toConnect.begin(), _toConnect.end(),
                                       [](const auto& one, const auto& other) { return one.second < other.second; });
    if (next == _toConnect.end() || Clock::now() < next->second) return;
    const Camera camera{next->first, _link.cameras().at(next->first)};
    try {
      _link.connect(camera);
    } catch (const Failure& failure) {
      if (failure.status != kNoCamera && failure.status != kTimeout) {
        // A lost helper is told by the event that follows.
        if (failure.status == kHelperLost) return;
        throw;
      }
      next->second = Clock::now() + kConnectAgain;
      _pictures.report().connectFailed(camera, failure.text, !_refused.insert(camera.id).second);
      return;
    }
    _toConnect.erase(next);
    _refused.erase(camera.id);
    _connected.insert(camera.id);
    _pictures.connected();
    _pictures.report().camera("connected", camera, camera.name + " (" + std::to_string(camera.id) + ") connected");
  }

  void handle(const Event& event) {
    if (const auto* const added = std::get_if<DeviceAdded>(&event)) {
      const Camera camera{added->device_id, added->name};
      _pictures.report().camera("camera_added", camera, camera.name + " (" + std::to_string(camera.id) + ") is there");
      if (_link.isWanted(camera)) _toConnect[camera.id] = Clock::now();
    } else if (const auto* const removed = std::get_if<DeviceRemoved>(&event)) {
      _toConnect.erase(removed->device_id);
      _connected.erase(removed->device_id);
      _refused.erase(removed->device_id);
    } else if (const auto* const lost = std::get_if<HelperLost>(&event)) {
      _toConnect.clear();
      _connected.clear();
      _refused.clear();
      _pictures.restart(*lost);
    }
  }

  void showStatus() {
    std::string text = _pictures.status();
    if (text.empty()) text = _connected.empty() ? "Waiting for a camera" : "Waiting for pictures";
    _console.status(text);
  }

  const Options& _options;
  Console& _console;
  Link _link;
  Pictures _pictures;
  std::map<std::int32_t, Clock::time_point> _toConnect;  // wanted, and when to ask
  std::set<std::int32_t> _connected;                     // at least once since it came
  std::set<std::int32_t> _refused;                       // and the user has been told
  bool _saidNoCamera = false;
};

}  // namespace

Outcome runWatch(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  return Watch(options, console, wakeup).run();
}

}  // namespace tether::command
