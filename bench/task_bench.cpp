// What the task does: frames out, from a payload to the pipe, and idle passes.
#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <functional>
#include <memory>
#include <stdexcept>
#include <utility>

#include "Heap.h"
#include "Measure.h"
#include "MessageNames.h"
#include "NikonTetherService.h"
#include "Suites.h"
#include "TetherTask.h"

namespace {

constexpr int kTicksAnHour = 36'000;
constexpr auto kSettled = std::chrono::milliseconds(2500);  // every timer of the task has fired by then
constexpr int kReadEvery = 128;                             // frames, which a pipe has room for

std::unique_ptr<KtLuaTETable> picture() {
  auto table = std::make_unique<KtLuaTETable>();
  table->Set(kKeyCaptureId, new KtLuaTENumber(1));
  table->Set(kKeyHasSidecar, new KtLuaTENumber(0));
  table->Set(kKeyFileName, new KtLuaTEString("Capture0001.jpg"));
  table->Set(kKeyFileSize, new KtLuaTENumber(1 << 20));
  return table;
}

// Standard output as one end of a connection of which this keeps the other, while it lives.
class HostEnd {
 public:
  explicit HostEnd(std::array<int, 2> ends) : _saved(dup(STDOUT_FILENO)), _input(ends[0]) {
    dup2(ends[1], STDOUT_FILENO);
    close(ends[1]);
    fcntl(_input, F_SETFL, O_NONBLOCK);
  }
  HostEnd(const HostEnd&) = delete;
  HostEnd& operator=(const HostEnd&) = delete;
  ~HostEnd() {
    dup2(_saved, STDOUT_FILENO);
    close(_saved);
    close(_input);
  }
  // What one read takes; 0 when there is nothing.
  std::size_t take() {
    const ssize_t got = read(_input, _bytes.data(), _bytes.size());
    return got > 0 ? static_cast<std::size_t>(got) : 0;
  }

 private:
  int _saved;
  int _input;
  std::array<char, 64 * 1024> _bytes{};
};

std::array<int, 2> makePipe() {
  std::array<int, 2> ends{};
  if (pipe(ends.data()) != 0) throw std::runtime_error("no pipe");
  return ends;
}

// One write of it is one piece at the other end.
std::array<int, 2> makePieces() {
  std::array<int, 2> ends{};
  if (socketpair(AF_UNIX, SOCK_DGRAM, 0, ends.data()) != 0) throw std::runtime_error("no socket pair");
  return ends;
}

// The host reads now and then, on the same thread: no other is to be woken, which would cost both alike.
Body sending(HostEnd& host, const std::function<void()>& send) {
  return [&host, send](benchmark::State& state) {
    int unread = 0;
    for ([[maybe_unused]] auto _ : state) {
      send();
      if (++unread % kReadEvery == 0) host.take();
    }
    host.take();
  };
}

// The passes of an hour, one behind the other, each scheduling the next as the task's do.
void measureTicks(Report& report) {
  auto& service = *NikonTetherService::getSingleton();
  platform::Timer timer;
  int ticks = 0;
  const std::function<void()> tick = [&] {
    service.idle();
    ++ticks;
    timer = platform::Timer::once(platform::Seconds::zero(), [&] { tick(); });
  };
  const auto turn = [] { platform::RunLoop::current()->runOnce(platform::Clock::now()); };
  tick();
  const auto begin = platform::Clock::now() + kSettled;
  while (platform::Clock::now() < begin) turn();
  ticks = 0;
  const std::size_t inUse = heapInUse();
  heapCalls = 0;
  while (ticks < kTicksAnHour) turn();
  const long calls = std::exchange(heapCalls, -1);
  const auto grown = static_cast<double>(heapInUse()) - static_cast<double>(inUse);
  report.add(
      {"heap calls in the 36,000 idle passes of an hour / none", static_cast<double>(calls), 1, Unit::count, 0.0});
  report.add({"memory grown in the 36,000 idle passes of an hour / none", grown, 1, Unit::bytes, 0.0});
}

}  // namespace

void measureTask(Report& report) {
  dup2(makePipe()[0], STDIN_FILENO);  // an input that does not end
  auto& task = *new TetherTask;       // like the one of the application, it lives as long as the process
  {
    HostEnd host(makePipe());
    task.awakeFromNib();
    measureTicks(report);
  }
  const KtLuaTEString name(kMessageObjectWasAdded);
  const auto payload = picture();
  const auto sendFrame = [&] { task.sendMessage(name, 0, payload.get()); };

  std::string bytes;
  int writes = 0;
  {
    HostEnd host(makePieces());
    sendFrame();
    while (const std::size_t size = host.take()) {
      ++writes;
      bytes.append(size, 'x');
    }
  }
  report.add({"writes for a frame / 1", static_cast<double>(writes), 1, Unit::count, 1.0});

  HostEnd host(makePipe());
  compare(report, "a frame out / one write of the same bytes to a pipe", 1.2, Count::processor,
          sending(host, sendFrame), sending(host, [&] {
            if (write(STDOUT_FILENO, bytes.data(), bytes.size()) < 0) throw std::runtime_error("no write");
          }));
}
