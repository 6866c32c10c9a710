#include "RunLoop.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <array>
#include <future>
#include <stdexcept>
#include <string>
#include <thread>

#include "Log.h"
#include "Thread.h"

namespace {

using namespace std::chrono_literals;
using platform::Clock;
using platform::DescriptorWatch;
using platform::RunLoop;
using platform::Thread;
using platform::Timer;

// Turns the loop until the condition holds; a test that waits in vain is ended by its own time-out.
template <typename Condition>
void turnUntil(Condition condition) {
  while (!condition()) RunLoop::current()->runOnce(Clock::now() + 1s);
}

struct Pipe {
  Pipe() { EXPECT_EQ(pipe(ends.data()), 0); }
  ~Pipe() {
    close(ends[0]);
    close(ends[1]);
  }
  void put() { EXPECT_EQ(write(ends[1], "x", 1), 1); }
  void take() {
    char byte = 0;
    EXPECT_EQ(read(ends[0], &byte, 1), 1);
  }
  std::array<int, 2> ends{};
};

TEST(RunLoop, RunsWhatIsDueInOrderAndWhatIsPostedDuringATurnInALaterOne) {
  std::string order;
  auto& loop = *RunLoop::current();
  loop.performAfter(0.03s, [&] { order += 'f'; });
  loop.performAfter(0.01s, [&] { order += 'e'; });
  loop.post([&] {
    loop.post([&] { order += 'c'; });
    loop.performAfter(0s, [&] { order += 'd'; });
    order += 'a';
  });
  loop.post([&] { order += 'b'; });
  loop.runOnce(Clock::now());
  EXPECT_EQ(order, "ab");
  loop.runOnce(Clock::now());
  EXPECT_EQ(order, "abcd");
  turnUntil([&] { return order.size() == 6; });
  EXPECT_EQ(order, "abcdef");
}

TEST(RunLoop, ARepeatingTimerKeepsItsScheduleAndLeavesOutWhatItMissed) {
  std::vector<Clock::time_point> fired;
  const auto begin = Clock::now();
  Timer timer = Timer::repeating(0.05s, [&] {
    fired.push_back(Clock::now());
    if (fired.size() == 1) std::this_thread::sleep_until(begin + 0.12s);  // misses the time at 0.1
  });
  turnUntil([&] { return fired.size() == 2; });
  EXPECT_GE(fired[0] - begin, 0.05s);
  EXPECT_GE(fired[1] - begin, 0.15s);
}

TEST(RunLoop, ATimerMayCancelItselfAndOthersFromItsOwnCallback) {
  int first = 0;
  int second = 0;
  Timer other;
  Timer self = Timer::repeating(0.01s, [&] {
    ++first;
    self.invalidate();
    other.invalidate();
  });
  other = Timer::repeating(0.01s, [&] { ++second; });
  turnUntil([&] { return first == 1; });
  bool later = false;
  RunLoop::current()->performAfter(0.05s, [&] { later = true; });
  turnUntil([&] { return later; });
  EXPECT_EQ(first, 1);
  EXPECT_EQ(second, 0);
}

TEST(RunLoop, ANestedTurnTakesOverTheRestAndDoesNotReenterTheTimer) {
  std::string order;
  auto& loop = *RunLoop::current();
  int entered = 0;
  Timer timer = Timer::repeating(0.001s, [&] {
    ++entered;
    EXPECT_EQ(entered, 1);
    if (order.empty()) {
      loop.post([&] { order += 'n'; });
      while (order.empty()) loop.runOnce(Clock::now() + 1s);
      order += 'o';
    }
    --entered;
  });
  turnUntil([&] { return order == "no"; });
}

TEST(RunLoop, ReadableDescriptorsCallBackUntilTheirWatchIsDisabledOrEnds) {
  Pipe first;
  Pipe second;
  int calls = 0;
  DescriptorWatch watch(first.ends[0], [&] {
    first.take();
    ++calls;
    watch.setEnabled(false);
  });
  DescriptorWatch ending(second.ends[0], [&] { ending.end(); });
  first.put();
  first.put();
  second.put();
  turnUntil([&] { return calls == 1 && !ending; });
  RunLoop::current()->runOnce(Clock::now() + 20ms);
  EXPECT_EQ(calls, 1);
  watch.setEnabled(true);
  turnUntil([&] { return calls == 2; });
}

TEST(RunLoop, AThrowingCallbackIsLoggedAndTheLoopGoesOnUntilItIsStopped) {
  std::string logged;
  platform::setLogSink([&](const std::string& line) { logged += line; });
  auto& loop = *RunLoop::current();
  EXPECT_FALSE(loop.runOnce(Clock::time_point::max())) << "nothing to wait for";
  loop.post([] { throw std::runtime_error("broken"); });
  loop.post([&] { loop.stop(); });
  loop.run();
  platform::setLogSink(nullptr);
  EXPECT_NE(logged.find("broken"), std::string::npos);
}

TEST(RunLoop, WaitsWithoutUsingTheProcessor) {
  const auto switches = [] {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_nvcsw;
  };
  const long before = switches();
  bool done = false;
  RunLoop::current()->performAfter(0.2s, [&] { done = true; });
  turnUntil([&] { return done; });
  EXPECT_LT(switches() - before, 20);
}

class OtherThread : public ::testing::Test {
 protected:
  OtherThread() {
    thread->start();
    loop = thread->runLoop();
  }
  ~OtherThread() override {
    thread->cancel();
    thread->join();
  }
  std::shared_ptr<Thread> thread = Thread::make([] {
    const auto keep = Timer::repeating(1h, [] {});
    while (!Thread::current()->isCancelled()) RunLoop::current()->runOnce(Clock::now() + 1h);
  });
  std::shared_ptr<RunLoop> loop;
};

TEST_F(OtherThread, WaitingFromTheOwnThreadRunsTheCallAtOnceAndAWaiterGetsTheExceptionOfItsCall) {
  std::string order;
  loop->perform([&] {
    loop->post([&] { order += 'c'; });
    loop->perform([&] { order += 'a'; });
    order += 'b';
  });
  EXPECT_THROW(loop->perform([] { throw 7; }), int);
  EXPECT_EQ(order, "abc");
}

TEST(RunLoopEnd, QueuedWorkIsDestroyedOnItsThreadAndWaitersAreToldSo) {
  std::promise<void> mayEnd;
  auto thread = Thread::make([&] { mayEnd.get_future().wait(); });
  thread->start();
  const auto loop = thread->runLoop();

  std::thread::id destroyedOn;
  std::shared_ptr<int> owned(new int(1), [&](const int* value) {
    destroyedOn = std::this_thread::get_id();
    delete value;
  });
  bool ran = false;
  ASSERT_TRUE(loop->post([owned, &ran] { ran = true; }));
  owned.reset();
  auto waiter = std::async(std::launch::async, [&] { return loop->perform([&] { ran = true; }); });
  mayEnd.set_value();
  EXPECT_FALSE(waiter.get());
  thread->join();
  EXPECT_FALSE(ran);
  EXPECT_NE(destroyedOn, std::thread::id());
  EXPECT_NE(destroyedOn, std::this_thread::get_id());
  EXPECT_FALSE(loop->post([] {}));
  EXPECT_FALSE(loop->perform([] {}));
}

}  // namespace
