// soak --minutes M --seed S: drives a helper and its virtual cameras at random for so long: shots, pairs, bursts,
// plugs, requests, transfers that fail, a full disk, kills. Ends with 1, naming the seed and the step, at the first
// message or file that must not be, and where descriptors, threads or memory grow.

#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <csignal>
#include <cstdio>
#include <random>
#include <set>
#include <thread>

#include "Helper.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr auto kSilence = 120s;  // without a message that is waited for
constexpr auto kRest = 6s;       // after that the helper has given its buffer back
#ifdef SOAK_SANITIZED
constexpr double kMinutesToJudgeMemory = 1e9;  // sanitizers hold freed memory back
#else
constexpr double kMinutesToJudgeMemory = 5;
#endif
constexpr std::ptrdiff_t kMemorySlack = 1024;  // KiB
constexpr std::size_t kDelivery = 50'000;

void require(bool met, const std::string& what) {
  if (!met) throw std::runtime_error(what);
}

struct Picture {
  std::string file;
  std::size_t size;  // no two have the same, so that an announcement tells which one it is of
  bool pair = false;
  bool lost = false;  // announced perhaps, but never complete
  std::string bytes() const { return pattern(size, static_cast<unsigned>(size)); }
};

struct Camera {
  int id;
  std::string name;
  bool seen = false;  // the host was told
  bool plugged = false;
  unsigned items = 0;         // since it was plugged in
  std::deque<Picture> due{};  // in the order of their announcements
  std::string folder() const { return std::to_string(id) + "-" + name; }
};

// A fault of a picture's data object, what it costs.
struct Fault {
  const char* text;
  bool loses;
};
constexpr Fault kFaults[] = {
    {R"("object": "item", "command": "Open", "answer": "HardwareError")", true},
    {R"("object": "data", "command": "Open", "answer": "HardwareError")", true},
    {R"("object": "data", "command": "CapStart", "capability": "Acquire", "stopAfter": 0)", true},
    {R"("object": "data", "command": "CapStart", "capability": "Acquire", "delivery": {"drop": true, "count": 99})",
     true},
    {R"("object": "data", "command": "Open", "answer": "HardwareError", "times": 1)", false},
    {R"("object": "data", "command": "CapStart", "capability": "Acquire", "delivery": {"twice": true})", false},
    {R"("object": "data", "command": "CapStart", "capability": "Acquire", "ownThread": true)", false},
    {R"("object": "data", "command": "CapStart", "capability": "Acquire", "completion": {"twice": true})", false},
    {R"("object": "data", "command": "CapGet", "capability": "StoredBytes", "answer": "HardwareError")", false},
};

struct Use {
  std::ptrdiff_t memory = 0;  // KiB
  std::ptrdiff_t descriptors = 0;
  std::ptrdiff_t threads = 0;
};

class Soak {
 public:
  explicit Soak(unsigned seed) : random_(seed) { start(); }
  void run(double minutes);
  std::string state() const;

 private:
  void start();
  void oneStep(bool kills);
  void burst();
  void shoot();
  void askAnything();
  void fullDisk();
  void killIt();
  void plugIn(Camera& camera);
  void pull(Camera& camera);

  std::vector<Picture> make(std::size_t shots, bool pairs);
  void prepare(Camera& camera, std::vector<Picture>& pictures, bool faulty, std::size_t bytesPerSecond = 0);
  void put(const Camera& camera, const std::vector<Picture>& pictures, const std::string& below = "");
  void finish();
  void settle();
  void until(const std::string& what, const std::function<bool()>& met);
  void send(const char* name, double device) { helper_->send(request(name, ++lastAsked_, device)); }

  void see(const Received& message);
  void begins(const Received& message);
  void completes(const Received& message);
  bool nothingDue() const;
  Use measure(bool rests);

  double device(const Camera& camera) const { return 256 + camera.id; }
  fs::path folderOf(const Camera& camera) const {
    return (camera.plugged ? helper_->cameras() : helper_->folder() / "drawer") / camera.folder();
  }
  std::vector<Camera*> cameras(bool plugged) {
    std::vector<Camera*> found;
    for (Camera& camera : cameras_)
      if (camera.plugged == plugged) found.push_back(&camera);
    std::shuffle(found.begin(), found.end(), random_);
    return found;
  }
  // Of the bounds, both included.
  std::size_t number(std::size_t least, std::size_t most) {
    return std::uniform_int_distribution<std::size_t>(least, most)(random_);
  }
  bool oneIn(std::size_t count) { return number(1, count) == 1; }

