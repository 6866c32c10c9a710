// Frames out, from a payload to the pipe.
#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <stdexcept>
#include <thread>

#include "Measure.h"
#include "Suites.h"
#include "TetherTask.h"

namespace {

std::unique_ptr<KtLuaTETable> picture() {
  auto table = std::make_unique<KtLuaTETable>();
  table->Set("capture_id", new KtLuaTENumber(1));
  table->Set("has_sidecar", new KtLuaTENumber(0));
  table->Set("file_name", new KtLuaTEString("Capture0001.jpg"));
  table->Set("file_size", new KtLuaTENumber(1 << 20));
  return table;
}

// Standard output as a pipe that another thread empties, while it lives.
class HostPipe {
 public:
  HostPipe() : _saved(dup(STDOUT_FILENO)) {
    std::array<int, 2> ends{};
    if (_saved < 0 || pipe(ends.data()) != 0) throw std::runtime_error("no pipe");
    dup2(ends[1], STDOUT_FILENO);
    close(ends[1]);
    _host = std::thread([this, input = ends[0]] {
      std::array<char, 64 * 1024> bytes{};
      for (ssize_t got = 0; (got = read(input, bytes.data(), bytes.size())) > 0;) _received += got;
      close(input);
    });
  }
  HostPipe(const HostPipe&) = delete;
  HostPipe& operator=(const HostPipe&) = delete;
  ~HostPipe() { end(); }
  // Bytes that went through it.
  ssize_t end() {
    if (_host.joinable()) {
      dup2(_saved, STDOUT_FILENO);
      close(_saved);
      _host.join();
    }
    return _received;
  }

 private:
  int _saved;
  ssize_t _received = 0;
  std::thread _host;
};

}  // namespace

void measureSending(Report& report) {
  auto& task = *new TetherTask;  // like the one of the application, it lives as long as the process
  task.awakeFromNib();
  const KtLuaTEString name("objectWasAdded");
  const auto payload = picture();
  HostPipe probe;
  task.sendMessage(name, 0, payload.get());
  const std::string bytes(static_cast<std::size_t>(probe.end()), 'x');

  HostPipe host;
  compare(
      report, "a frame out / one write of the same bytes to a pipe", 1.2, Count::wall,
      [&](benchmark::State& state) {
        for ([[maybe_unused]] auto _ : state) task.sendMessage(name, 0, payload.get());
      },
      [&](benchmark::State& state) {
        for ([[maybe_unused]] auto _ : state) {
          if (write(STDOUT_FILENO, bytes.data(), bytes.size()) < 0) state.SkipWithError("no write");
        }
      });
}
