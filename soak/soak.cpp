// soak --minutes M --seed S: drives a helper and its virtual cameras at random for so long, and compares what comes of
// it with a model. Ends with 1, naming the seed and the step, at the first difference.

#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>
#include <fstream>
#include <iterator>
#include <random>
#include <stdexcept>

#include "Model.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr auto kSilence = 120s;  // without a message that is waited for
constexpr auto kRepeat = 2s;
constexpr auto kRest = 6s;  // after that the helper has given its buffer back
constexpr auto kReportInterval = 20s;
constexpr unsigned kLongSession = 1000;  // pictures; what the helper keeps of each is used again by the next session
constexpr std::size_t kUsual = 10;       // one transfer in so many goes wrong
#ifdef SOAK_SANITIZED
constexpr double kMinutesToJudgeMemory = 1e9;  // sanitizers hold freed memory back
#else
constexpr double kMinutesToJudgeMemory = 5;
#endif
constexpr std::ptrdiff_t kMemorySlack = 1024;  // KiB

struct Use {
  std::ptrdiff_t memory = 0;  // KiB
  std::ptrdiff_t descriptors = 0;
  std::ptrdiff_t threads = 0;
};

class Soak {
 public:
  explicit Soak(unsigned seed) : random_(seed) {}
  void run(double minutes);
  void report(const char* when) const;
  unsigned step() const { return step_; }
  std::string log() const { return helper_.standardError(); }

 private:
  // Steps. Each begins and ends with nothing due.
  void oneStep();
  void burst(bool pulling);
  void shoot();
  void plugIn(Camera& camera);
  void pull(Camera& camera);
  void remove(Camera& camera, const std::string& file);
  void trouble(bool folderGone);

  void until(const std::string& what, const std::function<bool()>& met);
  void settle();
  void finish();
  void send(const char* name, double device, bool busy) { helper_.send(model_.ask(name, device, busy)); }
  void sendAnything(std::size_t requests, bool busy);
  Use measure(bool rests);

  Pictures make(std::size_t shots, bool pairs, const std::string& folder = {});
  void put(const Camera& camera, const Pictures& pictures) const;
  void prepare(Camera& camera, const Pictures& pictures, std::size_t faulty = kUsual, unsigned bytesPerSecond = 0,
               std::string faults = {});
  void fault(Picture& picture, unsigned item, std::size_t deliveryBytes);
  std::size_t loggedLosses() const;
  std::vector<Camera*> cameras(bool seen);

  // Of the bounds, both included; one in so many; one of these.
  std::size_t number(std::size_t least, std::size_t most) {
    return std::uniform_int_distribution<std::size_t>(least, most)(random_);
  }
  bool oneIn(std::size_t count) { return number(1, count) == 1; }
  template <typename T>
  T oneOf(std::initializer_list<T> all) {
    return all.begin()[number(0, all.size() - 1)];
  }

  std::mt19937 random_;
  Helper helper_{};
  Model model_{helper_};
  unsigned step_ = 0;
  unsigned shots_ = 0;
  Clock::time_point began_ = Clock::now();
};

// Waiting.

void Soak::until(const std::string& what, const std::function<bool()>& met) {
  auto limit = Clock::now() + kSilence;
  while (!met()) {
    if (const auto message = helper_.next(Clock::now() + 20ms)) {
      if (message->name != "heartbeat") limit = Clock::now() + kSilence;
      model_.see(*message);
      continue;
    }
    siginfo_t ended{};
    waitid(P_PID, static_cast<id_t>(helper_.pid()), &ended, WEXITED | WNOHANG | WNOWAIT);
    require(ended.si_pid == 0, "the helper has ended");
    require(Clock::now() < limit, "no " + what + "; due: " + model_.whatIsDue());
  }
}

