// The model as a client sees it: strict where a client is wrong, and safe between threads.
#include <gtest/gtest.h>

#include <thread>

#include "Client.h"
#include "VirtualCamera.h"

namespace virtualcamera::test {
namespace {

using camerakit::test::Client;
using camerakit::test::Opened;

struct ModelTest : testing::Test {
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

TEST_F(ModelTest, AnUnpluggedCameraAnswersTheShotsOfWhichAByteIsMissing) {
  camera.setTransfer({.deliveryBytes = 400});
  camera.shootPair(patternPicture(kNkMAIDFileDataType_NEF, 1), Picture::jpeg({1, 2}));
  camera.shootPair(patternPicture(kNkMAIDFileDataType_NEF, 3), Picture::jpeg({1, 2, 3, 4}));
  for (const uint64_t size : {1000, 400}) camera.shoot(patternPicture(kNkMAIDFileDataType_NEF, size));
  EXPECT_EQ(Opened(device, 1).transfer(), kNkMAIDResult_NoError);
  Opened part(device, 5);
  part.data.start(kNkMAIDCapability_Acquire);
  part.data.poll();
  Opened last(device, 6);
  std::vector<std::vector<uint64_t>> left;
  last.data.inCallback = [&] {
    for (const Shot& shot : model.removeCamera(1)) {
      left.emplace_back();
      for (const Picture& picture : shot) left.back().push_back(picture.size());
    }
  };
  last.data.start(kNkMAIDCapability_Acquire);
  last.data.poll();
  EXPECT_EQ(left, (decltype(left){{2}, {3, 4}, {1000}}));
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
    coming.shoot(patternPicture(kNkMAIDFileDataType_JPEG, 50'000));
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
