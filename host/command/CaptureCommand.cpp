#include <algorithm>

#include "Commands.h"
#include "Pictures.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr auto kStatusStep = 200ms;
// A shutter of a series that is this late moves those after it.
constexpr auto kLate = 100ms;
// After so many in a row that brought nothing the others would be fired for nothing, too.
constexpr int kMostFailures = 10;

// One run of the command.
class Capture {
 public:
  Capture(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup)
      : _options(options),
        _console(console),
        _link(options, console, wakeup),
        _pictures(options, console, _link, wakeup, true),
        _count(options.count.value_or(1)) {}

  Outcome run() {
    Failure end{kSuccess, ""};
    try {
      _link.start();
      connect();
      while (!isDone()) step();
      end.text = _gaveUp;
    } catch (const Failure& failure) {
      end = failure;
    }
    Outcome outcome;
    outcome.status = _pictures.finish(end);
    outcome.error = end.text;
    const std::string missing = missingText(end.status == kInterrupted ? shots().counts().shutters : _count);
    if (!missing.empty()) outcome.error += (end.text.empty() ? "" : "; ") + missing;
    outcome.details = countsJson(shots().counts());
    if (outcome.status == kSuccess && _console.closed()) outcome.status = kUnwritable;
    return outcome;
  }

 private:
  const Shots& shots() const { return _pictures.shots(); }
  bool isLast() const { return shots().counts().shutters >= _count || !_gaveUp.empty() || _gone; }

  bool isDone() {
    if (_gaveUp.empty() && shots().counts().failedInARow >= kMostFailures) {
      _gaveUp = std::to_string(kMostFailures) + " shutters in a row brought no picture";
    }
    const bool over = isLast() && _pictures.isSettled();
    // What a camera that has gone still sends is waited for, but not for long.
    if (_gone && (over || Clock::now() >= *_gone + _link.timeout())) throwGone();
    return over;
  }

  [[noreturn]] void throwGone() const { throw Failure{kNoCamera, _camera.name + " has gone"}; }

  // When the next shutter is due, whether it may be released by then or not.
  Clock::time_point due() const { return isLast() ? Clock::time_point::max() : _due; }

  void step() {
    const auto now = Clock::now();
    auto until = due();
    if (now >= until) {
      if (shots().mayRelease(_options.every.has_value(), now)) {
        release(now);
        return;
      }
      until = Clock::time_point::max();
    }
    if (_console.live()) {
      showStatus();
      until = std::min(until, now + kStatusStep);
    }
    if (const auto event = _pictures.next(until)) handle(*event);
  }

  // A shutter that had to wait is not made up for: those after it keep their distance.
  void release(Clock::time_point now) {
    if (!_pictures.releaseShutter()) {
      if (const auto event = _pictures.next(now)) handle(*event);
      return;
    }
    if (now > _due + kLate) _due = now;
    _due += _options.every.value_or(0s);
  }

  void handle(const Event& event) {
    const auto* const removed = std::get_if<DeviceRemoved>(&event);
    if (removed != nullptr && removed->device_id == _camera.id) _gone = Clock::now();
    if (const auto* const lost = std::get_if<HelperLost>(&event)) startAgain(*lost);
  }

  // A picture that was lost is not taken again: whether to expose once more is the photographer's to say.
  void startAgain(const HelperLost& lost) {
    _pictures.restart(lost);
    if (isLast()) return;
    connect();
  }

  void connect() {
    while (!tryToConnect()) {
    }
  }

  // False when the helper was lost meanwhile, and there is a new one.
  bool tryToConnect() {
    try {
      _camera = _link.choose([this](const Event& event) { _pictures.take(event); });
      _link.connect(_camera);
      _pictures.connected();
      // Whatever the camera had before comes now, and none of it is a shutter's.
      while (!_pictures.isSettled()) {
        const auto event = _pictures.next(Clock::time_point::max());
        const auto* const lost = event ? std::get_if<HelperLost>(&*event) : nullptr;
        if (lost != nullptr) throw Failure{kHelperLost, lost->description};
        if (event) handle(*event);
        if (_gone) throwGone();
      }
      _due = std::max(_due, Clock::now());
      return true;
    } catch (const Failure& failure) {
      if (failure.status != kHelperLost || !_link.session().lost()) throw;
      _pictures.restart(HelperLost(*_link.session().lost()));
      return false;
    }
  }

  void showStatus() {
    std::string text = _pictures.status();
    if (const auto since = shots().waitingSince(); text.empty() && since) {
      text = "Waiting for " + _camera.name + " " + secondsText(Clock::now() - *since);
    } else if (text.empty() && !isLast()) {
      text = "Next picture in " + secondsText(std::max<Clock::duration>(_due - Clock::now(), 0s));
    }
    _console.status(text);
  }

  // What of so many pictures is not there, in words.
  std::string missingText(int asked) const {
    const Shots::Tally& own = shots().counts().own;
    const int missing = asked - own.saved - own.notSaved;
    if (missing <= 0 || shots().counts().shutters == 0) return {};
    return std::to_string(missing) + " of " + std::to_string(asked) +
           (asked == 1 ? " picture is missing" : " pictures are missing");
  }

  const Options& _options;
  Console& _console;
  Link _link;
  Pictures _pictures;
  const int _count;
  Camera _camera;
  Clock::time_point _due;
  std::optional<Clock::time_point> _gone;  // when the camera went
  std::string _gaveUp;                     // why no more shutters are sent
};

}  // namespace

Outcome runCapture(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  return Capture(options, console, wakeup).run();
}

}  // namespace tether::command
