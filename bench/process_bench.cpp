// The helper's start, its idling and its end.
#include <dlfcn.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <csignal>
#include <stdexcept>
#include <thread>
#include <utility>
#include <vector>

#include "FrameWriter.h"
#include "HelperProcess.h"
#include "KtLuaTableMarshalling.h"
#include "MAID.h"
#include "Measure.h"
#include "MessageNames.h"
#include "Suites.h"

namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

constexpr int kTurns = 15;
constexpr double kStartLimit = 0.050;
constexpr double kIdleLimit = 0.01;
constexpr auto kSettled = 2s;  // behind the first idle pass
constexpr auto kIdleTime = 10s;
constexpr double kIdleSeconds = 10;
constexpr std::size_t kSmallRequests = std::size_t{6} << 20;
constexpr std::size_t kSentBefore = std::size_t{100} << 20;
constexpr double kNoCamera = 0x01FF;
constexpr int kSleeperWait = 77;  // milliseconds: about as often as the helper, which is made up for

double since(Clock::time_point start) { return std::chrono::duration<double>(Clock::now() - start).count(); }

// Opens the module, lists its cameras, and opens and names each, as is needed for telling of them.
void useModule() {
  void* const image = dlopen(BENCH_MODULE, RTLD_NOW | RTLD_LOCAL);
  void* const function = image == nullptr ? nullptr : dlsym(image, "MAIDEntryPoint");
  if (function == nullptr) throw std::runtime_error("the module cannot be loaded");
  const auto entry = reinterpret_cast<NkMAIDEntryPoint*>(function);
  const auto call = [entry](tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter,
                            std::uint32_t dataType, void* data) {
    entry(object, command, parameter, dataType, reinterpret_cast<std::uint64_t>(data), nullptr, nullptr);
  };
  tagNkMAIDObject module{};
  call(nullptr, kNkMAIDCommand_Open, 0, kNkMAIDDataType_ObjectPtr, &module);
  std::array<std::uint32_t, 256> ids{};
  tagNkMAIDEnum children{};
  call(&module, kNkMAIDCommand_CapGet, kNkMAIDCapability_Children, kNkMAIDDataType_EnumPtr, &children);
  children.elements = ids.data();
  call(&module, kNkMAIDCommand_CapGetArray, kNkMAIDCapability_Children, kNkMAIDDataType_EnumPtr, &children);
  if (children.elementCount < 1) throw std::runtime_error("the module has no camera");
  for (std::uint32_t index = 0; index < children.elementCount; ++index) {
    tagNkMAIDObject camera{};
    std::array<char, kNkMAIDStringSize> name{};
    call(&module, kNkMAIDCommand_Open, ids.at(index), kNkMAIDDataType_ObjectPtr, &camera);
    call(&camera, kNkMAIDCommand_CapGet, kNkMAIDCapability_Name, kNkMAIDDataType_StringPtr, name.data());
    call(&camera, kNkMAIDCommand_Close, 0, kNkMAIDDataType_Null, nullptr);
  }
  call(&module, kNkMAIDCommand_Close, 0, kNkMAIDDataType_Null, nullptr);
}

// In a process of its own, which has not loaded it before.
double moduleTime() {
  std::array<int, 2> ends{};
  if (pipe(ends.data()) != 0) throw std::runtime_error("no pipe");
  const pid_t child = fork();
  if (child == 0) {
    const auto start = Clock::now();
    useModule();
    const double seconds = since(start);
    _exit(write(ends[1], &seconds, sizeof seconds) == sizeof seconds ? 0 : 1);
  }
  close(ends[1]);
  double seconds = 0;
  const bool told = read(ends[0], &seconds, sizeof seconds) == sizeof seconds;
  close(ends[0]);
  waitFor(child);
  if (!told) throw std::runtime_error("the module's time could not be taken");
  return seconds;
}

double startUpTime() {
  const auto start = Clock::now();
  HelperProcess helper(BENCH_HELPER, {});
  helper.await(kMessageDeviceAdded);
  return since(start);
}

double startToEnd(const std::string& program) {
  const auto begin = Clock::now();
  waitFor(start(program, {}));
  return since(begin);
}

// A process that wakes again and again for nothing. Like all that have an input and can be woken, it watches two pipes.
pid_t startSleeper() {
  const pid_t child = fork();
  if (child != 0) return child;
  std::array<pollfd, 2> watched{};
  for (pollfd& input : watched) {
    std::array<int, 2> ends{};
    if (pipe(ends.data()) != 0) _exit(1);
    input = {ends[0], POLLIN, 0};
  }
  while (true) poll(watched.data(), watched.size(), kSleeperWait);
}

struct Idle {
  double ours;     // processor time in kIdleTime, in seconds
  double sleeper;  // of a process that wakes as often, at the same time
};

