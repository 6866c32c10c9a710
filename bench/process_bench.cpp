// The helper's start, its idling and its end.
#include <dlfcn.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <stdexcept>
#include <thread>

#include "HelperProcess.h"
#include "MAID.h"
#include "Measure.h"
#include "Suites.h"

namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

constexpr int kTurns = 15;
constexpr double kStartLimit = 0.050;
constexpr double kIdleLimit = 0.01;
constexpr auto kSettled = 2s;  // behind the first idle pass
constexpr auto kIdleTime = 10s;

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
  helper.await("deviceAdded");
  return since(start);
}

double startToEnd(const std::string& program) {
  const auto begin = Clock::now();
  waitFor(start(program, {}));
  return since(begin);
}

double idleShare() {
  HelperProcess helper(BENCH_HELPER, {});
  helper.await("deviceAdded");
  std::this_thread::sleep_for(kSettled);
  const double before = helper.processorTime();
  const auto start = Clock::now();
  std::this_thread::sleep_for(kIdleTime);
  return (helper.processorTime() - before) / since(start);
}

}  // namespace

void measureProcesses(Report& report) {
  const auto [startUp, module] = medianTurns(kTurns, startUpTime, moduleTime);
  report.add({"start to first deviceAdded, without the module's own / 50 ms", std::max(startUp - module, 0.0),
              kStartLimit, Unit::seconds, 1.0});
  const auto [ours, empty] = medianTurns(
      kTurns * 3, [] { return startToEnd(BENCH_HELPER_WITHOUT_MODULES); },
      [] { return startToEnd(BENCH_EMPTY_PROGRAM); });
  report.add({"start to end at closed input, no modules / empty program", ours, empty, Unit::seconds, 1.5});
  report.add({"idle with one module, share of a core over 10 s / 1 %", idleShare(), kIdleLimit, Unit::share, 1.0});
}
