// Two threads in the module at once, and callbacks from a thread of the module's own.
#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <mutex>

#include "Client.h"
#include "VirtualCamera.h"

namespace virtualcamera::test {
namespace {

// Opens at the first pass, stays open.
class Gate {
 public:
  void open() {
    const std::lock_guard lock(mutex_);
    open_ = true;
    opened_.notify_all();
  }
  void pass() {
    std::unique_lock lock(mutex_);
    opened_.wait(lock, [this] { return open_; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable opened_;
  bool open_ = false;
};

TEST(ThreadTest, CamerasGoWhileOneThreadPollsTheModuleAndAnotherTransfers) {
  constexpr int kRounds = 200;
  Model model({.closeWait = std::chrono::seconds(10)});
  Client module(Model::entryPoint(), nullptr, 0);
  std::atomic<bool> ended{false};
  std::atomic<int> transfers{0};
  std::thread polling([&] {
    while (!ended) EXPECT_EQ(module.poll(), kNkMAIDResult_NoError);
  });
  std::thread transferring([&] {
    while (!ended) {
      Client device(module, 1);
      if (device.opened != 0) continue;
      Opened open(device, 1);
      if (open.data.opened != 0 || open.data.start(kNkMAIDCapability_Acquire) != kNkMAIDResult_Pending) continue;
      const int32_t result = open.data.finish();
      EXPECT_TRUE(result == kNkMAIDResult_NoError || result == kNkMAIDResult_ZombieObject) << result;
      open.data.close();  // the other thread may be inside a delivery until then
      if (!open.data.deliveries.empty()) ++transfers;
    }
  });
  for (int round = 0; round < kRounds || transfers < 20; ++round) {
    Camera& camera = model.addCamera(1, "Coming and going");
    camera.setTransfer({.deliveryBytes = 1000, .inModulePolls = true});
    camera.shoot(Picture::pattern(kNkMAIDFileDataType_JPEG, 50'000));
    std::this_thread::yield();
    if (round % 3 == 0) camera.set(Capability::integer(kNkMAIDCapability_BatteryLevel, round));
    model.removeCamera(1);
  }
  ended = true;
  polling.join();
  transferring.join();
  module.close();
  EXPECT_EQ(model.openObjects(), 0u);
}

TEST(ThreadTest, OneObjectNeverGetsTwoEventsAtOnceAndKeepsTheirOrder) {
  Model model;
  Camera& camera = model.addCamera(1, "One");
  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  constexpr uint64_t kEvents = 2000;
  std::atomic<bool> ended{false};
  const auto pollUntilEnded = [&](Client& client) {
    while (!ended) client.poll();
  };
  std::atomic<int> inside{0};
  std::atomic<size_t> seen{0};
  device.inCallback = [&] {
    EXPECT_EQ(++inside, 1);
    ++seen;
    --inside;
  };
  std::thread one(pollUntilEnded, std::ref(module));
  std::thread two(pollUntilEnded, std::ref(device));
  for (uint64_t i = 0; i < kEvents; ++i) camera.raise(kNkMAIDEvent_CapChange, i);
  while (seen < kEvents) std::this_thread::yield();
  ended = true;
  one.join();
  two.join();
  for (uint64_t i = 0; i < kEvents; ++i) EXPECT_EQ(device.events[i].second, i);
}

TEST(ThreadTest, ACloseWaitsForACallbackInProgressElsewhere) {
  Model model({.closeWait = std::chrono::minutes(1)});
  Camera& camera = model.addCamera(1, "One");
  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  Gate entered, leave;
  std::atomic<bool> left{false};
  device.inCallback = [&] {
    entered.open();
    leave.pass();
    left = true;
  };
  camera.raise(kNkMAIDEvent_CapChange, 1);
  camera.raise(kNkMAIDEvent_CapChange, 2);
  std::thread polling([&] { module.poll(); });
  entered.pass();
  std::thread leaving([&] {
    while (model.openObjects() == 2) std::this_thread::yield();  // until the close is under way
    EXPECT_FALSE(left);
    leave.open();
  });
  EXPECT_EQ(device.close(), kNkMAIDResult_NoError);
  EXPECT_TRUE(left);
  leaving.join();
  polling.join();
  EXPECT_EQ(device.events.size(), 1u);
}

TEST(ThreadTest, ACloseFromTheCallbackAndAClientThatWaitsForTheCloserBothEnd) {
  Model model({.closeWait = std::chrono::milliseconds(1)});
  Camera& camera = model.addCamera(1, "One");
  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  Gate closed;
  std::thread closing;
  device.inCallback = [&] {
    closing = std::thread([&] {
      device.close();
      closed.open();
    });
    closed.pass();
  };
  camera.raise(kNkMAIDEvent_CapChange, 1);
  module.poll();
  closing.join();
  EXPECT_EQ(model.openObjects(), 1u);
}

TEST(ThreadTest, DeliveriesAndCompletionComeOnTheModulesOwnThreadWhereAFaultSaysSo) {
  Model model;
  Camera& camera = model.addCamera(1, "One");
  camera.setTransfer({.deliveryBytes = 10});
  camera.shoot(Picture::pattern(kNkMAIDFileDataType_JPEG, 100));
  model.faults().add({.level = Level::Data, .command = kNkMAIDCommand_CapStart, .ownThread = true});
  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  Opened open(device, 1);
  Gate completed;
  open.data.inCallback = [&] {
    if (!open.data.completions.empty()) completed.open();
  };
  open.data.start(kNkMAIDCapability_Acquire);
  std::atomic<bool> ended{false};
  std::thread polling([&] {
    while (!ended) open.data.poll();
  });
  completed.pass();
  ended = true;
  polling.join();
  ASSERT_EQ(open.data.deliveries.size(), 10u);
  for (const Delivery& delivery : open.data.deliveries) EXPECT_EQ(delivery.thread, open.data.completionThread);
  EXPECT_NE(open.data.completionThread, std::this_thread::get_id());
}

TEST(ThreadTest, EventsComeOnTheModulesOwnThreadWhereToldAndNotAfterAClose) {
  Model model({.eventsOnOwnThread = true});
  Camera& camera = model.addCamera(1, "One");
  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  Gate heard;
  std::thread::id thread;
  device.inCallback = [&] {
    thread = std::this_thread::get_id();
    heard.open();
  };
  camera.raise(kNkMAIDEvent_CapChange, 1);
  module.poll();
  heard.pass();
  EXPECT_NE(thread, std::this_thread::get_id());
  EXPECT_EQ(device.close(), kNkMAIDResult_NoError);
  EXPECT_EQ(device.events.size(), 1u);
}

}  // namespace
}  // namespace virtualcamera::test
