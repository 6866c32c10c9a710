// Cameras that come and go, and requests that name them.

#include <cmath>
#include <future>

#include "DeferredCalls.h"
#include "ServiceTest.h"

namespace {

using virtualcamera::Capability;
using virtualcamera::Level;

TEST_F(ServiceTest, AnnouncesEachCameraOnceInTheOrderListed) {
  model.addCamera(1, "One");
  model.addCamera(2, "Two");
  start();
  service->listDevices(9, nullptr);
  const auto sent = recorder.messages();
  ASSERT_EQ(recorder.names(), "deviceAdded deviceAdded");
  EXPECT_EQ(sent[0].numbers.at("device_id"), 769);
  EXPECT_EQ(sent[0].strings.at("name"), "One");
  EXPECT_EQ(sent[1].numbers.at("device_id"), 770);
}

TEST_F(ServiceTest, ARescanAnnouncesWhatCameBeforeWhatWentAndDeletesThatOnTheDownloadThread) {
  model.addCamera(1, "One");
  model.addCamera(2, "Two");
  start();
  recorder.forgetMessages();
  model.removeCamera(1);
  model.addCamera(3, "Three");
  EXPECT_EQ(model.openObjects(), 3U);
  idle();
  ASSERT_EQ(recorder.names(), "deviceAdded deviceRemoved");
  EXPECT_EQ(recorder.messages()[0].numbers.at("device_id"), 771);
  EXPECT_EQ(recorder.messages()[1].numbers.at("device_id"), 769);
  EXPECT_EQ(recorder.traced("removed camera: One - device id: 1"), 1U);
  EXPECT_EQ(recorder.logged("Nikon Download Thread> - Releasing lock"), 1U);
  EXPECT_EQ(model.openObjects(), 3U);
  idle();
  EXPECT_EQ(recorder.traced("scanAndInformHostOfCameraChanges begin"), 1U) << "the flag was cleared";
}

TEST_F(ServiceTest, ACameraThatIsListedButNotAliveGoesAndComesAnew) {
  auto& camera = model.addCamera(1, "One");
  model.addCamera(2, "Two");
  start();
  recorder.forgetMessages();
  camera.setAlive(false);
  service->doCameraScanOnIdle();
  idle();
  EXPECT_EQ(recorder.names(), "deviceRemoved");
  camera.setAlive(true);
  service->doCameraScanOnIdle();
  idle();
  EXPECT_EQ(recorder.names(), "deviceRemoved deviceAdded");
}

TEST_F(ServiceTest, LivenessIsAskedOfMarkedCamerasOnlyAndAFailedListingRemovesAll) {
  model.addCamera(1, "One");
  model.addCamera(2, "Two");
  start();
  recorder.forgetMessages();
  model.faults().add({.level = Level::Module,
                      .parameter = kNkMAIDCapability_Children,
                      .times = 1,
                      .answer = kNkMAIDResult_UnexpectedError});
  service->doCameraScanOnIdle();
  idle();
  EXPECT_EQ(recorder.names(), "deviceRemoved deviceRemoved");
  EXPECT_EQ(recorder.traced("isAlive()"), 0U);
  service->doCameraScanOnIdle();
  idle();
  EXPECT_EQ(recorder.names(), "deviceRemoved deviceRemoved deviceAdded deviceAdded");
  EXPECT_EQ(recorder.traced("isAlive(): TRUE"), 2U);
}

TEST_F(ServiceTest, ACameraWhoseNameCannotBeReadIsTriedAgainWithTheNextScan) {
  model.addCamera(1, "One");
  model.faults().add(
      {.level = Level::Camera, .parameter = kNkMAIDCapability_Name, .times = 1, .answer = kNkMAIDResult_DeviceBusy});
  start();
  EXPECT_EQ(recorder.names(), "");
  EXPECT_EQ(recorder.traced("Error caught while creating camera: 152"), 1U);
  EXPECT_EQ(model.openObjects(), 1U);
  service->doCameraScanOnIdle();
  idle();
  EXPECT_EQ(recorder.names(), "deviceAdded");
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

TEST_F(ServiceTest, ConnectingAnswersOkAndThenTellsTheSettings) {
  auto& camera = model.addCamera(1, "One");
  camera.remove(kNkMAIDCapability_FreeBytes);
  camera.set(Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 0));
  start();
  recorder.forgetMessages();
  connect(7, 1);
  ASSERT_EQ(recorder.names(), "ok#7 cameraSettingsChanged");
  EXPECT_FALSE(recorder.messages()[0].hasPayload);
  const Message settings = recorder.messages()[1];
  EXPECT_EQ(settings.nils, (std::vector<std::string>{"availableShots"}));
  for (const char* key : {"isoSpeed", "batteryLevel", "aeMode", "aperture", "shutter", "whiteBalance"}) {
    EXPECT_EQ(settings.numbers.count(key) + settings.strings.count(key), 1U) << key;
  }
  EXPECT_EQ(camera.get(kNkMAIDCapability_SaveMedia), Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 1));

  connect(8, 1);
  EXPECT_EQ(recorder.traced("camera was already connected - id: 769"), 1U);
  connect(9, 5);
  ASSERT_EQ(recorder.names(), "ok#7 cameraSettingsChanged error#9");
  EXPECT_EQ(recorder.messages()[2].numbers.at("error_code"), -1);
  EXPECT_TRUE(recorder.messages()[2].strings.empty());
  connect(10, 1);  // the failed request had disconnected it
  EXPECT_EQ(recorder.names(), "ok#7 cameraSettingsChanged error#9 ok#10");
}

