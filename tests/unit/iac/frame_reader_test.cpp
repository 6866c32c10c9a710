// What no chunking of any bytes may change, the fuzz target `wire` tells.
#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <future>
#include <thread>
#include <vector>

#include "KtRCMessageAccumulator.h"
#include "Log.h"

using namespace std::chrono_literals;
using namespace std::string_literals;
using platform::Clock;
using platform::RunLoop;

namespace {

const std::string kHeartbeat = "\x1a\0\0\0\0\0\0\0\3\0\0\0\x0a\0\0\0heartbeat\0\1\0\0\0"s;

template <typename Number>
std::string raw(Number number) {
  return {reinterpret_cast<const char*>(&number), sizeof number};
}

// A frame whose length field is `surplus` off.
std::string frame(std::int32_t id, const std::string& elements, std::int32_t surplus = 0) {
  return raw(static_cast<std::int32_t>(4 + elements.size()) + surplus) + raw(id) + elements;
}

const std::string kNil = "\1\0\0\0"s;
const std::string kName = "\3\0\0\0\2\0\0\0a\0"s;

// A reader on one end of a pipe, and what it announces.
class FrameReader : public ::testing::Test {
 protected:
  FrameReader() {
    std::array<int, 2> ends{};
    EXPECT_EQ(pipe(ends.data()), 0);
    writing = std::make_unique<platform::FileHandle>(ends[1]);
    reader = std::make_unique<KtRCMessageAccumulator>(std::make_shared<platform::FileHandle>(ends[0]));
    observer = platform::NotificationCenter::defaultCenter().addObserver(
        "", reader.get(), [this](const platform::Notification& notification) {
          (notification.name == kMessageIsAvailable ? available : finished) += 1;
        });
    platform::setLogSink([this](const std::string& line) { logged.push_back(line); });
  }
  ~FrameReader() override { platform::setLogSink(nullptr); }

  // Hands the bytes over and lets the reader take them in.
  void feed(const std::string& bytes) {
    ASSERT_EQ(writing->write(bytes.data(), bytes.size()), 0);
    RunLoop::current()->runOnce(Clock::now() + 5s);
  }
  void feedInChunksOf(std::size_t size, const std::string& bytes) {
    for (std::size_t from = 0; from < bytes.size(); from += size) feed(bytes.substr(from, size));
  }
  std::vector<std::int32_t> takeIds() {
    std::vector<std::int32_t> ids;
    while (const auto message = reader->getNextMessage()) ids.push_back(message->id);
    return ids;
  }