  std::mt19937 random_;
  std::unique_ptr<Helper> helper_;
  std::vector<Camera> cameras_;
  std::set<std::int32_t> answered_;
  std::int32_t lastAsked_ = 0;
  std::size_t lastSize_ = 0;
  int announced_ = 0;
  std::optional<Picture> current_;  // that is being received
  Camera* source_ = nullptr;        // its
  unsigned step_ = 0, files_ = 0, complete_ = 0;
};

// What the host sees.

void Soak::see(const Received& message) {
  if (message.id != 0) {
    require(message.id <= lastAsked_ && answered_.insert(message.id).second, "an answer that was not due");
    require(message.name == "ok" || message.name == "error", "an answer " + message.name);
  } else if (message.name == "deviceAdded" || message.name == "deviceRemoved") {
    const bool comes = message.name == "deviceAdded";
    for (Camera& camera : cameras_) {
      if (device(camera) != message.number("device_id")) continue;
      require(camera.seen != comes && camera.plugged == comes, message.name + " was not due");
      camera.seen = comes;
    }
  } else if (message.name == "objectWasAdded") {
    begins(message);
  } else if (message.name == "fileDownloadComplete") {
    completes(message);
  } else {
    require(message.name == "heartbeat" || message.name == "cameraSettingsChanged", "unknown: " + message.name);
  }
}

// One at a time, and those of a camera in their order. Of a camera that was pulled out any may lack.
void Soak::begins(const Received& message) {
  require(!current_ || current_->lost || !source_->plugged, "not completed: " + state());
  require(message.number("capture_id") == ++announced_, "another id");
  const auto size = static_cast<std::size_t>(message.number("file_size"));
  current_.reset();
  for (Camera& camera : cameras_) {
    for (std::size_t i = 0; i < camera.due.size() && !current_; ++i) {
      if (camera.due[i].size == size) {
        current_ = camera.due[i];
        source_ = &camera;
        camera.due.erase(camera.due.begin(), camera.due.begin() + static_cast<std::ptrdiff_t>(i) + 1);
      } else if (camera.plugged && !camera.due[i].lost) {
        break;
      }
    }
  }
  require(current_.has_value(), "announced, but not due: " + std::to_string(size));
  require(message.number("has_sidecar") == (current_->pair ? 1 : 0), "another sidecar");
  require(fs::path(message.text("file_name")).extension() == fs::path(current_->file).extension(), "another type");
}

void Soak::completes(const Received& message) {
  require(current_ && !current_->lost && message.number("capture_id") == announced_, "complete, but not due");
  const fs::path path = message.text("file_path");
  require(path.parent_path() == helper_->temporary() && readFile(path) == current_->bytes(), "other bytes");
  fs::remove(path);
  fs::remove(folderOf(*source_) / current_->file);
  current_.reset();
  ++complete_;
}

bool Soak::nothingDue() const {
  const auto whole = [](const Picture& picture) { return !picture.lost; };
  return (!current_ || current_->lost) && std::none_of(cameras_.begin(), cameras_.end(), [&](const Camera& camera) {
           return std::any_of(camera.due.begin(), camera.due.end(), whole);
         });
}

std::string Soak::state() const {
  std::string text = "step " + std::to_string(step_) + ", " + std::to_string(complete_) + " complete";
  if (current_) text += ", " + current_->file + " begun";
  for (const Camera& camera : cameras_)
    for (const Picture& picture : camera.due) text += ", " + picture.file + (picture.lost ? " lost" : " due");
  return text;
}

// Waiting.

void Soak::until(const std::string& what, const std::function<bool()>& met) {
  auto limit = Clock::now() + kSilence;
  while (!met()) {
    const auto message = helper_->next(Clock::now() + 20ms);
    if (message && message->name != "heartbeat") limit = Clock::now() + kSilence;
    if (message) see(*message);
    require(message || helper_->isRunning(), "the helper has ended: " + helper_->standardError());
    require(Clock::now() < limit, "no " + what);
  }
}

// Afterwards every request that was sent before is carried out, and no look at the cameras is older than this call.
void Soak::settle() {
  const std::int32_t before = lastAsked_;
  Clock::time_point asked{};
  until("answer", [&] {
    if (!answered_.empty() && *answered_.rbegin() > before) return true;
    if (Clock::now() > asked + 2s) {
      send("getCameraSettings", device(cameras_[0]));
      asked = Clock::now();
    }
    return false;
  });
}

// All that is due has come, and nothing stays in the folder but empty files of pictures that were only announced.
void Soak::finish() {
  until("end of what is due", [&] { return nothingDue(); });
  settle();
  current_.reset();
  for (Camera& camera : cameras_) {
    for (const Picture& picture : camera.due) fs::remove(folderOf(camera) / picture.file);
    camera.due.clear();
  }
  for (const auto& entry : fs::directory_iterator(helper_->temporary())) {
    require(entry.file_size() == 0, entry.path().string() + " stays");
    fs::remove(entry.path());
  }
}