// Afterwards every request that was sent before is carried out, and no look at the cameras is older than this call.
void Soak::settle() {
  const std::int32_t before = model_.lastAsked;
  Clock::time_point asked{};
  until("answer", [&] {
    if (model_.lastAnswered > before) return true;
    if (Clock::now() > asked + kRepeat) {
      send("getCameraSettings", model_.cameras[0].device, true);
      asked = Clock::now();
    }
    return false;
  });
}

void Soak::finish() {
  until("end of what is due", [&] { return model_.nothingDue(); });
  settle();
  model_.checkFolder();
}

// Pictures.

// No two of one size, so that an announcement tells which one it is of.
Pictures Soak::make(std::size_t shots, bool pairs, const std::string& folder) {
  std::set<std::size_t> sizes{0};
  for (const Camera& camera : model_.cameras)
    for (const auto& [file, picture] : camera.held) sizes.insert(picture.size);
  Pictures pictures;
  for (; shots > 0; --shots) {
    std::vector<std::string> types = {".nef", ".jpg"};
    if (!pairs || !oneIn(3)) types = {oneOf({".jpg", ".tif", ".nef", ".ndf", ".dat"})};
    for (const std::string& type : types) {
      Picture picture;
      while (sizes.contains(picture.size)) {
        picture.size = static_cast<std::size_t>(std::exp(std::uniform_real_distribution<double>(0, 13.5)(random_)));
        picture.size += number(0, 100);
      }
      sizes.insert(picture.size);
      picture.seed = static_cast<unsigned>(random_());
      picture.file = folder + std::to_string(10'000'000 + shots_) + type;
      pictures.emplace(picture.file, picture);
    }
    ++shots_;
  }
  return pictures;
}

void Soak::put(const Camera& camera, const Pictures& pictures) const {
  for (const auto& [file, picture] : pictures)
    drop(model_.folderOf(camera) / file, pattern(picture.size, picture.seed));
}

