#include <algorithm>

#include "Commands.h"
#include "Link.h"
#include "Pictures.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr auto kEndGrace = 5s;
constexpr auto kStatusStep = 200ms;

// One run of the command.
class Capture {
 public:
  Capture(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup)
      : _options(options),
        _console(console),
        _pictures(options.output, console),
        _link(options, console, wakeup),
        _count(options.count.value_or(1)) {}

  int run() {
    try {
      _link.start();
      connect();
      _begun = Clock::now();
      while (!isDone()) step();
    } catch (const Failure& failure) {
      finish(failure.status);
      if (failure.status == kInterrupted || missing().empty()) throw;
      throw Failure{failure.status, failure.text.empty() ? missing() : failure.text + "; " + missing()};
    }
    finish(kSuccess);
    if (_pictures.notSaved() > 0) return kNotSaved;
    if (_lost > 0) throw Failure{kHelperLost, missing()};
    return _console.closed() ? kUnwritable : kSuccess;
  }

 private:
  int done() const { return _pictures.done() - _earlier; }
  int outstanding() const { return std::max(0, _released - _lost - done()); }

  bool isDone() const {
    const bool allReleased = _released >= _count || _pictures.notSaved() > 0;
    return allReleased && outstanding() == 0 && _pictures.underWay() == 0;
  }

  Clock::time_point nextShutter() const {
    if (_released >= _count || _pictures.notSaved() > 0 || _console.closed()) return Clock::time_point::max();
    if (_options.every) return _begun + *_options.every * _released;
    return outstanding() == 0 ? Clock::time_point::min() : Clock::time_point::max();
  }

  void step() {
    if (Clock::now() >= nextShutter()) release();
    const bool waiting = outstanding() > 0 || _pictures.underWay() > 0;
    const auto deadline =
        waiting ? std::max(_lastRelease, _pictures.lastProgress()) + _link.timeout() : Clock::time_point::max();
    auto until = std::min(deadline, nextShutter());
    if (_console.live()) {
      showStatus();
      until = std::min(until, Clock::now() + kStatusStep);
    }
    const auto event = _link.next(until);
    if (event) {
      handle(*event);
    } else if (Clock::now() >= deadline) {
      throw Failure{kTimeout, "nothing came from " + _camera.name + " for " + secondsText(_link.timeout())};
    }
  }

  void release() {
    _lastRelease = Clock::now();
    ++_released;
    _pictures.shutterReleased();
    _link.session().send("doCapture");
  }

  void handle(const Event& event) {
    _pictures.take(event, _camera);
    const auto* const removed = std::get_if<DeviceRemoved>(&event);
    if (removed != nullptr && removed->device_id == _camera.id) {
      throw Failure{kNoCamera, _camera.name + " has gone"};
    }
    if (const auto* const lost = std::get_if<HelperLost>(&event)) startAgain(*lost);
  }

  // A picture that was lost is not taken again: whether to expose once more is the photographer's to say.
  void startAgain(const HelperLost& lost) {
    _pictures.giveUp(lost.description);
    _lost += outstanding();
    if (_released >= _count) throw Failure{kHelperLost, lost.description};
    _link.restart(lost);
    connect();
  }

  // What the camera had already when it was connected is saved too, but is none of the pictures asked for.
  void connect() {
    const int before = _pictures.done();
    while (!tryToConnect()) {
    }
    _earlier += _pictures.done() - before;
  }

  // False when the helper was lost meanwhile, and there is a new one.
  bool tryToConnect() {
    try {
      _camera = _link.choose([this](const Event& event) { _pictures.take(event, std::nullopt); });
      _link.connect(_camera);
      const auto until = [this] {
        return _pictures.underWay() > 0 ? _pictures.lastProgress() + _link.timeout() : Clock::now();
      };
      while (const auto event = _link.next(until())) {
        if (const auto* const lost = std::get_if<HelperLost>(&*event)) throw Failure{kHelperLost, lost->description};
        handle(*event);
      }
      return true;
    } catch (const Failure& failure) {
      if (failure.status != kHelperLost) throw;
      _pictures.giveUp(failure.text);
      _link.restart(HelperLost(*_link.session().lost()));
      return false;
    }
  }

  void showStatus() {
    std::string text = _pictures.status();
    if (text.empty() && outstanding() > 0) {
      text = "Waiting for " + _camera.name + " " + secondsText(Clock::now() - _lastRelease);
    } else if (text.empty()) {
      text = "Next picture in " + secondsText(std::max<Clock::duration>(nextShutter() - Clock::now(), 0s));
    }
    _console.status(text);
  }

  void finish(int status) {
    if (status == kInterrupted || status == kUnwritable) _pictures.waitBriefly(_link);
    _link.finishing();
    _link.end(kEndGrace, [this](const Event& event) { _pictures.take(event, _camera); });
    _pictures.giveUp("the helper has ended");
  }

  // What of the pictures asked for is not there, in words.
  std::string missing() const {
    const int there = std::min(_count, done());
    if (there >= _count) return {};
    return std::to_string(_count - there) + " of " + std::to_string(_count) +
           (_count == 1 ? " picture is missing" : " pictures are missing");
  }

  const Options& _options;
  Console& _console;
  Pictures _pictures;
  Link _link;
  const int _count;
  Camera _camera;
  Clock::time_point _begun;
  Clock::time_point _lastRelease;
  int _released = 0;
  int _lost = 0;
  int _earlier = 0;
};

}  // namespace

int runCapture(const Options& options, Console& console, const std::shared_ptr<Wakeup>& wakeup) {
  return Capture(options, console, wakeup).run();
}

}  // namespace tether::command
