// Cameras that come and go, and requests that name them.

#include "DeferredCalls.h"
#include "ServiceTest.h"

// What the forwarding module calls.
extern "C" __attribute__((visibility("default"))) std::int32_t testEntryPoint(
    tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType, std::uint64_t data,
    NkMAIDCompletionProc* completion, void* reference) {
  return virtualcamera::entryPoint(object, command, parameter, dataType, data, completion, reference);
}

namespace {

using virtualcamera::Capability;
using virtualcamera::Level;

TEST_F(ServiceTest, AnEventWhileTheModuleIsOpenedLeadsToAScan) {
  model.afterCall([&](const virtualcamera::Call& call) {
    if (call.command != kNkMAIDCommand_CapSet || call.parameter != kNkMAIDCapability_EventProc) return;
    model.afterCall({});
    model.addCamera(1, "Early");
  });
  service.reset(NikonTetherService::getSingleton());
  idleUntil("deviceAdded");
  EXPECT_EQ(recorder.names(), "deviceAdded");
}

TEST_F(ServiceTest, ARescanAnnouncesWhatCameBeforeWhatWentAndDeletesThatOnTheDownloadThread) {
  model.addCamera(1, "One");
  model.addCamera(2, "Two");
  start();
  model.removeCamera(1);
  model.addCamera(3, "Three");
  idle();
  ASSERT_EQ(recorder.names(), "deviceAdded deviceAdded deviceAdded deviceRemoved");
  EXPECT_EQ(recorder.messages()[2].numbers.at("device_id"), 771);
  EXPECT_EQ(recorder.messages()[3].numbers.at("device_id"), 769);
  EXPECT_EQ(recorder.traced("removed camera: One - device id: 1"), 1U);
  EXPECT_EQ(recorder.logged("Nikon Download Thread> - Releasing lock"), 1U);
  EXPECT_EQ(model.openObjects(), 3U);
  idle();
  EXPECT_EQ(recorder.traced("scanAndInformHostOfCameraChanges begin"), 1U) << "the flag was cleared";
}

TEST_F(ServiceTest, ACameraThatIsNotAliveOrNotListedGoesAndComesAnewAndOneWithoutANameIsTriedAgain) {
  auto& camera = model.addCamera(1, "One");
  model.addCamera(2, "Two");
  model.faults().add(
      {.level = Level::Camera, .parameter = kNkMAIDCapability_Name, .times = 1, .answer = kNkMAIDResult_DeviceBusy});
  const auto scan = [this] {
    recorder.forgetMessages();
    service->doCameraScanOnIdle();
    idle();
    return recorder.names();
  };
  start();
  EXPECT_EQ(recorder.names(), "deviceAdded");
  EXPECT_EQ(recorder.traced("Error caught while creating camera: 152"), 1U);
  EXPECT_EQ(model.openObjects(), 2U);
  EXPECT_EQ(scan(), "deviceAdded");
  camera.setAlive(false);
  EXPECT_EQ(scan(), "deviceRemoved");
  camera.setAlive(true);
  EXPECT_EQ(scan(), "deviceAdded");
  const std::size_t asked = recorder.traced("isAlive()");
  model.faults().add({.level = Level::Module,
                      .parameter = kNkMAIDCapability_Children,
                      .times = 1,
                      .answer = kNkMAIDResult_UnexpectedError});
  EXPECT_EQ(scan(), "deviceRemoved deviceRemoved");
  EXPECT_EQ(recorder.traced("isAlive()"), asked) << "liveness is asked of listed cameras only";
  EXPECT_EQ(scan(), "deviceAdded deviceAdded");
}

TEST_F(ServiceTest, IdsThatAreNoCamerasAreLeftOutAndRepeatedOnesCountOnce) {
  for (const std::uint32_t id : {1U, 255U}) model.addCamera(id, "Camera");
  model.faults().add({.level = Level::Module, .children = {{0, 256, 0xFFFFFFFF, 255, 1, 255}}});
  start();
  service->doCameraScanOnIdle();
  idle();
  EXPECT_EQ(recorder.names(), "deviceAdded deviceAdded");
  EXPECT_EQ(recorder.messages()[0].numbers.at("device_id"), 0x3FF);
  EXPECT_EQ(recorder.traced("addCamera(): id is outside 1 to 255: "), 6U);
}

TEST_F(ServiceTest, ConnectingAnswersOkTellsTheSettingsAndHasPicturesSavedWhereTheyWereNot) {
  auto& camera = model.addCamera(1, "One");
  camera.set(Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 0));
  auto& other = model.addCamera(2, "Two");
  other.set(Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 2));
  start();
  recorder.forgetMessages();
  connect(7, 1);
  ASSERT_EQ(recorder.names(), "ok#7 cameraSettingsChanged");
  EXPECT_EQ(camera.get(kNkMAIDCapability_SaveMedia), Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 1));
  connect(8, 1);
  EXPECT_EQ(recorder.traced("camera was already connected - id: 769"), 1U);
  connect(9, 5);
  ASSERT_EQ(recorder.names(), "ok#7 cameraSettingsChanged error#9");
  EXPECT_EQ(recorder.messages()[2].numbers.at("error_code"), -1);
  EXPECT_TRUE(recorder.messages()[2].strings.empty());
  service->disconnectDevice(0, device(0x301).get());
  EXPECT_EQ(recorder.traced("but no camera is currently connected (this is probably OK)"), 1U);
  connect(10, 2);  // the failed request had disconnected the other
  EXPECT_EQ(recorder.names(), "ok#7 cameraSettingsChanged error#9 ok#10");
  EXPECT_EQ(other.get(kNkMAIDCapability_SaveMedia), Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 2));
}

TEST_F(ServiceTest, SettingsFollowEachOtherHalfASecondApartAndAtMostOneWaitsAndNoneForADeletedModule) {
  model.addCamera(1, "One");
  start();
  const auto first = platform::Clock::now();
  const auto connectAgain = [this](int messageId) {
    service->disconnectDevice(messageId, device(0x301).get());
    connect(messageId, 1);
  };
  for (const int id : {1, 3, 5}) connectAgain(id);
  ASSERT_EQ(recorder.names(), "deviceAdded ok#1 cameraSettingsChanged ok#3 ok#5");
  const auto turn = [&] {
    while (CallDelay::queuedCount() > 0) platform::RunLoop::current()->runOnce(first + std::chrono::seconds(10));
  };
  turn();
  EXPECT_GE(platform::Clock::now() - first, std::chrono::milliseconds(499));
  EXPECT_EQ(recorder.names(), "deviceAdded ok#1 cameraSettingsChanged ok#3 ok#5 cameraSettingsChanged");
  connectAgain(7);
  EXPECT_EQ(CallDelay::queuedCount(), 1U);
  service.reset();
  recorder.forgetMessages();
  turn();
  EXPECT_EQ(recorder.names(), "");
}

}  // namespace