  std::unique_ptr<platform::FileHandle> writing;
  std::unique_ptr<KtRCMessageAccumulator> reader;
  platform::Observer observer;
  int available = 0;
  int finished = 0;
  std::vector<std::string> logged;
};

TEST_F(FrameReader, AByteAtATimeItWaitsForTheWholeFrame) {
  for (std::size_t index = 0; index < kHeartbeat.size(); ++index) {
    EXPECT_EQ(available, 0) << index;
    feed(kHeartbeat.substr(index, 1));
    const bool waits = index >= 3 && index < 29;
    EXPECT_EQ(reader->currentMessageStage(), waits ? 1 : 0) << index;
    EXPECT_EQ(reader->accumulatedLength(), waits ? index - 3 : (index + 1) % 30) << index;
  }
  EXPECT_EQ(available, 1);
  EXPECT_EQ(reader->getNextMessage()->length, 26);
}

TEST_F(FrameReader, TheFrameEndsWhereItsElementsEndWhateverItsLengthSays) {
  const std::string longer = frame(1, kName + kNil, 22);  // waits for the 22 bytes of the next frame, then reads them
  feed(longer);
  EXPECT_EQ(available, 0);
  feed(frame(2, kName + kNil));
  feed(frame(3, kName + kNil, -14));
  feed(frame(4, kName + kNil, -1000));  // a negative length waits for nothing
  EXPECT_EQ(takeIds(), (std::vector<std::int32_t>{1, 2, 3, 4}));
  ASSERT_EQ(logged.size(), 2U) << "told once until a frame fits again";
  EXPECT_EQ(logged.front(), "Out of step with the host: a frame with length 40 ended after 18 bytes");
  feed(frame(5, "\x09\0\0\0"s + kNil));
  const auto message = reader->getNextMessage();
  ASSERT_NE(message, nullptr);
  EXPECT_EQ(message->name, nullptr) << "an unknown tag is a message without that element";
  EXPECT_EQ(message->data->getType(), kKtLuaTypeNil);
}

TEST_F(FrameReader, AFrameThatCanNeverBeDecodedIsDroppedWithOneLineInAnyChunking) {
  const std::string negativeData = "\4\0\0\0\xff\xff\xff\xff"s;
  // The table promises eight million entries, but what follows it is no key.
  const std::string damagedCount = frame(6, kName + raw(kKtLuaTypeTable) + raw(std::int32_t{8000000}));
  const std::string bytes = frame(1, kName + negativeData + std::string(40, 'x')) + frame(2, negativeData) +
                            frame(3, kName + kNil) + frame(4, kName + "\4\0\0\0\xff\xff\xff\x7f"s + "xyz") +
                            frame(5, kName + kNil) + damagedCount + kHeartbeat + frame(7, kName + kNil);
  for (const std::size_t chunk : {std::size_t{1}, std::size_t{13}, bytes.size()}) {
    feedInChunksOf(chunk, bytes);
    EXPECT_EQ(takeIds(), (std::vector<std::int32_t>{3, 5, 0, 7})) << chunk;
    EXPECT_EQ(logged.size(), 4U) << chunk;
    logged.clear();
  }
}

TEST_F(FrameReader, AFrameOf64MiBIsReadAndOneAboveTheLimitSkippedAsItArrivesWithoutBeingStored) {
  for (const std::int32_t size : {64 << 20, (64 << 20) + 1}) {  // with the length itself
    const bool fits = size == 64 << 20;
    const std::int32_t announced = size - 4;
    const auto rest = static_cast<std::size_t>(announced) - 4 - kName.size() - 8;
    const std::string begin = raw(announced) + raw(8) + kName + "\4\0\0\0"s + raw(static_cast<std::int32_t>(rest));
    std::thread writer([&] {
      for (const std::string& bytes : {begin, std::string(rest, 'x'), frame(9, kName + kNil)})
        writing->write(bytes.data(), bytes.size());
    });
    std::vector<std::int32_t> ids;
    std::size_t largest = 0;
    while (ids.empty() || ids.back() != 9) {
      RunLoop::current()->runOnce(Clock::now() + 5s);
      largest = std::max(largest, reader->accumulatedLength());
      for (const std::int32_t id : takeIds()) ids.push_back(id);
    }
    writer.join();
    EXPECT_EQ(ids, fits ? (std::vector<std::int32_t>{8, 9}) : (std::vector<std::int32_t>{9}));
    EXPECT_EQ(logged.size(), fits ? 0U : 1U);
    EXPECT_TRUE(fits || largest < (1 << 20)) << largest;
  }
}

TEST_F(FrameReader, TheEndOfTheInputIsToldOnceAndQueuedMessagesStay) {
  feed(kHeartbeat);
  writing.reset();
  RunLoop::current()->runOnce(Clock::now() + 5s);
  RunLoop::current()->runOnce(Clock::now() + 20ms);
  EXPECT_EQ(finished, 1);
  EXPECT_EQ(takeIds().size(), 1U);
}

TEST_F(FrameReader, ReadsNoMoreThanItMayKeepUntilItsQueueIsEmptyAgain) {
  // More than may wait, and more than the pipe holds beside it.
  constexpr std::int32_t kCount = 3 * kMostWaitingMessages;
  std::thread host([&] {
    for (std::int32_t id = 0; id < kCount; ++id) {
      const std::string bytes = frame(id, kName + kNil);
      EXPECT_EQ(writing->write(bytes.data(), bytes.size()), 0);
    }
  });
  std::vector<std::int32_t> ids;
  while (ids.size() < kCount) {
    const std::size_t before = available;
    while (available - before < kMostWaitingMessages && ids.size() + available - before < kCount) {
      RunLoop::current()->runOnce(Clock::now() + 5s);
    }
    for (int turn = 0; turn < 3; ++turn) RunLoop::current()->runOnce(Clock::now());
    EXPECT_LT(available - before, kMostWaitingMessages + 64 * 1024 / frame(0, kName + kNil).size() + 2);
    for (const std::int32_t id : takeIds()) ids.push_back(id);
  }
  host.join();
  for (std::int32_t id = 0; id < kCount; ++id) ASSERT_EQ(ids[static_cast<std::size_t>(id)], id);
}

TEST_F(FrameReader, WhatCameBeforeTheQueueWasEmptyDoesNotHoldUpWhatComesNow) {
  const std::string large = frame(1, kName + "\4\0\0\0"s + raw(std::int32_t{60'000}) + std::string(60'000, 'x'));
  for (std::size_t sent = 0; sent <= kMostWaitingBytes; sent += large.size()) {
    feed(large);
    ASSERT_EQ(takeIds().size(), 1U);
  }
  RunLoop::current()->runOnce(Clock::now());
  feed(frame(2, kName + kNil));
  feed(frame(3, kName + kNil));
  EXPECT_EQ(takeIds(), (std::vector<std::int32_t>{2, 3}));
}

TEST(FrameReaderThread, ReadsOnItsOwnThreadUntilTheEndOrUntilItIsDestroyed) {
  for (const bool closeFirst : {true, false}) {
    std::promise<void> ended;
    platform::setLogSink([&](const std::string& line) {
      if (line == "NSRunLoop thread exit.") ended.set_value();
    });
    std::array<int, 2> ends{};
    ASSERT_EQ(pipe(ends.data()), 0);
    auto writing = std::make_unique<platform::FileHandle>(ends[1]);
    KtRCMessageAccumulator reader(std::make_shared<platform::FileHandle>(ends[0]), true);
    std::promise<void> available;
    std::promise<void> finished;
    const auto test = std::this_thread::get_id();
    const auto observer = platform::NotificationCenter::defaultCenter().addObserver(
        "", &reader, [&](const platform::Notification& notification) {
          EXPECT_TRUE(std::this_thread::get_id() != test);
          (notification.name == kMessageIsAvailable ? available : finished).set_value();
        });
    writing->write(kHeartbeat.data(), kHeartbeat.size());
    available.get_future().wait();
    EXPECT_NE(reader.getNextMessage(), nullptr);
    if (closeFirst) {
      writing.reset();
      finished.get_future().wait();
      ended.get_future().wait();
    }
  }
  platform::setLogSink(nullptr);
}

}  // namespace
