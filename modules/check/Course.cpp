#include "Course.h"

#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <set>

#include "Bundle.h"
#include "Log.h"

namespace modulecheck {
namespace {

using namespace std::chrono_literals;

constexpr auto kIdlePause = 5ms;
constexpr auto kSettling = 100ms;  // for what comes by itself: pictures that are there, late callbacks
constexpr auto kFirstCamera = 3s;  // one on a network has to be asked first
constexpr auto kAsLongAsItTakes = 24h;

// Loaded as the helper loads it: all symbols resolved, none given to others.
NkMAIDEntryPoint* load(Report& report, const std::string& bundlePath) {
  const Doing doing(report.shared(), "library: loading it");
  std::string reason = "it cannot be loaded";
  platform::setLogSink([&](const std::string& line) {
    const std::string failed = "failed: ";
    reason = line.substr(line.find(failed) + failed.size());
    if (reason.compare(0, bundlePath.size(), bundlePath) == 0) reason = reason.substr(reason.find(": ") + 2);
  });
  const auto bundle = platform::Bundle::create(bundlePath);
  const bool loaded = bundle && bundle->loadExecutable();
  platform::setLogSink({});
  if (!loaded) {
    report.fault("library", "library", reason, "a shared library for this machine, all its symbols resolved");
    return nullptr;
  }
  void* const function = bundle->functionPointer("MAIDEntryPoint");
  bundle->stayLoaded();
  if (function == nullptr) report.fault("library", "library", "it exports no MAIDEntryPoint", "that function");
  return reinterpret_cast<NkMAIDEntryPoint*>(function);
}

// What belongs to the helper alone: the host's pipes.
class StandardPipes {
 public:
  StandardPipes() : _input(identity(STDIN_FILENO)), _output(identity(STDOUT_FILENO)), _waiting(waiting()) {}

  void check(Report& report) const {
    if (identity(STDIN_FILENO) != _input || identity(STDOUT_FILENO) != _output) {
      report.fault("module", "module", "descriptor 0 or 1 is closed, or another file", "the host's pipes left alone");
    } else if (waiting() != _waiting) {
      report.fault("module", "module", "it has read from standard input", "the host's requests left alone");
    }
  }

 private:
  using Identity = std::pair<dev_t, ino_t>;
  static Identity identity(int descriptor) {
    struct stat status {};
    fstat(descriptor, &status);
    return {status.st_dev, status.st_ino};
  }
  static int waiting() {
    int bytes = 0;
    ioctl(STDIN_FILENO, FIONREAD, &bytes);
    return bytes;
  }

