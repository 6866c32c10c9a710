// Pictures through the whole helper, beside filling a buffer and writing it.
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <thread>

#include "HelperProcess.h"
#include "Measure.h"
#include "Suites.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr std::size_t kMiB = std::size_t{1} << 20;
constexpr std::chrono::milliseconds kFirstLook{1050};
constexpr double kRoomBeside = 16.0 * kMiB;

double since(Clock::time_point start) { return std::chrono::duration<double>(Clock::now() - start).count(); }

struct Figures {
  double seconds;
  double waited;  // of these, ready while other programs had the processors
  double memory;
};

// From the first delivery of the first picture to the end of the last one.
Figures receive(int count, std::size_t bytes, const TemporaryFolder& folder) {
  HelperProcess helper(
      BENCH_HELPER_WITH_PICTURES,
      {"TMPDIR=" + folder.path(), "TETHER_BENCH_PICTURES=" + std::to_string(count) + " " + std::to_string(bytes)});
  helper.await("objectWasAdded");
  const auto start = Clock::now();
  const double waited = helper.processorWait();
  for (int number = 0; number < count; ++number) helper.await("fileDownloadComplete");
  const double seconds = since(start);
  return {seconds, helper.processorWait() - waited, helper.peakMemory()};
}

// What there is to do at the least: a new buffer filled from a piece of the source at a time, and one write of it.
Figures fillAndWrite(int count, std::size_t bytes, const TemporaryFolder& folder) {
  const std::size_t pieceSize = std::min(bytes, kMiB);
  const std::vector<char> piece(pieceSize, 'x');
  const double waited = processorWaitOf("/proc/thread-self");
  const auto start = Clock::now();
  for (int number = 0; number < count; ++number) {
    const std::unique_ptr<char, void (*)(void*)> buffer(static_cast<char*>(std::malloc(bytes)), std::free);
    if (!buffer) throw std::runtime_error("no memory for a picture");
    for (std::size_t done = 0; done < bytes; done += pieceSize) {
      std::memcpy(buffer.get() + done, piece.data(), pieceSize);
    }
    const std::string path = folder.path() + "/picture" + std::to_string(number);
    const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    const bool whole = file >= 0 && write(file, buffer.get(), bytes) == static_cast<ssize_t>(bytes);
    if (!whole || close(file) != 0) throw std::runtime_error("a picture could not be written");
  }
  const double seconds = since(start);
  return {seconds, processorWaitOf("/proc/thread-self") - waited, 0};
}

// As the clock has it, and with the time taken off that went to other programs: who sleeps between deliveries stands in
// line for a processor more often than who never lets go of it.
double measure(Report& report, const std::string& metric, int turns, int count, std::size_t bytes) {
  // Many removed files slow a file system down that is asked for new ones soon after: they stay until the end.
  std::vector<std::unique_ptr<TemporaryFolder>> folders;
  const auto nextFolder = [&]() -> const TemporaryFolder& {
    if (count == 1) folders.clear();
    return *folders.emplace_back(std::make_unique<TemporaryFolder>());
  };
  std::vector<double> memory;
  std::vector<double> ourShares;
  std::vector<double> referenceShares;
  const auto [ours, reference] = medianTurns(
      turns,
      [&] {
        const Figures figures = receive(count, bytes, nextFolder());
        memory.push_back(figures.memory);
        ourShares.push_back(figures.seconds - figures.waited);
        return figures.seconds;
      },
      [&] {
        // The helper begins to look for pictures after as long; memory that has lain idle meanwhile costs more to take.
        std::this_thread::sleep_for(kFirstLook);
        const Figures figures = fillAndWrite(count, bytes, nextFolder());
        referenceShares.push_back(figures.seconds - figures.waited);
        return figures.seconds;
      });
  report.add({metric, ours, reference, Unit::seconds, 1.5});
  report.add({"... without waits for a processor", median(ourShares), median(referenceShares), Unit::seconds, 1.5});
  return median(memory);
}

void measureOne(Report& report, std::size_t size, int turns) {
  const std::string name = "picture of " + std::to_string(size / kMiB) + " MiB, ";
  const double memory = measure(report, name + "first delivery to end / fill and write", turns, 1, size);
  const double limit = static_cast<double>(size) + kRoomBeside;
  report.add({name + "peak memory / size + 16 MiB", memory, limit, Unit::bytes, 1.0});
}

}  // namespace

void measurePictures(Report& report) {
  measureOne(report, 64 * kMiB, 9);
  measureOne(report, 512 * kMiB, 8);
  measure(report, "1,000 queued pictures of 64 KiB / the same writes", 5, 1000, 64 * 1024);
}
