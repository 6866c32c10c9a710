// The frame reader, fed through the notification that a completed read posts, beside another library's streaming
// reader.
#include <fcntl.h>

#include <cstdlib>
#include <cstring>
#include <memory>
#include <msgpack.hpp>
#include <utility>
#include <vector>

#include "FrameWriter.h"
#include "Heap.h"
#include "KtRCMessageAccumulator.h"
#include "Measure.h"
#include "MessageNames.h"
#include "Suites.h"
#include "Tables.h"

namespace {

using Chunks = std::vector<std::shared_ptr<const platform::Data>>;

constexpr std::size_t kMiB = std::size_t{1} << 20;
constexpr std::size_t kChunk = 64 * 1024;
constexpr double kLinear = 2.3;  // for twice the work

Chunks cut(const std::string& bytes, std::size_t size) {
  Chunks chunks;
  for (std::size_t from = 0; from < bytes.size(); from += size) {
    const std::string chunk = bytes.substr(from, size);
    chunks.push_back(std::make_shared<const platform::Data>(std::vector<char>(chunk.begin(), chunk.end())));
  }
  return chunks;
}

// A whole frame of that size, cut as reads from a pipe cut it unless told.
Chunks largeFrame(std::size_t size, std::size_t chunk = kChunk) {
  const KtLuaTEData none("", 0);
  const std::size_t around = encodeFrame(0, "file", &none).size();
  const std::vector<char> bytes(size - around, 'x');
  const KtLuaTEData all(bytes.data(), static_cast<std::int32_t>(bytes.size()));
  return cut(encodeFrame(0, "file", &all), chunk);
}

std::string repeated(const std::string& one, std::size_t count) {
  std::string all;
  for (std::size_t number = 0; number < count; ++number) all += one;
  return all;
}

// Each message is taken as soon as it is announced.
Body reading(Chunks chunks) {
  return [chunks = std::move(chunks)](benchmark::State& state) {
    const auto handle = std::make_shared<platform::FileHandle>(open("/dev/null", O_RDONLY | O_CLOEXEC));
    KtRCMessageAccumulator reader(handle);
    std::size_t count = 0;
    const auto observer = platform::NotificationCenter::defaultCenter().addObserver(
        std::string(kMessageIsAvailable), &reader, [&](const auto&) { count += reader.getNextMessage() ? 1 : 0; });
    for ([[maybe_unused]] auto _ : state) {
      count = 0;
      for (const auto& chunk : chunks) {
        platform::NotificationCenter::defaultCenter().post(
            {platform::kFileHandleReadCompletionNotification, handle.get(), chunk});
      }
      if (count == 0) state.SkipWithError("no message");
    }
  };
}

// The same values as one array each, read as the library's documentation shows.
Body unpacking(const std::string& bytes, std::size_t chunk) {
  return [bytes, chunk](benchmark::State& state) {
    for ([[maybe_unused]] auto _ : state) {
      msgpack::unpacker unpacker;
      std::size_t messages = 0;
      for (std::size_t from = 0; from < bytes.size(); from += chunk) {
        const std::size_t count = std::min(chunk, bytes.size() - from);
        unpacker.reserve_buffer(count);
        std::memcpy(unpacker.buffer(), bytes.data() + from, count);
        unpacker.buffer_consumed(count);
        for (msgpack::object_handle message; unpacker.next(message);) ++messages;
      }
      if (messages == 0) state.SkipWithError("no message");
    }
  };
}

void compareFrames(Report& report, const std::string& name, double goal, const std::string& ours,
                   const std::string& theirs) {
  constexpr std::size_t kCount = 20'000;
  compare(report, name + ", chunks of 64 KiB / msgpack-cxx, streaming", goal, Count::processor,
          reading(cut(repeated(ours, kCount), kChunk)), unpacking(repeated(theirs, kCount), kChunk));
}

// What there is to do at the least: the frame's bytes come to stand in memory of its own.
void copying(benchmark::State& state) {
  const std::vector<char> source(32 * kMiB, 'x');
  for ([[maybe_unused]] auto _ : state) {
    const std::unique_ptr<void, void (*)(void*)> copy(std::malloc(source.size()), std::free);
    std::memcpy(copy.get(), source.data(), source.size());
    benchmark::DoNotOptimize(copy.get());
    benchmark::ClobberMemory();
  }
}

// What the messages of these chunks take while none is taken.
double memoryOf(const Chunks& chunks) {
  const auto handle = std::make_shared<platform::FileHandle>(open("/dev/null", O_RDONLY | O_CLOEXEC));
  KtRCMessageAccumulator reader(handle);
  const std::size_t before = heapInUse();
  for (const auto& chunk : chunks) {
    platform::NotificationCenter::defaultCenter().post(
        {platform::kFileHandleReadCompletionNotification, handle.get(), chunk});
  }
  return static_cast<double>(heapInUse() - before);
}

// Each input is about twice the one before. They are points of curves, and the last three are rows.
void addGrowth(Report& report, const std::string& metric, const std::string& series,
               const std::vector<std::pair<double, Chunks>>& inputs) {
  std::vector<Body> bodies;
  for (const auto& [x, chunks] : inputs) bodies.push_back(reading(chunks));
  const std::vector<double> times = medians(Count::processor, bodies);
  for (std::size_t index = 0; index < inputs.size(); ++index) {
    const double x = inputs[index].first;
    report.add({metric, times[index], times[0] * x / inputs[0].first, Unit::seconds, {}, Point{series, x}});
    const double memory = memoryOf(inputs[index].second);
    report.add({metric, memory, memoryOf(inputs[0].second) * x / inputs[0].first, Unit::bytes, {}, Point{series, x}});
  }
  for (std::size_t index = inputs.size() - 2; index < inputs.size(); ++index) {
    report.add({metric + (index + 1 < inputs.size() ? ": second / first" : ": third / second"), times[index],
                times[index - 1], Unit::seconds, kLinear});
  }
}

}  // namespace

