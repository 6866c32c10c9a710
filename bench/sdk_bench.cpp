// What the camera side does around the SDK: callbacks carried to the download thread, and polling.
#include <poll.h>
#include <unistd.h>

#include <array>
#include <ctime>
#include <memory>
#include <stdexcept>
#include <thread>

#include "MAID.h"
#include "Measure.h"
#include "NikonDownloadThread.h"
#include "NikonThreadedObject.h"
#include "Suites.h"

namespace {

constexpr std::uint32_t kPolls = 200;  // until a transfer ends
constexpr timespec kPause{0, 10'000};

// A module that is as cheap as can be: everything succeeds, nothing is announced, what is started ends after kPolls.
std::uint32_t polls = 0;
NkMAIDCompletionProc* pending = nullptr;
void* pendingReference = nullptr;

std::int32_t cheapModule(tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter,
                         std::uint32_t dataType, std::uint64_t data, NkMAIDCompletionProc* completion,
                         void* reference) {
  if (command == kNkMAIDCommand_GetCapCount) *reinterpret_cast<std::uint32_t*>(data) = 0;
  if (command == kNkMAIDCommand_CapStart) {
    polls = 0;
    pending = completion;
    pendingReference = reference;
  }
  if (command == kNkMAIDCommand_Async && ++polls == kPolls && pending != nullptr) {
    pending(object, command, parameter, dataType, data, pendingReference, kNkMAIDResult_NoError);
  }
  return kNkMAIDResult_NoError;
}

class Module : public CNikonObject {
 public:
  Module() : CNikonObject(cheapModule, "module") { openGate(); }
  Module(const Module&) = delete;
  Module& operator=(const Module&) = delete;
  ~Module() override { closeGate(); }
};

class Item : public CNikonThreadedObject {
 public:
  explicit Item(CNikonObject* module) : CNikonThreadedObject(module, 1, "item") { openGate(); }
  Item(const Item&) = delete;
  Item& operator=(const Item&) = delete;
  ~Item() override { closeGate(); }
  std::int32_t dataCallback_thread(void* /*info*/, void* /*data*/) override { return 1; }
};

void carrying(benchmark::State& state) {
  Module module;
  Item item(&module);
  NikonDownloadThread download;
  const auto thread = platform::Thread::make([&] { download.threadMain(); });
  thread->start();
  item.setDownloadThread(&download);
  for ([[maybe_unused]] auto _ : state) {
    if (item.dataCallback(nullptr, nullptr) != 1) state.SkipWithError("not carried");
  }
  thread->cancel();
  thread->join();
}

struct Pipe {
  Pipe() {
    if (pipe(ends.data()) != 0) throw std::runtime_error("no pipe");
  }
  Pipe(const Pipe&) = delete;
  Pipe& operator=(const Pipe&) = delete;
  ~Pipe() {
    close(ends[0]);
    close(ends[1]);
  }
  void send(char byte) const {
    if (write(ends[1], &byte, 1) != 1) throw std::runtime_error("a pipe cannot be written");
  }
  char receive() const {
    pollfd ready{ends[0], POLLIN, 0};
    ::poll(&ready, 1, -1);
    char byte = 0;
    if (read(ends[0], &byte, 1) != 1) throw std::runtime_error("a pipe cannot be read");
    return byte;
  }
  std::array<int, 2> ends{};
};

// A byte there and a byte back, each waited for in poll.
void handingOver(benchmark::State& state) {
  const Pipe there;
  const Pipe back;
  std::thread other([&] {
    while (there.receive() != 0) back.send(1);
  });
  for ([[maybe_unused]] auto _ : state) {
    there.send(1);
    back.receive();
  }
  there.send(0);
  other.join();
}

void waitingForTransfer(benchmark::State& state) {
  Module module;
  for ([[maybe_unused]] auto _ : state) module.capStart(kNkMAIDCapability_Acquire, &module, nullptr);
}

void bareLoop(benchmark::State& state) {
  tagNkMAIDObject object{};
  for ([[maybe_unused]] auto _ : state) {
    for (std::uint32_t poll = 0; poll < kPolls; ++poll) {
      cheapModule(&object, kNkMAIDCommand_Async, 0, kNkMAIDDataType_Null, 0, nullptr, nullptr);
      nanosleep(&kPause, nullptr);
    }
  }
}

}  // namespace

void measureSdkSide(Report& report) {
  compare(report, "callback to the download thread / hand-over by pipe and poll", 1.3, Count::wall, carrying,
          handingOver);
  compare(report, "200 polls of a waiting transfer / bare call and 10 us sleep", 1.05, Count::wall, waitingForTransfer,
          bareLoop);
}
