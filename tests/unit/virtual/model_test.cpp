// The model as a client sees it: strict where a client is wrong, asynchronous, and safe between threads.
#include <gtest/gtest.h>

#include <thread>

#include "Client.h"

namespace virtualcamera::test {
namespace {

struct ModelTest : testing::Test {
  static Fault acquire(Fault fault) {
    fault.level = Level::Data;
    fault.command = kNkMAIDCommand_CapStart;
    return fault;
  }

  Model model{{.closeWait = std::chrono::minutes(1)}};
  Camera& camera = model.addCamera(1, "One");
  Client module;
  Client device{module, 1};
};

TEST_F(ModelTest, WhatAClientDoesWrongIsAnsweredWithItsResult) {
  tagNkMAIDObject foreign{};
  foreign.sdkHead = 1;  // the module's, but not in the module's record
  for (tagNkMAIDObject* record : {&foreign, static_cast<tagNkMAIDObject*>(nullptr)})
    EXPECT_EQ(entryPoint(record, kNkMAIDCommand_Async, 0, 0, 0, nullptr, nullptr), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(Client(module, 8).opened, kNkMAIDResult_ValueOutOfBounds);
  EXPECT_EQ(Client(device, 9).opened, kNkMAIDResult_ValueOutOfBounds);
  EXPECT_EQ(module.send(kNkMAIDCommand_Abort), kNkMAIDResult_NotSupported);
  int32_t battery = 0;
  EXPECT_EQ(device.get(kNkMAIDCapability_BatteryLevel, kNkMAIDDataType_UnsignedPtr, &battery),
            kNkMAIDResult_UnexpectedDataType);
  EXPECT_EQ(device.get(0x7777, kNkMAIDDataType_UnsignedPtr, &battery), kNkMAIDResult_NotSupported);
  tagNkMAIDCapInfo tooFew[1];
  EXPECT_EQ(device.send(kNkMAIDCommand_GetCapInfo, 1, kNkMAIDDataType_CapInfoPtr, tooFew), kNkMAIDResult_BufferSize);

  tagNkMAIDEnum header{};
  ASSERT_EQ(device.get(kNkMAIDCapability_Sensitivity, kNkMAIDDataType_EnumPtr, &header), 0);
  std::vector<uint32_t> room(header.elementCount, 42);
  header.elements = room.data();
  camera.set(Capability::unsigneds(kNkMAIDCapability_Sensitivity, std::vector<uint32_t>(20, 1)));
  EXPECT_EQ(device.send(kNkMAIDCommand_CapGetArray, kNkMAIDCapability_Sensitivity, kNkMAIDDataType_EnumPtr, &header),
            kNkMAIDResult_BufferSize);
  EXPECT_EQ(room, std::vector<uint32_t>(room.size(), 42));

  EXPECT_EQ(module.close(), kNkMAIDResult_OrphanedChildren);
  EXPECT_EQ(device.poll(), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(device.close(), kNkMAIDResult_NoError);
  EXPECT_EQ(device.send(kNkMAIDCommand_Close), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(model.openObjects(), 0u);
}

TEST_F(ModelTest, WhatAnActionBringsComesInLaterPollsAPieceAPollAndTheCompletionLast) {
  camera.setTransfer({.deliveryBytes = 400});
  camera.load(Picture::pattern(kNkMAIDFileDataType_NEF, 1000));
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_Pending);
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_DeviceBusy);
  device.poll();  // the shutter
  EXPECT_TRUE(device.events.empty() && device.completions.empty());
  size_t eventsAtCompletion = 0;
  device.inCallback = [&] { eventsAtCompletion = device.completions.empty() ? 0 : device.events.size(); };
  device.poll();
  EXPECT_EQ(device.events, (Client::Events{{kNkMAIDEvent_AddChild, 1}, {kNkMAIDEvent_CaptureComplete, 0}}));
  EXPECT_EQ(eventsAtCompletion, 2u);
  Opened open(device, 1);
  open.data.start(kNkMAIDCapability_Acquire);
  for (const size_t expected : {1, 2, 3}) {
    module.poll();  // not the transfer's
    open.data.poll();
    EXPECT_EQ(open.data.deliveries.size(), expected);
  }
  EXPECT_TRUE(open.data.completions.empty() && !camera.items().empty());
  open.item.poll();
  EXPECT_TRUE(open.data.completions.size() == 1 && camera.items().empty());
}

TEST_F(ModelTest, EachCallInTurnCanFail) {
  const auto session = [] {
    Client top;
    if (top.opened != 0) return false;
    Client below(top, 1);
    return below.opened == 0 && below.name() != "!";
  };
  model.failCall(0, 0, {.closes = false});
  EXPECT_TRUE(session());
  EXPECT_EQ(model.countedCalls(), 7u);  // per object an open and two callbacks; the name
  std::vector<uint64_t> fatal;
  for (uint64_t k = 1; k <= 7; ++k) {
    model.failCall(k, kNkMAIDResult_UnexpectedError, {.closes = false});
    if (!session()) fatal.push_back(k);
    EXPECT_EQ(model.openObjects(), 2u);
  }
  EXPECT_EQ(fatal, (std::vector<uint64_t>{1, 4, 7}));
}

TEST_F(ModelTest, CompletionsStayAwayComeLateTwiceOrAfterTheClose) {
  // How many have come: after seven polls of the object, after one of the module, after the close and one more.
  const std::vector<std::pair<Fault, std::vector<size_t>>> table{
      {acquire({.noCompletion = true}), {0, 0, 0}},
      {acquire({.completionPolls = 5, .completionTwice = true}), {1, 2, 2}},
      {acquire({.completionPolls = 6}), {0, 0, 0}},
      {acquire({.completionAfterClose = true}), {0, 0, 1}}};
  for (const auto& [fault, expected] : table) {
    model.faults().clear();
    model.faults().add(fault);
    Opened open(device, camera.shoot(Picture::jpeg({1})));
    open.data.start(kNkMAIDCapability_Acquire);
    std::vector<size_t> counts;
    for (int i = 0; i < 7; ++i) open.data.poll();
    counts.push_back(open.data.completions.size());
    module.poll();
    counts.push_back(open.data.completions.size());
    open.data.close();
    module.poll();
    counts.push_back(open.data.completions.size());
    EXPECT_EQ(counts, expected);
  }
}

TEST_F(ModelTest, CamerasGoWhileOneThreadPollsTheModuleAndAnotherTransfers) {
  device.close();
  std::atomic<bool> ended{false};
  std::atomic<int> transfers{0};
  std::thread polling([&] {
    while (!ended) EXPECT_EQ(module.poll(), kNkMAIDResult_NoError);
  });
  std::thread transferring([&] {
    while (!ended) {
      Client opened(module, 1);
      if (opened.opened != 0) continue;
      Opened open(opened, 1);
      // The other thread may deliver and complete as well, so that only polls tell the end here.
      if (open.data.opened != 0 || open.data.start(kNkMAIDCapability_Acquire) != kNkMAIDResult_Pending) continue;
      while (open.data.poll() == kNkMAIDResult_NoError && !ended) continue;
      open.data.close();
      if (!open.data.deliveries.empty()) ++transfers;
    }
  });
  for (int round = 0; round < 200 || transfers < 20; ++round) {
    Camera& coming = model.addCamera(1, "Coming and going");
    coming.setTransfer({.deliveryBytes = 1000, .inModulePolls = true});
    coming.shoot(Picture::pattern(kNkMAIDFileDataType_JPEG, 50'000));
    std::this_thread::yield();
    model.removeCamera(1);
  }
  ended = true;
  polling.join();
  transferring.join();
  module.close();
  EXPECT_EQ(model.openObjects(), 0u);
}

}  // namespace
}  // namespace virtualcamera::test
