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
  StandardPipes() : input_(identity(STDIN_FILENO)), output_(identity(STDOUT_FILENO)), waiting_(waiting()) {}

  void check(Report& report) const {
    if (identity(STDIN_FILENO) != input_ || identity(STDOUT_FILENO) != output_) {
      report.fault("module", "module", "descriptor 0 or 1 is closed, or another file", "the host's pipes left alone");
    } else if (waiting() != waiting_) {
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

  const Identity input_;
  const Identity output_;
  const int waiting_;
};

}  // namespace

Transfers::Transfers() : thread_([this] { work(); }) {}

void Transfers::add(std::function<void()> task) {
  const std::lock_guard guard(mutex_);
  if (ends_) return;
  ++unfinished_;
  tasks_.push(std::move(task));
  changed_.notify_one();
}

void Transfers::stop() {
  {
    const std::lock_guard guard(mutex_);
    ends_ = true;
    changed_.notify_one();
  }
  if (thread_.joinable()) thread_.join();
}

void Transfers::work() {
  std::unique_lock guard(mutex_);
  for (;;) {
    changed_.wait(guard, [this] { return ends_ || !tasks_.empty(); });
    if (ends_) return;
    const auto task = std::move(tasks_.front());
    tasks_.pop();
    guard.unlock();
    task();
    --unfinished_;
    guard.lock();
  }
}

void Course::run(const std::string& bundlePath) {
  const StandardPipes pipes;
  context_.entryPoint = load(context_.report, bundlePath);
  if (context_.entryPoint != nullptr) check();
  transfers_.stop();
  pipes.check(context_.report);
}

void Course::check() {
  module_ = std::make_unique<Module>(context_);
  if (!module_->open()) return;
  module_->examine();
  scan();
  idle(kSettling);
  if (present_.empty()) module_->note("there is no camera: only the module itself was checked");
  const auto present = present_;
  for (const auto& [id, camera] : present) work(*camera);

  // As at a shutdown: pictures that wait for their transfer are closed without it.
  transfers_.stop();
  for (const auto& [id, camera] : present_) {
    if (camera->canCapture()) camera->capture();
  }
  idle(kSettling);
  for (const auto& [id, camera] : present_) camera->checkPairs();
  module_->takeDown();
  std::this_thread::sleep_for(kSettling);
}

void Course::scan() {
  const std::vector<uint32_t> listed = module_->cameras();
  for (const uint32_t id : listed) {
    if (present_.count(id) == 0) meet(id);
  }
  const std::set<uint32_t> there(listed.begin(), listed.end());
  for (auto entry = present_.begin(); entry != present_.end();) {
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
    --context_.report.shared().cameras;
    transfers_.add([&camera] { camera.takeDown(); });
    entry = present_.erase(entry);
  }
}

void Course::meet(uint32_t id) {
  cameras_.push_back(std::make_unique<Camera>(
      *module_, id, [this](Item& item) { transfers_.add([&item] { item.data()->transfer(); }); }));
  Camera& camera = *cameras_.back();
  module_->add(&camera);
  if (!camera.open() || !camera.meet()) return camera.takeDown();
  present_[id] = &camera;
  ++context_.report.shared().cameras;
}

void Course::work(Camera& camera) {
  camera.connect();
  camera.checkSettings();
  if (camera.canCapture()) shoot(camera, 2);
  // Pictures may come by themselves, too.
  idleUntil([this] { return transfers_.isIdle(); }, kAsLongAsItTakes);
  idle(kSettling);
  findAgain(camera);
}

// The second is fired while the first may still be transferred.
void Course::shoot(Camera& camera, int times) {
  for (; times > 0; --times) {
    const uint32_t before = camera.announced();
    context_.mainThread.calling = true;
    const bool captured = camera.capture();
    context_.mainThread.calling = false;
    const auto came = [&] { return camera.announced() != before; };
    if (captured && !idleUntil(came, context_.patience)) {
      camera.fault("its Capture completed and brought no picture", "AddChild for every picture");
    }
  }
}

// A camera that was judged gone is closed on the other thread, and opened again when it is listed.
void Course::findAgain(Camera& camera) {
  const auto entry = present_.find(camera.id());
  if (entry == present_.end()) return;
  camera.checkPairs();
  present_.erase(entry);
  transfers_.add([&camera] { camera.takeDown(); });
  while (!transfers_.isIdle()) std::this_thread::sleep_for(kIdlePause);
  --context_.report.shared().cameras;
  idle(4 * kIdlePause);
  scan();
}

bool Course::idleUntil(const Condition& condition, Clock::duration longest) {
  const auto until = Clock::now() + longest;
  context_.mainThread.calling = true;
  bool holds = false;
  for (int turn = 0; !(holds = condition()) && Clock::now() < until; ++turn) {
    module_->poll();
    if (module_->hasNews()) {
      scan();
    } else if (turn % 4 == 0) {
      for (const auto& [id, camera] : present_) camera->isAlive();
    }
    std::this_thread::sleep_for(kIdlePause);
  }
  context_.mainThread.calling = false;
  return holds;
}

void Course::idle(Clock::duration time) {
  idleUntil([] { return false; }, time);
}

}  // namespace modulecheck