TEST_F(ServiceTest, AnySaveMediaButZeroStays) {
  auto& camera = model.addCamera(1, "One");
  camera.set(Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 2));
  start();
  connect(1, 1);
  EXPECT_EQ(camera.get(kNkMAIDCapability_SaveMedia), Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 2));
}

TEST_F(ServiceTest, SettingsFollowEachOtherHalfASecondApartAndAtMostOneWaits) {
  model.addCamera(1, "One");
  start();
  connect(1, 1);
  const auto first = platform::Clock::now();
  service->disconnectDevice(2, device(0x301).get());
  connect(3, 1);
  service->disconnectDevice(4, device(0x301).get());
  connect(5, 1);
  ASSERT_EQ(recorder.names(), "deviceAdded ok#1 cameraSettingsChanged ok#3 ok#5");
  while (CallDelay::queuedCount() > 0) platform::RunLoop::current()->runOnce(first + std::chrono::seconds(10));
  EXPECT_GE(platform::Clock::now() - first, std::chrono::milliseconds(499));
  EXPECT_EQ(recorder.names(), "deviceAdded ok#1 cameraSettingsChanged ok#3 ok#5 cameraSettingsChanged");
}

TEST_F(ServiceTest, AnUpdateThatWaitsDoesNotReachADeletedModule) {
  model.addCamera(1, "One");
  start();
  connect(1, 1);
  service->disconnectDevice(2, device(0x301).get());
  connect(3, 1);
  service.reset();
  recorder.forgetMessages();
  while (CallDelay::queuedCount() > 0) platform::RunLoop::current()->runOnce(platform::Clock::time_point::max());
  EXPECT_EQ(recorder.names(), "");
}

TEST_F(ServiceTest, DisconnectingGoesOnAfterAMismatch) {
  model.addCamera(1, "One");
  start();
  service->disconnectDevice(1, device(0x301).get());  // nothing was ever connected
  connect(2, 1);
  service->disconnectDevice(3, device(0x302).get());
  EXPECT_EQ(recorder.traced("but the id (770) did not match that of the currently connected camera"), 1U);
  EXPECT_EQ(recorder.traced("connected camera id is: 1"), 1U);
  service->disconnectDevice(4, device(0x301).get());
  EXPECT_EQ(recorder.traced("but no camera is currently connected (this is probably OK)"), 1U);
}

TEST_F(ServiceTest, SettingsRequestsAreAnsweredOrRefusedWithTheirReason) {
  model.addCamera(1, "One");
  model.addCamera(2, "Two");
  start();
  recorder.forgetMessages();
  askSettings(1, 0x301);
  connect(2, 1);
  askSettings(3, 0x302);
  askSettings(4, 0x301);
  model.removeCamera(1);
  idle();
  askSettings(5, 0x301);
  ASSERT_EQ(recorder.names(), "error#1 ok#2 cameraSettingsChanged error#3 ok#4 deviceRemoved error#5");
  const auto sent = recorder.messages();
  EXPECT_EQ(sent[0].strings.at("error_description"), "Module specified was not connected");
  EXPECT_EQ(sent[0].numbers.at("error_code"), 65535);
  EXPECT_EQ(sent[3].strings.at("error_description"), "Camera specified was not connected");
  EXPECT_EQ(sent[4].numbers, sent[2].numbers);
  EXPECT_EQ(sent[6].strings.at("error_description"), "No camera is connected");
}

TEST_F(ServiceTest, ASettingsRequestIsDroppedWhileTheSdkIsBusy) {
  model.addCamera(1, "One");
  start();
  connect(1, 1);
  recorder.forgetMessages();
  std::promise<void> held;
  std::promise<void> release;
  auto holder = std::async(std::launch::async, [&] {
    const std::lock_guard guard(getAsyncLock());
    held.set_value();
    release.get_future().wait();
  });
  held.get_future().wait();
  askSettings(2, 0x301);
  EXPECT_EQ(recorder.names(), "");
  release.set_value();
  holder.get();
  askSettings(3, 0x301);
  EXPECT_EQ(recorder.names(), "ok#3");
}

TEST_F(ServiceTest, APayloadWithoutAUsableDeviceIdNamesNoModule) {
  model.addCamera(1, "One");
  start();
  recorder.forgetMessages();
  KtLuaTETable text;
  text.Set("device_id", new KtLuaTEString("769"));
  KtLuaTETable nothing;
  KtLuaTENumber number(769);
  for (KtLuaTE* payload : std::initializer_list<KtLuaTE*>{&text, &nothing, &number, nullptr}) {
    service->connectDevice(1, payload);
  }
  for (const double wild : {std::nan(""), 1e300, -1e300, 4294967296.0 + 769}) {
    service->connectDevice(2, device(wild).get());
  }
  EXPECT_EQ(recorder.traced("could not find module id 0"), 8U);
  EXPECT_EQ(recorder.names(), "");
  service->connectDevice(3, device(769.9).get());
  EXPECT_EQ(recorder.names(), "ok#3 cameraSettingsChanged");
}

}  // namespace
