// The frame reader, fed through the notification that a completed read posts.
#include <fcntl.h>

#include <cstring>
#include <memory>
#include <sstream>

#include "KtRCMessageAccumulator.h"
#include "Measure.h"
#include "Suites.h"

namespace {

using Chunks = std::vector<std::shared_ptr<const platform::Data>>;

constexpr std::size_t kMiB = std::size_t{1} << 20;
constexpr std::size_t kChunk = 64 * 1024;
constexpr double kLinear = 2.3;  // for twice the work

std::string frame(const char* name, const KtLuaTE& data) {
  std::ostringstream body;
  KtLuaTEString(name).writeToStream(body);
  data.writeToStream(body);
  const std::string bytes = body.str();
  const std::int32_t id = 0;
  const auto length = static_cast<std::int32_t>(sizeof id + bytes.size());
  std::string whole(sizeof length + sizeof id, '\0');
  std::memcpy(whole.data(), &length, sizeof length);
  std::memcpy(whole.data() + sizeof length, &id, sizeof id);
  return whole + bytes;
}

Chunks cut(const std::string& bytes, std::size_t size) {
  Chunks chunks;
  for (std::size_t from = 0; from < bytes.size(); from += size) {
    const std::string chunk = bytes.substr(from, size);
    chunks.push_back(std::make_shared<const platform::Data>(std::vector<char>(chunk.begin(), chunk.end())));
  }
  return chunks;
}

// A whole frame of that size, cut as reads from a pipe cut it.
Chunks largeFrame(std::size_t size) {
  const std::size_t around = frame("file", KtLuaTEData("", 0)).size();
  const std::vector<char> bytes(size - around, 'x');
  return cut(frame("file", KtLuaTEData(bytes.data(), static_cast<std::int32_t>(bytes.size()))), kChunk);
}

Chunks smallFrames(int count) {
  const std::string one = frame("heartbeat", KtLuaTENil());
  std::string all;
  for (int number = 0; number < count; ++number) all += one;
  return cut(all, all.size());
}

Body reading(Chunks chunks) {
  return [chunks = std::move(chunks)](benchmark::State& state) {
    const auto handle = std::make_shared<platform::FileHandle>(open("/dev/null", O_RDONLY | O_CLOEXEC));
    KtRCMessageAccumulator reader(handle);
    for ([[maybe_unused]] auto _ : state) {
      for (const auto& chunk : chunks) {
        platform::NotificationCenter::defaultCenter().post(
            {platform::kFileHandleReadCompletionNotification, handle.get(), chunk});
      }
      if (!reader.getNextMessage()) state.SkipWithError("no message");
      while (reader.getNextMessage()) {
      }
    }
  };
}

void copying(benchmark::State& state) {
  const std::vector<char> source(32 * kMiB, 'x');
  std::vector<char> destination(source.size());
  for ([[maybe_unused]] auto _ : state) {
    std::memcpy(destination.data(), source.data(), source.size());
    benchmark::DoNotOptimize(destination.data());
    benchmark::ClobberMemory();
  }
}

void addGrowth(Report& report, const std::string& metric, const std::vector<double>& times) {
  for (std::size_t index = 1; index < times.size(); ++index) {
    report.add({metric + (index == 1 ? ": second / first" : ": third / second"), times[index], times[index - 1],
                Unit::seconds, kLinear});
  }
}

}  // namespace

void measureFrameReader(Report& report) {
  const auto large = medians(Count::processor, {reading(largeFrame(8 * kMiB)), reading(largeFrame(16 * kMiB)),
                                                reading(largeFrame(32 * kMiB)), copying});
  report.add({"a frame of 32 MiB in chunks of 64 KiB / memcpy of 32 MiB", large[2], large[3], Unit::seconds, {}});
  addGrowth(report, "a frame of 8, 16, 32 MiB", {large[0], large[1], large[2]});
  addGrowth(report, "25, 50, 100 thousand frames in one chunk",
            medians(Count::processor,
                    {reading(smallFrames(25'000)), reading(smallFrames(50'000)), reading(smallFrames(100'000))}));
}
