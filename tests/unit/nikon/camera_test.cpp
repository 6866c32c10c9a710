// Shots: how the camera numbers what it announces.

#include "ServiceTest.h"

namespace {

using virtualcamera::Level;
using virtualcamera::Picture;

TEST_F(ServiceTest, APairWhoseSecondFileNeverComesIsOverWithTheNextShot) {
  auto& camera = model.addCamera(1, "One");
  start();
  model.faults().add(
      {.level = Level::Item, .item = 2, .command = kNkMAIDCommand_Open, .answer = kNkMAIDResult_NoMedia});
  camera.shootPair(Picture::raw(bytes(30)), Picture::jpeg(bytes(20)));
  camera.shoot(Picture::jpeg(bytes(11)));
  camera.shootPair(Picture::raw(bytes(30)), Picture::jpeg(bytes(20)));
  idleUntil("fileDownloadComplete", 4);
  EXPECT_EQ(recorder.traced("could not open item, error: -122"), 1U);
  EXPECT_EQ(files(),
            (std::vector<std::string>{"Capture0001.nef", "Capture0002.jpg", "Capture0003.jpg", "Capture0003.nef"}));
}

TEST_F(ServiceTest, TheShutterIsFiredOnTheConnectedCameraAloneAndTheOthersDeliverAllTheSame) {
  auto& first = model.addCamera(1, "One");
  auto& second = model.addCamera(2, "Two");
  second.load(Picture::jpeg(bytes(123)));
  start();
  service->doCapture(1, nullptr);
  connect(2, 2);
  service->doCapture(3, nullptr);
  idleUntil("fileDownloadComplete");
  EXPECT_EQ(recorder.await("objectWasAdded").numbers.at("file_size"), 123);
  EXPECT_EQ(recorder.traced("CCamera completion callback for command kNkMAIDCommand_CapStart"), 1U);
  first.raise(kNkMAIDEvent_CapChange, kNkMAIDCapability_Aperture);
  first.shoot(Picture::jpeg(bytes(5)));
  idleUntil("fileDownloadComplete", 2);
  EXPECT_EQ(recorder.traced("Camera event notification: kNkMAIDEvent_CapChange"), 1U);
  EXPECT_EQ(recorder.names(),
            "deviceAdded deviceAdded ok#2 cameraSettingsChanged objectWasAdded fileDownloadComplete objectWasAdded "
            "fileDownloadComplete");
}

TEST_F(ServiceTest, ACameraThatComesAnewCountsFromOneAgain) {
  for (int round = 1; round <= 2; ++round) {
    model.addCamera(1, "One").shoot(Picture::jpeg(bytes(5, round)));
    round == 1 ? start() : idle();
    const Message complete = idleUntil("fileDownloadComplete", static_cast<std::size_t>(round));
    EXPECT_EQ(recorder.await("objectWasAdded", static_cast<std::size_t>(round)).strings.at("file_name"),
              "Capture0001.jpg");
    EXPECT_EQ(read(complete.strings.at("file_path")), bytes(5, round));
    model.removeCamera(1);
    idleUntil("deviceRemoved", static_cast<std::size_t>(round));
  }
}

}  // namespace
