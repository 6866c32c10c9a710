// Any bytes as an element: what decodes can be written and read again, and what does not says how much is missing at
// the least. Then through the frame reader, in one piece and in several chunkings: the messages are the same, no reader
// waits long before it looks at what it has, and where the stream is in step a good frame is read. The first byte of
// the input chooses the chunks.
#include <unistd.h>

#include <algorithm>
#include <array>
#include <memory>
#include <string>
#include <vector>

#include "FrameWriter.h"
#include "Input.h"
#include "KtRCMessageAccumulator.h"
#include "Log.h"

using testkit::check;
using Element = std::unique_ptr<KtLuaTE>;

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

struct Decoded {
  enum { element, unknownTag, incomplete, malformed } kind;
  Element value;
  std::int64_t consumed = 0;
  std::int64_t missing = 0;
};

Decoded decode(const char* bytes, std::size_t count) {
  KtNSDataReadStreamBuf buffer(std::make_shared<platform::Data>(std::vector<char>(bytes, bytes + count)));
  std::istream in(&buffer);
  try {
    Element value(KtLuaTE::createFromStream(in));
    const std::int64_t consumed = in.tellg();
    const auto kind = value ? Decoded::element : Decoded::unknownTag;
    return {kind, std::move(value), consumed, 0};
  } catch (const KtStreamError& error) {
    return {Decoded::incomplete, nullptr, 0, error.missing()};
  } catch (const platform::Exception&) {
    return {Decoded::malformed, nullptr, 0, 0};
  }
}

// Data and tables as keys stand in order of their addresses, which differ between two objects of one content.
bool hasAddressKeys(const KtLuaTE& element) {
  const auto* const table = dynamic_cast<const KtLuaTETable*>(&element);
  if (table == nullptr) return false;
  for (const auto& [key, value] : table->getEntries()) {
    check(key != nullptr && value != nullptr, "a table holds no null");
    const bool byAddress = key->getType() == kKtLuaTypeData || key->getType() == kKtLuaTypeTable;
    if (byAddress || hasAddressKeys(*value)) return true;
  }
  return false;
}

void checkSame(const std::string& one, const std::string& other, bool byAddress) {
  check(one.size() == other.size(), "the same element has the same size");
  check(byAddress || one == other, "the same element has the same bytes");
}

void checkElement(const std::uint8_t* bytes, std::size_t count) {
  const auto* const text = reinterpret_cast<const char*>(bytes);
  const Decoded first = decode(text, count);
  if (first.kind == Decoded::incomplete) check(first.missing > 0, "what is incomplete misses something");
  if (first.kind == Decoded::unknownTag) check(first.consumed == 4, "an unknown tag is all that is read");
  if (first.kind != Decoded::element) return;

  const bool byAddress = hasAddressKeys(*first.value);
  const std::string written = encodeElement(*first.value);
  const Decoded second = decode(written.data(), written.size());
  check(second.kind == Decoded::element, "what was written can be read");
  check(second.consumed == static_cast<std::int64_t>(written.size()), "what was written is read to its end");
  checkSame(written, encodeElement(*second.value), byAddress);
  const Element copy(first.value->copy());
  checkSame(written, encodeElement(*copy), byAddress);

  // Every beginning is incomplete, and says no more than the truth of what is missing.
  const std::int64_t part = bytes[count - 1] * first.consumed / 256;
  const Decoded beginning = decode(text, static_cast<std::size_t>(part));
  check(beginning.kind == Decoded::incomplete, "the beginning of an element is incomplete");
  check(beginning.missing > 0 && beginning.missing <= first.consumed - part, "no more is missing than there is");
}

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
  std::string bytes = encodeElement(*element);
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
  checkElement(input, size);
  const auto* const bytes = reinterpret_cast<const char*>(input + 1);
  const std::size_t count = size - 1;
  const Outcome whole = read(bytes, count, SIZE_MAX, UINT32_MAX);
  check(read(bytes, count, 1U + input[0], input[0]) == whole, "messages do not depend on the chunks");
  if (count <= kMostSingleBytes) {
    check(read(bytes, count, 1, 0) == whole, "messages do not depend on the chunks, a byte at a time");
  }
  return 0;
}