// Pictures.

std::vector<Picture> Soak::make(std::size_t shots, bool pairs) {
  std::vector<Picture> pictures;
  const auto add = [&](const char* type, bool pair) {
    lastSize_ = (lastSize_ + number(1, 1 << number(3, 17))) % 700'000;
    pictures.push_back({std::to_string(10'000'000 + files_) + type, ++lastSize_, pair});
  };
  constexpr const char* kTypes[] = {".jpg", ".tif", ".nef", ".ndf", ".dat"};
  for (; shots > 0; --shots, ++files_) {
    const bool pair = pairs && oneIn(3);
    add(pair ? ".nef" : kTypes[number(0, 4)], pair);
    if (pair) add(".jpg", true);
  }
  return pictures;
}

// Some transfers go wrong, but not the last, whose end tells that all before it have come to theirs.
void Soak::prepare(Camera& camera, std::vector<Picture>& pictures, bool faulty, std::size_t bytesPerSecond) {
  std::string faults;
  for (Picture& picture : pictures) {
    ++camera.items;
    if (faulty && !picture.pair && oneIn(8) && &picture != &pictures.back()) {
      const Fault& fault = kFaults[number(0, std::size(kFaults) - 1)];
      faults += (faults.empty() ? "{" : ", {") + std::string(fault.text) +
                ", \"item\": " + std::to_string(camera.items) + "}";
      picture.lost = fault.loses;
    }
    camera.due.push_back(picture);
  }
  drop(folderOf(camera) / "camera.json", R"({"transfer": {"deliveryBytes": )" + std::to_string(kDelivery) +
                                             R"(, "bytesPerSecond": )" + std::to_string(bytesPerSecond) +
                                             R"(, "inModulePolls": )" + (oneIn(2) ? "true" : "false") +
                                             "}, \"faults\": [" + faults + "]}");
  settle();
}

void Soak::put(const Camera& camera, const std::vector<Picture>& pictures, const std::string& below) {
  for (const Picture& picture : pictures) drop(folderOf(camera) / (below + picture.file), picture.bytes());
}

// Steps. Each begins and ends with nothing due.

void Soak::start() {
  helper_ = std::make_unique<Helper>();
  helper_->install("Type0001Module", VIRTUAL_CAMERA_MODULE);
  cameras_ = {{1, "Studio"}, {2, "Field"}, {255, "Attic"}};
  answered_.clear();
  announced_ = 0;
  current_.reset();
  helper_->start();
  helper_->await("heartbeat");
}

void Soak::oneStep(bool kills) {
  const auto in = cameras(true);
  const auto out = cameras(false);
  const std::size_t kind = number(1, 20);
  if (in.empty() || (kind <= 4 && !out.empty())) return plugIn(*out.front());
  if (kind <= 5) return pull(*in.front());
  if (kind <= 12) return burst();
  if (kind <= 16) return shoot();
  if (kind <= 18) return askAnything();
  kills&& kind == 20 ? killIt() : fullDisk();
}