  const Identity _input;
  const Identity _output;
  const int _waiting;
};

}  // namespace

Transfers::Transfers() : _thread([this] { work(); }) {}

void Transfers::add(std::function<void()> task) {
  const platform::Guard guard(_lock);
  if (_ends) return;
  ++_unfinished;
  _tasks.push(std::move(task));
  _changed.notifyOne();
}

void Transfers::stop() {
  {
    const platform::Guard guard(_lock);
    _ends = true;
    _changed.notifyOne();
  }
  if (_thread.joinable()) _thread.join();
}

void Transfers::work() {
  const platform::Guard guard(_lock);
  for (;;) {
    while (!_ends && _tasks.empty()) _changed.wait(_lock);
    if (_ends) return;
    const auto task = std::move(_tasks.front());
    _tasks.pop();
    const platform::Release meanwhile(_lock);
    task();
    --_unfinished;
  }
}

void Course::run(const std::string& bundlePath) {
  const StandardPipes pipes;
  _context.entryPoint = load(_context.report, bundlePath);
  if (_context.entryPoint != nullptr) check();
  _transfers.stop();
  pipes.check(_context.report);
}

void Course::check() {
  _module = std::make_unique<Module>(_context);
  if (!_module->open()) return;
  _module->examine();
  scan();
  idleUntil([this] { return !_present.empty(); }, kFirstCamera);
  idle(kSettling);
  if (_present.empty()) _module->note("there is no camera: only the module itself was checked");
  const auto present = _present;
  for (const auto& [id, camera] : present) work(*camera);

  // As at a shutdown: pictures that wait for their transfer are closed without it.
  _transfers.stop();
  for (const auto& [id, camera] : _present) {
    if (camera->canCapture()) camera->capture();
  }
  idle(kSettling);
  for (const auto& [id, camera] : _present) camera->checkPairs();
  _module->takeDown();
  std::this_thread::sleep_for(kSettling);
}

void Course::scan() {
  const std::vector<uint32_t> listed = _module->cameras();
  for (const uint32_t id : listed) {
    if (_present.count(id) == 0) meet(id);
  }
  const std::set<uint32_t> there(listed.begin(), listed.end());
  for (auto entry = _present.begin(); entry != _present.end();) {
    Camera& camera = *entry->second;
    const bool isListed = there.count(entry->first) != 0;
    if (isListed && camera.isAlive()) {
      ++entry;
      continue;
    }
    if (isListed) {
      camera.fault("it is listed, and its IsAlive is false or not to be had", "true for a camera that is listed");
    } else {
      camera.note("it has gone: it was given up");
    }
    --_context.report.shared().cameras;
    _transfers.add([&camera] { camera.takeDown(); });
    entry = _present.erase(entry);
  }
}

void Course::meet(uint32_t id) {
  _cameras.push_back(std::make_unique<Camera>(
      *_module, id, [this](Item& item) { _transfers.add([&item] { item.data()->transfer(); }); }));
  Camera& camera = *_cameras.back();
  _module->add(&camera);
  if (!camera.open() || !camera.meet()) return camera.takeDown();
  _present[id] = &camera;
  ++_context.report.shared().cameras;
}

void Course::work(Camera& camera) {
  camera.connect();
  camera.checkSettings();
  if (camera.canCapture()) shoot(camera, 2);
  // Pictures may come by themselves, too.
  idleUntil([this] { return _transfers.isIdle(); }, kAsLongAsItTakes);
  idle(kSettling);
  findAgain(camera);
}

// The second is fired while the first may still be transferred.
void Course::shoot(Camera& camera, int times) {
  for (; times > 0; --times) {
    const uint32_t before = camera.announced();
    _context.mainThread.calling = true;
    const bool captured = camera.capture();
    _context.mainThread.calling = false;
    const auto came = [&] { return camera.announced() != before; };
    if (captured && !idleUntil(came, _context.patience)) {
      camera.fault("its Capture completed and brought no picture", "AddChild for every picture");
    }
  }
}

// A camera that was judged gone is closed on the other thread, and opened again when it is listed.
void Course::findAgain(Camera& camera) {
  const auto entry = _present.find(camera.id());
  if (entry == _present.end()) return;
  camera.checkPairs();
  _present.erase(entry);
  _transfers.add([&camera] { camera.takeDown(); });
  while (!_transfers.isIdle()) std::this_thread::sleep_for(kIdlePause);
  --_context.report.shared().cameras;
  idle(4 * kIdlePause);
  scan();
}

bool Course::idleUntil(const Condition& condition, Clock::duration longest) {
  const auto until = Clock::now() + longest;
  _context.mainThread.calling = true;
  bool holds = false;
  for (int turn = 0; !(holds = condition()) && Clock::now() < until; ++turn) {
    _module->poll();
    if (_module->hasNews()) {
      scan();
    } else if (turn % 4 == 0) {
      for (const auto& [id, camera] : _present) camera->isAlive();
    }
    std::this_thread::sleep_for(kIdlePause);
  }
  _context.mainThread.calling = false;
  return holds;
}

void Course::idle(Clock::duration time) {
  idleUntil([] { return false; }, time);
}

}  // namespace modulecheck
