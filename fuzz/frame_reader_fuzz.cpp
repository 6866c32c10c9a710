// Any bytes through the frame reader, in one piece and in several chunkings: the messages are the same, no reader waits
// long before it looks at what it has, and where the stream is in step a good frame is read. The first byte of the
// input chooses the chunks.
#include <unistd.h>

#include <algorithm>
#include <array>
#include <memory>
#include <string>
#include <vector>

#include "Input.h"
#include "KtNSDataStreamBuf.h"
#include "KtRCMessageAccumulator.h"
#include "Log.h"

using testkit::check;

// A friend of the reader.
struct KtRCMessageAccumulatorTest {
  static std::int64_t bytesToSkip(const KtRCMessageAccumulator& reader) { return reader._bytesToSkip; }
  static std::int64_t bytesNeeded(const KtRCMessageAccumulator& reader) { return reader._bytesNeeded; }
  // A reader inside an element may wait for more before it looks at what it has.
  static void decodeNow(KtRCMessageAccumulator& reader) {
    reader._bytesNeeded = 0;
    reader.formMessagesWithData({});
  }
};

namespace {

constexpr std::int64_t kMostFiller = 4096;
constexpr std::size_t kMostSingleBytes = 128;

std::string goodFrame() {
  const std::array<char, 30> bytes = {26, 0,   0,   0,   7,   0,   0,   0,   3,   0,   0, 0, 10, 0, 0,
                                      0,  'h', 'e', 'a', 'r', 't', 'b', 'e', 'a', 't', 0, 1, 0,  0, 0};
  return {bytes.data(), bytes.size()};
}

// A handle that never becomes readable.
const std::shared_ptr<platform::FileHandle>& silentHandle() {
  static const auto* const handle = [] {
    platform::setLogSink([](const std::string&) {});
    static std::array<int, 2> ends{};
    check(pipe(ends.data()) == 0, "there is a pipe");
    return new std::shared_ptr<platform::FileHandle>(new platform::FileHandle(ends[0]));
  }();
  return *handle;
}

void feed(const KtRCMessageAccumulator& reader, const char* bytes, std::size_t count) {
  const std::size_t before = reader.accumulatedLength();
  platform::NotificationCenter::defaultCenter().post(
      {platform::kFileHandleReadCompletionNotification, silentHandle().get(),
       std::make_shared<platform::Data>(std::vector<char>(bytes, bytes + count))});
  check(reader.accumulatedLength() <= before + count, "no more is kept than came");
  check(reader.accumulatedLength() <= static_cast<std::size_t>(kLargestFrame), "no more is kept than a frame's limit");
}

std::string describe(const KtLuaTE* element) {
  if (element == nullptr) return "none";
  KtNSDataWriteStreamBuf buffer;
  std::ostream out(&buffer);
  element->writeToStream(out);
  std::string bytes(buffer.getNSData()->bytes(), buffer.getNSData()->length());
  // Keys may stand in another order, but their bytes are the same.
  std::sort(bytes.begin(), bytes.end());
  return bytes;
}

std::vector<std::string> takeMessages(KtRCMessageAccumulator& reader) {
  std::vector<std::string> messages;
  while (const auto message = reader.getNextMessage()) {
    messages.push_back(std::to_string(message->id) + ' ' + std::to_string(message->length) + ' ' +
                       describe(message->name.get()) + ' ' + describe(message->data.get()));
  }
  return messages;
}

void checkInStep(KtRCMessageAccumulator& reader) {
  const std::int64_t skip = KtRCMessageAccumulatorTest::bytesToSkip(reader);
  if (reader.currentMessageStage() != 0 || reader.accumulatedLength() != 0 || skip > kMostFiller) return;
  const std::string bytes = std::string(static_cast<std::size_t>(skip), '\x03') + goodFrame();
  feed(reader, bytes.data(), bytes.size());
  const auto message = reader.getNextMessage();
  check(message != nullptr && message->id == 7, "a good frame is read");
  check(static_cast<std::string>(*message->name) == "heartbeat", "a good frame is read right");
  check(reader.getNextMessage() == nullptr, "one frame is one message");
}

struct Outcome {
  std::vector<std::string> messages;
  int stage;
  std::size_t kept;
  std::int64_t toSkip;
  bool operator==(const Outcome&) const = default;
};

// Chunks of 1 to `largest` bytes, the same for the same seed.
Outcome read(const char* bytes, std::size_t count, std::size_t largest, std::uint32_t seed) {
  KtRCMessageAccumulator reader(silentHandle());
  std::size_t announced = 0;
  const auto observer = platform::NotificationCenter::defaultCenter().addObserver(
      std::string(kMessageIsAvailable), &reader, [&](const auto&) { ++announced; });
  for (std::size_t from = 0; from < count;) {
    seed = seed * 1664525 + 1013904223;
    const std::size_t size = std::min(count - from, 1 + (seed >> 16) % largest);
    feed(reader, bytes + from, size);
    from += size;
  }
  const auto kept = static_cast<std::int64_t>(reader.accumulatedLength());
  check(KtRCMessageAccumulatorTest::bytesNeeded(reader) <= 2 * kept, "no wait for more than there is already");
  KtRCMessageAccumulatorTest::decodeNow(reader);
  Outcome outcome{takeMessages(reader), reader.currentMessageStage(), reader.accumulatedLength(),
                  KtRCMessageAccumulatorTest::bytesToSkip(reader)};
  check(announced == outcome.messages.size(), "every message is announced once");
  checkInStep(reader);
  return outcome;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* input, size_t size) {
  if (size < 2) return 0;
  const auto* const bytes = reinterpret_cast<const char*>(input + 1);
  const std::size_t count = size - 1;
  const Outcome whole = read(bytes, count, SIZE_MAX, UINT32_MAX);
  check(read(bytes, count, 1U + input[0], input[0]) == whole, "messages do not depend on the chunks");
  if (count <= kMostSingleBytes) {
    check(read(bytes, count, 1, 0) == whole, "messages do not depend on the chunks, a byte at a time");
  }
  return 0;
}
