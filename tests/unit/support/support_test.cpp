#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "DebugTrace.h"
#include "DeferredCalls.h"
#include "RunLoop.h"
#include "UniqueFilePath.h"

namespace {

using namespace std::chrono_literals;
using platform::Clock;
using platform::RunLoop;

void count(void* counter) { ++*static_cast<int*>(counter); }
void countToo(void* counter) { *static_cast<int*>(counter) += 100; }

void turnUntilNothingIsQueued() {
  while (CallDelay::queuedCount() > 0) RunLoop::current()->runOnce(Clock::now() + 1s);
}

TEST(DeferredCalls, ANewerRequestForTheSamePairCancelsTheOlderAndRestartsTheWait) {
  int calls = 0;
  CallAfterDelay(count, &calls, 0.02);
  CallAfterDelay(count, &calls, 0.05);
  EXPECT_EQ(calls, 0);
  EXPECT_EQ(CallDelay::queuedCount(), 2U);
  while (CallDelay::queuedCount() == 2) RunLoop::current()->runOnce(Clock::now() + 1s);
  EXPECT_EQ(calls, 0) << "the cancelled request woke up and did something";
  turnUntilNothingIsQueued();
  EXPECT_EQ(calls, 1);
}

TEST(DeferredCalls, OtherArgumentsAndOtherFunctionsAreOtherPairs) {
  int first = 0;
  int second = 0;
  CallAfterDelay(count, &first, 0);
  CallAfterDelay(count, &second, 0);
  CallAfterDelay(countToo, &first, 0);
  turnUntilNothingIsQueued();
  EXPECT_EQ(first, 101);
  EXPECT_EQ(second, 1);
}

TEST(DeferredCalls, CancellingKeepsACallFromReachingWhatHasGone) {
  CallDelay::cancelCallsToProc(count, nullptr);
  int calls = 0;
  CallAfterDelay(count, &calls, 0);
  CallDelay::cancelCallsToProc(count, &calls);
  turnUntilNothingIsQueued();
  EXPECT_EQ(calls, 0);
}

TEST(DeferredCalls, TheClockCountsSecondsFromTheYear2001) {
  const double now = currentTime();
  EXPECT_GT(now, 24 * 365 * 86400.0);
  EXPECT_LT(now, 200 * 365 * 86400.0);
}

class UniqueFilePath : public ::testing::Test {
 protected:
  UniqueFilePath() {
    std::string pattern = ::testing::TempDir() + "tether-unique-XXXXXX";
    folder = mkdtemp(pattern.data());
  }
  ~UniqueFilePath() override { std::filesystem::remove_all(folder); }
  void touch(const std::string& name) const { std::ofstream(folder + "/" + name).put('x'); }
  std::string uniqueName(const std::string& name) const {
    const std::string path = MakeUniqueFilePath(folder, name);
    EXPECT_EQ(path.substr(0, folder.size() + 1), folder + "/");
    return path.substr(folder.size() + 1);
  }
  std::string folder;
};

TEST_F(UniqueFilePath, NumbersFromTwoBeforeTheExtension) {
  EXPECT_EQ(uniqueName("a.jpg"), "a.jpg");
  touch("a.jpg");
  EXPECT_EQ(uniqueName("a.jpg"), "a-2.jpg");
  touch("a-2.jpg");
  EXPECT_EQ(uniqueName("a.jpg"), "a-3.jpg");
  touch("notes");
  EXPECT_EQ(uniqueName("notes"), "notes-2");
  touch("x.tar.gz");
  EXPECT_EQ(uniqueName("x.tar.gz"), "x.tar-2.gz");
}

TEST_F(UniqueFilePath, WhateverHasTheNameTakesIt) {
  std::filesystem::create_directory(folder + "/Capture0005.nef");
  EXPECT_EQ(uniqueName("Capture0005.nef"), "Capture0005-2.nef");
  std::filesystem::create_symlink("/nowhere", folder + "/Capture0006.nef");
  EXPECT_EQ(uniqueName("Capture0006.nef"), "Capture0006-2.nef");
}

TEST(DebugTrace, LinesAreFormattedCutAndDroppedWithoutASink) {
  std::vector<std::string> lines;
  setDebugSink([&](const char* text) { lines.emplace_back(text); });
  debugmsgint("SendErrorMessage - error code: %xd", -1);
  debugmsgint("could not find module id %ld", 256);
  debugmsgstr("%s", std::string(5000, 'x').c_str());
  setDebugSink(nullptr);
  debugmsg("dropped");
  ASSERT_EQ(lines.size(), 3U);
  EXPECT_EQ(lines[0], "SendErrorMessage - error code: ffffffffd");
  EXPECT_EQ(lines[1], "could not find module id 256");
  EXPECT_EQ(lines[2].size(), 2047U);
}

}  // namespace