void measureFrameReader(Report& report) {
  const auto tables = settings();
  const std::string heartbeat = encodeFrame(0, kMessageHeartbeat, nullptr);
  compareFrames(report, "heartbeats", 1.0, heartbeat, packedMessage(kMessageHeartbeat, nullptr));
  compareFrames(report, "frames of the 7 settings", 2.5, encodeFrame(0, kMessageCameraSettingsChanged, &tables->ours),
                packedMessage(kMessageCameraSettingsChanged, tables.get()));

  const auto large = medians(Count::processor, {reading(largeFrame(32 * kMiB)), copying});
  report.add({"a frame of 32 MiB in chunks of 64 KiB / malloc and memcpy", large[0], large[1], Unit::seconds, 1.5});

  std::vector<std::pair<double, Chunks>> inputs;
  for (const int size : {1, 2, 4, 8, 16, 32})
    inputs.emplace_back(size, largeFrame(static_cast<std::size_t>(size) * kMiB));
  addGrowth(report, "a frame of 8, 16, 32 MiB", "MiB in one frame", inputs);
  inputs.clear();
  for (const int count : {12'500, 25'000, 50'000, 100'000}) {
    const std::string all = repeated(heartbeat, static_cast<std::size_t>(count));
    inputs.emplace_back(count, cut(all, all.size()));
  }
  addGrowth(report, "25, 50, 100 thousand frames in one chunk", "frames in one chunk", inputs);
  inputs.clear();
  for (const int size : {128, 256, 512, 1024})
    inputs.emplace_back(size, largeFrame(static_cast<std::size_t>(size) * 1024, 1));
  addGrowth(report, "a frame of 1/4, 1/2, 1 MiB, 1 byte a chunk", "KiB in one frame, 1 byte a chunk", inputs);
}