// Pictures taken with the cameras' own buttons, on several at a time. One may be pulled out in the middle.
void Soak::burst() {
  const auto all = cameras(true);
  const bool pulls = oneIn(3);
  for (Camera* const camera : all) {
    auto pictures = make(oneIn(8) ? number(100, 200) : number(1, 20), false);
    prepare(*camera, pictures, true, pulls && camera == all.front() ? 500'000 : 0);
    put(*camera, pictures);
  }
  askAnything();
  const int enough = announced_ + static_cast<int>(number(0, 5));
  if (pulls) until("picture", [&] { return announced_ >= enough || nothingDue(); });
  if (pulls) pull(*all.front());
}

// Pictures taken at the host's request.
void Soak::shoot() {
  Camera& camera = *cameras(true).front();
  send("disconnectDevice", device(camera));
  send("connectDevice", device(camera));
  const std::size_t shots = number(1, 10);
  auto pictures = make(shots, true);
  prepare(camera, pictures, true);
  put(camera, pictures, "roll/");
  settle();
  for (std::size_t shot = 0; shot < shots; ++shot) send("doCapture", 0);
}

void Soak::askAnything() {
  constexpr const char* kNames[] = {"connectDevice", "getCameraSettings", "listDevices", "getDeviceInfo", "nonsense"};
  for (std::size_t left = number(0, 20); left > 0; --left)
    send(kNames[number(0, 4)], oneIn(5) ? 70'000 : device(cameras_[number(0, 2)]));
}

// For a while there is no room for large files.
void Soak::fullDisk() {
  Camera& camera = *cameras(true).front();
  auto pictures = make(number(1, 20), false);
  const std::size_t room = std::max(number(50'000, 300'000), pictures.back().size);
  for (Picture& picture : pictures) picture.lost = picture.size > room;
  prepare(camera, pictures, false);
  const auto limit = [&](rlim_t bytes) {
    const rlimit both{bytes, RLIM_INFINITY};
    require(prlimit(helper_->pid(), RLIMIT_FSIZE, &both, nullptr) == 0, "the system takes no limit");
  };
  limit(room);
  put(camera, pictures);
  until("end of what is due", [&] { return nothingDue(); });
  limit(RLIM_INFINITY);
}

// At any moment: what was told to be complete was so.
void Soak::killIt() {
  burst();
  const auto moment = Clock::now() + std::chrono::microseconds(number(0, 50'000));
  until("moment", [&] { return Clock::now() > moment; });
  kill(helper_->pid(), SIGKILL);
  while (const auto message = helper_->next(Clock::now() + 100ms)) see(*message);
  start();
}

void Soak::plugIn(Camera& camera) {
  const fs::path drawer = folderOf(camera);
  fs::create_directories(drawer);
  camera.plugged = true;
  fs::rename(drawer, folderOf(camera));
  until("deviceAdded", [&] { return camera.seen; });
}

void Soak::pull(Camera& camera) {
  const fs::path place = folderOf(camera);
  camera.plugged = false;
  fs::rename(place, folderOf(camera));
  until("deviceRemoved", [&] { return !camera.seen; });
  settle();
  if (source_ == &camera) current_.reset();
  camera.due.clear();
  camera.items = 0;
  fs::remove_all(folderOf(camera));  // what was not sent would be the next time
}

// The run.

Use Soak::measure(bool rests) {
  for (Camera* const camera : cameras(true)) pull(*camera);
  finish();
  const auto rested = Clock::now() + (rests ? kRest : 0s);
  until("rest", [&] { return Clock::now() > rested; });
  const fs::path process = fs::path("/proc") / std::to_string(helper_->pid());
  const auto count = [&](const char* folder) {
    return std::distance(fs::directory_iterator(process / folder), fs::directory_iterator());
  };
  Use use{0, count("fd"), count("task")};
  for (int look = 0; look < 20; ++look) {  // what is open for a moment does not count
    const auto next = Clock::now() + 10ms;
    until("look", [&] { return Clock::now() > next; });
    use.descriptors = std::min(use.descriptors, count("fd"));
    use.threads = std::min(use.threads, count("task"));
  }
  std::ifstream pages(process / "statm");
  pages >> use.memory >> use.memory;  // the second is what is resident
  use.memory *= sysconf(_SC_PAGESIZE) / 1024;
  std::printf("%s, %td KiB, %td descriptors, %td threads\n", state().c_str(), use.memory, use.descriptors, use.threads);
  std::fflush(stdout);
  return use;
}

// The helper is killed in the first tenth only: after that it is one and the same.
void Soak::run(double minutes) {
  const auto began = Clock::now();
  const bool judgesMemory = minutes >= kMinutesToJudgeMemory;
  std::vector<Use> uses;
  for (const double part : {0.1, 0.2, 0.6, 1.0}) {
    do {
      ++step_;
      fs::resize_file(helper_->folder() / "stderr", 0);
      oneStep(uses.empty());
      finish();
    } while (Clock::now() - began < std::chrono::duration<double>(minutes * 60 * part));
    uses.push_back(measure(judgesMemory));
  }
  // The module may have started its own thread meanwhile.
  require(uses[3].descriptors == uses[1].descriptors && uses[3].threads <= uses[1].threads + 1, "what is open grows");
  require(!judgesMemory || uses[3].memory <= uses[2].memory + kMemorySlack, "memory grows");
  helper_->closeInput();
  require(helper_->wait() == 0, "the helper did not end well");
}

}  // namespace
}  // namespace tether

int main(int count, char** arguments) {
  const std::vector<std::string> given(arguments + 1, arguments + count);
  const double minutes = given.size() == 4 && given[0] == "--minutes" ? std::strtod(given[1].c_str(), nullptr) : 0;
  if (minutes <= 0 || given[2] != "--seed") {
    std::fprintf(stderr, "usage: soak --minutes M --seed S\n");
    return 2;
  }
  tether::Soak soak(static_cast<unsigned>(std::strtoul(given[3].c_str(), nullptr, 10)));
  try {
    soak.run(minutes);
    return 0;
  } catch (const std::exception& error) {
    std::fprintf(stderr, "seed %s, %s: %s\n", given[3].c_str(), soak.state().c_str(), error.what());
    return 1;
  }
}