Idle idle(const char* program, int cameras) {
  HelperProcess helper(program, {"TETHER_BENCH_CAMERAS=" + std::to_string(cameras)});
  helper.await(kMessageDeviceAdded);
  const pid_t sleeper = startSleeper();
  std::this_thread::sleep_for(kSettled);
  const auto now = [](pid_t process) { return std::pair(processorTimeOf(process), sleepsOf(process)); };
  const auto before = std::pair(now(helper.process()), now(sleeper));
  std::this_thread::sleep_for(kIdleTime);
  const auto after = std::pair(now(helper.process()), now(sleeper));
  kill(sleeper, SIGKILL);
  waitFor(sleeper);
  const double sleeps = after.first.second - before.first.second;
  const double sleeperSleeps = after.second.second - before.second.second;
  return {after.first.first - before.first.first, (after.second.first - before.second.first) * sleeps / sleeperSleeps};
}

// Start until the last camera is told, and the memory by then.
void addCameras(Report& report) {
  const std::string name = "cameras of one module";
  double seconds = 0;
  double bytes = 0;
  for (const int cameras : {1, 32, 64, 128, 255}) {
    std::vector<double> times;
    std::vector<double> memory;
    for (int turn = 0; turn < kTurns; ++turn) {
      const auto start = Clock::now();
      HelperProcess helper(BENCH_HELPER_WITH_PICTURES, {"TETHER_BENCH_CAMERAS=" + std::to_string(cameras)});
      for (int camera = 0; camera < cameras; ++camera) helper.await(kMessageDeviceAdded);
      times.push_back(since(start));
      memory.push_back(helper.peakMemory());
    }
    if (cameras == 1) seconds = median(times);
    if (cameras == 1) bytes = median(memory);
    report.add(
        {"start to the last deviceAdded", median(times), seconds, Unit::seconds, {}, Point{name, 1.0 * cameras}});
    report.add({"peak memory", median(memory), bytes, Unit::bytes, {}, Point{name, 1.0 * cameras}});
  }
}

// 6 MiB of requests that nothing is done for, and one that is answered.
std::string smallRequests() {
  std::string all;
  while (all.size() < kSmallRequests) all += encodeFrame(1, kMessageGetDeviceInfo, nullptr);
  KtLuaTETable nobody;
  nobody.Set(kKeyDeviceId, new KtLuaTENumber(kNoCamera));
  return all + encodeFrame(1, kMessageConnectDevice, &nobody);
}

void addRequests(Report& report) {
  const std::string requests = smallRequests();
  std::vector<double> first;
  std::vector<double> later;
  for (int turn = 0; turn < 5; ++turn) {
    HelperProcess helper(BENCH_HELPER_WITH_PICTURES, {"TETHER_BENCH_CAMERAS=1"});
    helper.await(kMessageDeviceAdded);
    const auto answered = [&] {
      const auto begin = Clock::now();
      helper.send(requests);
      helper.await("error");
      return since(begin);
    };
    first.push_back(answered());
    for (std::size_t sent = 0; sent < kSentBefore; sent += requests.size()) answered();
    later.push_back(answered());
  }
  report.add({"6 MiB of small requests after 100 MiB / at first", median(later), median(first), Unit::seconds, 1.2});
}

}  // namespace

void measureProcesses(Report& report) {
  const auto [startUp, module] = medianTurns(kTurns, startUpTime, moduleTime);
  report.add({"start to first deviceAdded, without the module's own / 50 ms", std::max(startUp - module, 0.0),
              kStartLimit, Unit::seconds, 1.0});
  const auto [whole, empty] = medianTurns(
      kTurns * 3, [] { return startToEnd(BENCH_HELPER_WITHOUT_MODULES); },
      [] { return startToEnd(BENCH_EMPTY_PROGRAM); });
  report.add({"start to end at closed input, no modules / empty program", whole, empty, Unit::seconds, 1.5});
  std::vector<Idle> one;
  std::vector<Idle> all;
  for (int turn = 0; turn < 3; ++turn) {
    one.push_back(idle(BENCH_HELPER_WITH_PICTURES, 10));
    all.push_back(idle(BENCH_HELPER_WITH_ALL_MODULES, 10));
  }
  const auto middle = [](const std::vector<Idle>& turns, double Idle::*figure) {
    std::vector<double> figures;
    for (const Idle& turn : turns) figures.push_back(turn.*figure);
    return median(figures);
  };
  const double ours = middle(one, &Idle::ours);
  report.add(
      {"idle with one module, share of a core over 10 s / 1 %", ours / kIdleSeconds, kIdleLimit, Unit::share, 1.0});
  report.add({"idle with one module / a bare poll loop that wakes as often", ours, middle(one, &Idle::sleeper),
              Unit::seconds, 1.3});
  report.add(
      {"idle with 17 modules of 10 cameras / 17 times one", middle(all, &Idle::ours), 17 * ours, Unit::seconds, 1.0});
  addRequests(report);
  addCameras(report);
}
