#include "Thread.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <future>
#include <thread>

#include "Locks.h"
#include "Log.h"
#include "NotificationCenter.h"

namespace {

using namespace std::chrono_literals;
using platform::NotificationCenter;
using platform::Thread;

TEST(Locks, AreHadWithinTheWaitOrNotAtAll) {
  platform::TimedLock lock;
  platform::RecursiveTimedLock recursive;
  const std::unique_lock held(lock, 1s);
  const std::unique_lock outer(recursive, 1s);
  const std::unique_lock inner(recursive, 1s);
  EXPECT_TRUE(held && outer && inner);
  std::async(std::launch::async, [&] {
    EXPECT_FALSE(std::unique_lock(lock, 10ms));
    EXPECT_FALSE(std::unique_lock(recursive, 10ms));
  }).get();
}

TEST(Locks, AreHandedOnToWhoeverWaits) {
  platform::TimedLock lock;
  int turns = 0;
  const auto take = [&] {
    for (int turn = 0; turn < 20'000; ++turn) {
      const std::lock_guard guard(lock);
      ++turns;
    }
  };
  std::thread other(take);
  take();
  other.join();
  EXPECT_EQ(turns, 40'000);
}

TEST(Notifications, ReachObserversByNameAndObjectUntilTheirTokenGoes) {
  NotificationCenter center;
  int object = 0;
  int other = 0;
  std::string heard;
  auto byName = center.addObserver("ready", nullptr, [&](const auto&) { heard += 'n'; });
  auto byObject = center.addObserver("", &object, [&](const auto& notification) {
    heard += 'o';
    EXPECT_EQ(notification.object, &object);
  });
  center.post({"ready", &object, nullptr});
  EXPECT_EQ(heard, "no");
  center.post({"done", &object, nullptr});
  center.post({"done", &other, nullptr});
  EXPECT_EQ(heard, "noo");
  byObject.remove();
  center.post({"ready", &object, nullptr});
  EXPECT_EQ(heard, "noon");
}

TEST(Notifications, AnObserverMayRemoveItselfAndOthersDuringADelivery) {
  NotificationCenter center;
  int calls = 0;
  platform::Observer second;
  platform::Observer first = center.addObserver("x", nullptr, [&](const auto&) {
    ++calls;
    first.remove();
    second.remove();
  });
  second = center.addObserver("x", nullptr, [&](const auto&) { ++calls; });
  center.post({"x", nullptr, nullptr});
  center.post({"x", nullptr, nullptr});
  EXPECT_EQ(calls, 1);
}

TEST(Notifications, RemovingOnAnotherThreadWaitsForTheDeliveryInProgress) {
  NotificationCenter center;
  std::promise<void> entered;
  std::promise<void> mayLeave;
  std::atomic<bool> left{false};
  auto observer = center.addObserver("x", nullptr, [&](const auto&) {
    entered.set_value();
    mayLeave.get_future().wait();
    left = true;
  });
  std::thread poster([&] { center.post({"x", nullptr, nullptr}); });
  entered.get_future().wait();
  std::thread releaser([&] { mayLeave.set_value(); });
  observer.remove();
  EXPECT_TRUE(left);
  poster.join();
  releaser.join();
}

TEST(Log, LinesThatNobodyReadsAreDroppedAndTheNextOneSaysHowMany) {
  std::array<int, 2> ends{};
  ASSERT_EQ(pipe(ends.data()), 0);
  for (const int end : ends) fcntl(end, F_SETFL, O_NONBLOCK);
  const int before = dup(STDERR_FILENO);
  dup2(ends[1], STDERR_FILENO);
  constexpr int kLines = 20'000;
  for (int number = 0; number < kLines; ++number) platform::log("line");
  std::string read;
  const auto readAll = [&] {
    std::array<char, 65536> chunk{};
    for (ssize_t count = 0; (count = ::read(ends[0], chunk.data(), chunk.size())) > 0;)
      read.append(chunk.data(), count);
    return std::count(read.begin(), read.end(), '\n');
  };
  const auto kept = readAll();
  platform::log("the next");
  readAll();
  dup2(before, STDERR_FILENO);
  for (const int descriptor : {ends[0], ends[1], before}) close(descriptor);
  EXPECT_LT(kept, kLines);
  EXPECT_NE(read.find("] " + std::to_string(kLines - kept) + " log lines were dropped here"), std::string::npos);
  EXPECT_TRUE(read.ends_with("the next\n"));
}

}  // namespace
