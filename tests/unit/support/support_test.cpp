#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "DeferredCalls.h"
#include "RunLoop.h"
#include "UniqueFilePath.h"

namespace {

using namespace std::chrono_literals;
using platform::Clock;
using platform::RunLoop;

void count(void* counter) { ++*static_cast<int*>(counter); }
void countToo(void* counter) { *static_cast<int*>(counter) += 100; }

TEST(DeferredCalls, ANewerRequestForTheSamePairCancelsTheOlderAndRestartsTheWait) {
  int calls = 0;
  int others = 0;
  CallAfterDelay(count, &calls, 0.02);
  CallAfterDelay(count, &calls, 0.05);
  CallAfterDelay(countToo, &calls, 0);
  CallAfterDelay(count, &others, 0);
  CallAfterDelay(countToo, &others, 0);
  CallDelay::cancelCallsToProc(countToo, &others);
  CallDelay::cancelCallsToProc(countToo, nullptr);
  EXPECT_EQ(calls, 0);
  while (CallDelay::queuedCount() > 1) RunLoop::current()->runOnce(Clock::now() + 1s);
  EXPECT_EQ(calls, 100) << "the cancelled request woke up and did something";
  EXPECT_EQ(others, 1) << "another argument or function is another pair";
  while (CallDelay::queuedCount() > 0) RunLoop::current()->runOnce(Clock::now() + 1s);
  EXPECT_EQ(calls, 101);
  EXPECT_EQ(others, 1);
}

TEST(UniqueFilePath, NumbersFromTwoBeforeTheExtensionWhateverHasTheName) {
  std::string pattern = ::testing::TempDir() + "tether-unique-XXXXXX";
  std::string folder = mkdtemp(pattern.data());
  const auto expect = [&](const std::string& name, const std::string& unique) {
    EXPECT_EQ(MakeUniqueFilePath(folder, name), folder + "/" + unique);
  };
  expect("a.jpg", "a.jpg");
  for (const char* name : {"a.jpg", "a-2.jpg", "notes", "x.tar.gz"}) std::ofstream(folder + "/" + name).put('x');
  std::filesystem::create_directory(folder + "/folder.nef");
  std::filesystem::create_symlink("/nowhere", folder + "/link.nef");
  expect("a.jpg", "a-3.jpg");
  expect("notes", "notes-2");
  expect("x.tar.gz", "x.tar-2.gz");
  expect("folder.nef", "folder-2.nef");
  expect("link.nef", "link-2.nef");
  std::filesystem::remove_all(folder);
}

}  // namespace