// What the camera will send, in its order: by name, of a pair the RAW first. Some transfers go wrong, but not the last,
// whose end tells that all before it have come to theirs.
void Soak::prepare(Camera& camera, const Pictures& pictures, std::size_t faulty, unsigned bytesPerSecond,
                   std::string faults) {
  std::vector<Picture> order;
  for (const auto& [file, made] : pictures) {
    const std::string base = file.substr(0, file.rfind('.'));
    Picture& picture = order.emplace_back();
    picture.file = file;
    picture.size = made.size;
    picture.seed = made.seed;
    picture.sidecar = pictures.contains(base + ".nef") && pictures.contains(base + ".jpg");
    if (!picture.sidecar || !file.ends_with(".nef")) continue;
    std::swap(picture, order.at(order.size() - 2));
    ++model_.figures.pairs;
  }
  const std::size_t deliveryBytes = bytesPerSecond != 0 ? 1000 : oneOf<std::size_t>({2000, 50'000, 1 << 20});
  for (Picture& picture : order) {
    Picture hit = picture;
    fault(hit, camera.items + 1, deliveryBytes);
    if (faulty != 0 && oneIn(faulty) && (&picture != &order.back() || hit.fate == Fate::whole)) {
      picture = hit;
      faults += (faults.empty() ? "" : ",\n") + hit.fault;
      ++model_.figures.failures;
    }
    camera.held[picture.file] = picture;
    camera.expect(picture);
  }
  camera.battery = static_cast<int>(number(0, 100));
  drop(model_.folderOf(camera) / "camera.json",
       R"({"settings": {"BatteryLevel": )" + std::to_string(camera.battery) + R"(}, "capture": {"polls": )" +
           std::to_string(number(1, 3)) + R"(}, "transfer": {"deliveryBytes": )" + std::to_string(deliveryBytes) +
           R"(, "bytesPerSecond": )" + std::to_string(bytesPerSecond) + R"(, "pollsPerDelivery": )" +
           std::to_string(number(1, 3)) + R"(, "inModulePolls": )" + oneOf({"true", "false"}) + "},\n\"faults\": [" +
           faults + "]}");
}

void Soak::fault(Picture& picture, unsigned item, std::size_t deliveryBytes) {
  struct Kind {
    std::string text;
    Fate fate = Fate::whole;
    bool opens = true;
    bool knownPair = true;
    std::pair<std::size_t, std::size_t> hole{};  // where it begins, how long it is
    bool sent = false;
  };
  const std::size_t deliveries = (picture.size + deliveryBytes - 1) / deliveryBytes;
  const std::size_t piece = number(0, deliveries - 1);
  const Fate lost = deliveries > 1 ? Fate::begun : Fate::unseen;
  const std::string open = R"("command": "Open", "answer": "HardwareError")";
  const std::string acquire = R"("object": "data", "command": "CapStart", "capability": "Acquire", )";
  const std::string drops = acquire + R"("delivery": {"drop": true, "first": )";
  const Kind kind = oneOf<Kind>({
      {R"("object": "item", )" + open, Fate::unseen, false},
      {R"("object": "data", )" + open, Fate::unseen, true, false},
      {R"("object": "data", "times": 1, )" + open, Fate::whole, true, false},  // the download thread opens it
      {acquire + R"("stopAfter": )" + std::to_string(piece), piece > 0 ? Fate::begun : Fate::unseen},
      {drops + std::to_string(deliveries - 1) + "}", lost, true, true, {}, true},
      {drops + "0}", deliveries > 1 ? Fate::whole : lost, true, true, {0, std::min(deliveryBytes, picture.size)}, true},
      {acquire + R"("delivery": {"twice": true, "count": )" + std::to_string(deliveries) + "}"},
      {acquire + R"("ownThread": true)"},
      {acquire + R"("completion": {"twice": true})"},
      {acquire + R"("completion": {"result": "DataTransFailure"})"},
      {R"("object": "data", "command": "CapGet", "capability": "StoredBytes", "answer": "HardwareError")"},
  });
  picture.fate = kind.fate;
  picture.opens = kind.opens;
  picture.knownPair = kind.knownPair;
  picture.hole = kind.hole;
  picture.sent = kind.sent;
  picture.fault = "{" + kind.text + R"(, "item": )" + std::to_string(item) + "}";
}

std::vector<Camera*> Soak::cameras(bool seen) {
  std::vector<Camera*> found;
  for (Camera& camera : model_.cameras)
    if (camera.seen == seen) found.push_back(&camera);
  std::shuffle(found.begin(), found.end(), random_);
  return found;
}

// Steps.

void Soak::oneStep() {
  const std::vector<Camera*> in = cameras(true);
  const std::vector<Camera*> out = cameras(false);
  const auto worn = std::find_if(in.begin(), in.end(), [](const Camera* c) { return c->items > kLongSession; });
  const std::size_t kind = number(1, 20);
  if (worn != in.end()) {
    pull(**worn);
  } else if (in.empty() || (kind <= 4 && !out.empty())) {
    plugIn(*out.front());
  } else if (kind <= 5) {
    pull(*in.front());
  } else if (kind <= 14) {
    burst(kind <= 8);
  } else if (kind <= 17) {
    shoot();
  } else if (kind <= 18) {
    sendAnything(number(5, 30), false);
  } else {
    trouble(kind == 20);
  }
}

// Pictures taken with the cameras' own buttons, on several at a time. One camera may be pulled out in the middle.
void Soak::burst(bool pulling) {
  std::vector<Camera*> chosen = cameras(true);
  chosen.resize(number(1, chosen.size()));
  const auto slowness = oneOf({1U, 200'000U, 5'000'000U});  // bytes a second
  std::map<Camera*, Pictures> taken;
  for (Camera* const camera : chosen) {
    taken[camera] = make(oneIn(8) ? number(100, 300) : number(1, 20), false);
    prepare(*camera, taken[camera], kUsual, pulling && camera == chosen.front() ? slowness : 0);
  }
  settle();
  for (const auto& [camera, pictures] : taken) put(*camera, pictures);
  if (!pulling) return sendAnything(number(0, 10), true);
  const unsigned enough = model_.announced + static_cast<unsigned>(number(0, slowness == 1 ? 1 : 5));
  until("picture", [&] { return model_.announced >= enough || model_.nothingDue(); });
  pull(*chosen.front());
}

// Pictures taken at the host's request. A shutter that fails leaves its shot for the next time.
void Soak::shoot() {
  if (model_.connected == nullptr) send("connectDevice", cameras(true).front()->device, false);
  Camera& camera = *model_.connected;
  const std::size_t shots = number(1, 10);
  const Pictures pictures = make(shots, true, "roll/");
  const bool fails = oneIn(3);
  const std::string fault =
      R"({"object": "camera", "command": "CapStart", "capability": "Capture", "times": 1, )" +
      oneOf<std::string>({R"("answer": "HardwareError")", R"("completion": {"result": "CaptureFailure"})"}) +
      R"(, "skip": )" + std::to_string(number(0, shots - 1)) + "}";
  prepare(camera, pictures, kUsual, 0, fails ? fault : "");
  put(camera, pictures);
  settle();
  for (std::size_t shot = 0; shot < shots + (fails ? 1 : 0); ++shot) send("doCapture", 0, true);
}

void Soak::sendAnything(std::size_t requests, bool busy) {
  for (; requests > 0; --requests) {
    const double known = model_.cameras[number(0, model_.cameras.size() - 1)].device;
    const double device = oneIn(5) ? oneOf({0.0, 259.0, 513.0, 70'000.0}) : known;
    send(oneOf({"connectDevice", "connectDevice", "getCameraSettings", "getCameraSettings", "listDevices",
                "disconnectDevice", "getDeviceInfo", "startDownload", "heartbeat", "nonsense"}),
         device, busy);
  }
}

// With pictures on its card; later with those that were taken while it was out of sight, or not sent the last time.
void Soak::plugIn(Camera& camera) {
  Pictures pictures = make(oneIn(4) ? number(50, 200) : number(1, 10), true);
  put(camera, pictures);
  pictures.insert(camera.held.begin(), camera.held.end());
  prepare(camera, camera.known ? pictures : Pictures());
  const fs::path drawer = model_.folderOf(camera);
  camera.plugged = true;
  fs::rename(drawer, model_.folderOf(camera));
  until("deviceAdded", [&] { return camera.seen; });
  camera.known = true;
  if (step_ != 1) return;
  // Brings what is made once: buffers, the module's thread.
  pictures = make(number(1, 10), false);
  prepare(camera, pictures, 0, 0, R"({"object": "data", "command": "CapStart", "ownThread": true})");
  settle();
  put(camera, pictures);
}

void Soak::pull(Camera& camera) {
  const fs::path place = model_.folderOf(camera);
  camera.plugged = false;
  fs::rename(place, model_.folderOf(camera));
  until("deviceRemoved", [&] { return !camera.seen; });
  settle();
  model_.forget(camera);
  const Pictures held = camera.held;
  for (const auto& [file, picture] : held)
    if (picture.sent || file.starts_with("roll/")) remove(camera, file);
}

// It will not come, or not be known whether it does.
void Soak::remove(Camera& camera, const std::string& file) {
  fs::remove(model_.folderOf(camera) / file);
  camera.held.erase(file);
}

// For a while there is no room for large files, or no folder.
void Soak::trouble(bool folderGone) {
  Camera& camera = *cameras(true).front();
  const Pictures pictures = make(number(1, 20), false);
  prepare(camera, pictures, 0);
  settle();
  const rlim_t room = std::max(number(50'000, 200'000), camera.due.back().size);
  std::vector<std::string> lost;
  for (Picture& picture : camera.due) {
    if (!folderGone && picture.size <= room) continue;
    picture.fate = folderGone ? Fate::unseen : Fate::begun;
    lost.push_back(picture.file);
  }
  model_.figures.failures += static_cast<unsigned>(lost.size());
  const auto limit = [&](rlim_t bytes) {
    const rlimit both{bytes, RLIM_INFINITY};
    require(prlimit(helper_.pid(), RLIMIT_FSIZE, &both, nullptr) == 0, "the system takes no limit");
  };
  const fs::path away = helper_.folder() / "away";
  const std::size_t before = loggedLosses();
  if (folderGone) {
    fs::rename(helper_.temporary(), away);
    put(camera, pictures);
    until("log lines", [&] { return loggedLosses() >= before + lost.size(); });
    settle();
    camera.due.clear();
    fs::rename(away, helper_.temporary());
  } else {
    limit(room);
    put(camera, pictures);
    until("end of what is due", [&] { return model_.nothingDue(); });
    limit(RLIM_INFINITY);
  }
  for (const std::string& file : lost) remove(camera, file);
  require(loggedLosses() == before + lost.size(), "not one log line for each lost picture");
  require(fs::is_empty(helper_.temporary()), "a file stays of a picture that could not be written");
}

std::size_t Soak::loggedLosses() const {
  const std::string log = helper_.standardError();
  std::size_t lines = 0;
  for (const char* line : {"Could not create a file for Capture", "Writing /"})
    for (auto at = log.find(line); at != std::string::npos; at = log.find(line, at + 1)) ++lines;
  return lines;
}

// The run.

Use Soak::measure(bool rests) {
  for (Camera* const camera : cameras(true)) pull(*camera);
  finish();
  const auto rested = Clock::now() + (rests ? kRest : 0s);
  until("rest", [&] { return Clock::now() > rested; });
  const fs::path process = fs::path("/proc") / std::to_string(helper_.pid());
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
  return use;
}

void Soak::report(const char* when) const {
  const Figures& all = model_.figures;
  const double seconds = std::chrono::duration<double>(Clock::now() - began_).count();
  std::printf("%s: %.0f s, %u steps, %u pictures, %u pairs, %u plugs, %u requests, %.1f MB, %u failures\n", when,
              seconds, step_, all.pictures, all.pairs, all.plugs, all.requests, static_cast<double>(all.bytes) / 1e6,
              all.failures);
  std::fflush(stdout);
}

void Soak::run(double minutes) {
  helper_.install("Type0001Module", VIRTUAL_CAMERA_MODULE);
  helper_.limitFileSize(RLIM_INFINITY);  // for a start
  helper_.start();
  helper_.await("heartbeat");
  const bool judgesMemory = minutes >= kMinutesToJudgeMemory;
  auto reported = Clock::now();
  std::vector<Use> uses;
  for (const double part : {0.1, 0.5, 1.0}) {
    do {
      ++step_;
      fs::resize_file(helper_.folder() / "stderr", 0);
      oneStep();
      finish();
      if (Clock::now() < reported + kReportInterval) continue;
      report("so far");
      reported = Clock::now();
    } while (Clock::now() - began_ < std::chrono::duration<double>(minutes * 60 * part));
    uses.push_back(measure(judgesMemory));
  }
  report("in all");
  for (const auto& [when, use] : {std::pair("start", uses[0]), {"middle", uses[1]}, {"end", uses[2]}})
    std::printf("%s: %td KiB, %td descriptors, %td threads\n", when, use.memory, use.descriptors, use.threads);
  require(uses[2].descriptors == uses[0].descriptors && uses[2].threads == uses[0].threads,
          "descriptors or threads grow");
  require(!judgesMemory || uses[2].memory <= uses[1].memory + kMemorySlack, "memory grows");
  helper_.closeInput();
  require(helper_.wait() == 0, "the helper did not end well");
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
  const auto seed = static_cast<unsigned>(std::strtoul(given[3].c_str(), nullptr, 10));
  tether::Soak soak(seed);
  try {
    soak.run(minutes);
    return 0;
  } catch (const std::exception& error) {
    soak.report("until then");
    std::fprintf(stderr, "%s\nseed %u, step %u: %s\n", soak.log().c_str(), seed, soak.step(), error.what());
    return 1;
  }
}
