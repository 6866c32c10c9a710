// Requests and their answers.

#include <limits>
#include <string>
#include <vector>

#include "Helper.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
using namespace std::string_literals;

class Requests : public HelperTest {
 protected:
  void expectError(std::int32_t id, double code, const std::string& text) {
    const Message& error = helper.awaitAnswer(id);
    EXPECT_EQ(error.name, "error");
    EXPECT_EQ(error.number("error_code"), code);
    EXPECT_EQ(error.entries(), text.empty() ? 1U : 2U);
    EXPECT_EQ(error.value("error_description") == nullptr ? "" : error.text("error_description"), text);
  }
  // Nothing but these messages, besides heartbeats, since the start.
  void expectOnly(const std::vector<std::string>& names) {
    std::vector<std::string> seen;
    for (const Message& message : helper.messages()) {
      if (message.name != "heartbeat" && message.id < 1'000'000) seen.push_back(message.name);
    }
    EXPECT_EQ(seen, names);
  }
};

void expectSettings(const Message& message) {
  EXPECT_EQ(message.entries(), 7U);
  EXPECT_EQ(message.number("isoSpeed"), 400);
  EXPECT_EQ(message.number("batteryLevel"), 85);
  EXPECT_TRUE(message.isNil("availableShots"));
  EXPECT_EQ(message.number("aeMode"), 3);
  EXPECT_EQ(message.text("aperture"), "f/5.6");
  EXPECT_EQ(message.text("shutter"), "1/125");
  EXPECT_EQ(message.text("whiteBalance"), "Auto");
}

TEST_F(Requests, ConnectingAnswersByteForByteAndIsFollowedByAllSettings) {
  startWithCamera(R"({"settings": {"FreeBytes": null}})");
  helper.send(
      "\x40\0\0\0\x07\0\0\0\x03\0\0\0\x0e\0\0\0connectDevice\0\x05\0\0\0\x01\0\0\0"
      "\x03\0\0\0\x0a\0\0\0device_id\0\x02\0\0\0\0\0\0\0\0\x10\x70\x40"s);
  const Message& ok = helper.await("ok");
  EXPECT_EQ(ok.bytes, "\x13\0\0\0\x07\0\0\0\x03\0\0\0\x03\0\0\0ok\0\x01\0\0\0"s);
  const Message& changed = helper.await("cameraSettingsChanged");
  EXPECT_EQ(changed.id, 0);
  EXPECT_GT(changed.place, ok.place);
  expectSettings(changed);

  // Again: no answer, and it stays connected.
  helper.send(request("connectDevice", 8, kStudio) + request("getCameraSettings", 9, kStudio));
  expectSettings(helper.awaitAnswer(9));
  expectOnly({"deviceAdded", "ok", "cameraSettingsChanged", "ok"});
}

TEST_F(Requests, FailuresHaveTheirCodesAndTexts) {
  startWithCamera();
  helper.send(request("getCameraSettings", 2, kStudio));
  expectError(2, 65535, "Module specified was not connected");
  helper.send(request("connectDevice", 3, 0x0102));
  expectError(3, -1, "");
  helper.send(request("getCameraSettings", 4, kStudio));
  expectError(4, 65535, "No camera is connected");
  connect(kStudio);
  helper.send(request("getCameraSettings", 5, 0x0102));
  expectError(5, 65535, "Camera specified was not connected");
  // The camera that is named for the disconnection does not matter, as long as its module exists.
  helper.send(request("disconnectDevice", 6, 0x1102) + request("getCameraSettings", 7, kStudio));
  EXPECT_EQ(helper.awaitAnswer(7).name, "ok");
  helper.send(request("disconnectDevice", 8, 0x0102) + request("getCameraSettings", 9, kStudio));
  expectError(9, 65535, "No camera is connected");
}

TEST_F(Requests, WhatIsNoRequestOrDoesNothingHasNoAnswer) {
  startWithCamera();
  for (const char* name : {"getDeviceInfo", "downloadThumbnail", "getCaptureInfo", "startDownload", "listDevices",
                           "connectdevice", "Connectdevice", "connectDevice ", "heartbeat", "", "doCapture"}) {
    helper.send(request(name, 5, kStudio));
  }
  const std::string payload = encoded(KtLuaTENil());
  helper.send(frame(5, encoded(KtLuaTENumber(5)), payload));
  helper.send(frame(5, littleEndian(9), payload));  // no kind of element
  helper.send(frame(5, encoded(KtLuaTEString("connectDevice")), littleEndian(9)));
  KtLuaTETable text;
  text.Set("device_id", new KtLuaTEString("257"));
  helper.send(frame(5, encoded(KtLuaTEString("connectDevice")), encoded(text)));
  for (const double device : {0.0, 1.0, 0x0201 + 0.0, 1e300, -1e300, std::numeric_limits<double>::quiet_NaN()}) {
    helper.send(request("connectDevice", 5, device) + request("getCameraSettings", 5, device) +
                request("disconnectDevice", 5, device));
  }
  helper.settle();
  expectOnly({"deviceAdded"});
}

TEST_F(Requests, ArriveInAnyPieces) {
  startWithCamera();
  helper.send(request("connectDevice", 1, kStudio) + request("getCameraSettings", 2, kStudio));
  const Message& first = helper.awaitAnswer(1);
  EXPECT_LT(first.place, helper.awaitAnswer(2).place);
  for (const char byte : request("getCameraSettings", 3, kStudio)) {
    helper.send(std::string(1, byte));
    awaitCondition("read byte", [&] { return helper.unreadByHelper() == 0; });
  }
  EXPECT_EQ(helper.awaitAnswer(3).name, "ok");
}

TEST_F(Requests, ASecondConnectionWithinHalfASecondIsFollowedByItsSettingsHalfASecondLater) {
  startWithCamera();
  const auto begin = Clock::now();
  helper.send(request("connectDevice", 1, kStudio) + request("disconnectDevice", 2, kStudio) +
              request("connectDevice", 3, kStudio));
  EXPECT_EQ(helper.awaitAnswer(1).name, "ok");
  helper.await("cameraSettingsChanged");
  EXPECT_EQ(helper.awaitAnswer(3).name, "ok");
  const Message& second = helper.await("cameraSettingsChanged");
  EXPECT_GE(second.arrived - begin, 0.55s);
  EXPECT_LE(second.arrived - begin, 10s);
  helper.settle();
  EXPECT_EQ(helper.count("cameraSettingsChanged"), 2U);
}

TEST_F(Requests, ASettingChangedOnTheCameraIsReadWhenAskedForAndNotAnnounced) {
  startWithCamera();
  connect(kStudio);
  drop(studio() / "camera.json", R"({"settings": {"Aperture": "f/8"}})");
  std::string aperture = "f/5.6";
  for (std::int32_t id = 10; aperture == "f/5.6" && id < 500; ++id) {
    helper.send(request("getCameraSettings", id, kStudio));
    aperture = helper.awaitAnswer(id).text("aperture");
  }
  EXPECT_EQ(aperture, "f/8");
  EXPECT_EQ(helper.count("cameraSettingsChanged"), 1U);
}

}  // namespace
}  // namespace tether
