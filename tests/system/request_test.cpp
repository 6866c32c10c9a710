// Requests and their answers.

#include <limits>
#include <string>
#include <vector>

#include "Helper.h"

namespace tether {
namespace {

using namespace std::string_literals;

class Requests : public HelperTest {
 protected:
  // Nothing but these messages, besides heartbeats, since the start.
  void expectOnly(const std::vector<std::string>& names) {
    std::vector<std::string> seen;
    for (const Received& message : helper.messages()) {
      if (message.name != "heartbeat" && message.id < 1'000'000) seen.push_back(message.name);
    }
    EXPECT_EQ(seen, names);
  }
};

void expectSettings(const Received& message) {
  EXPECT_EQ(message.entries(), 7U);
  EXPECT_EQ(message.number("isoSpeed"), 400);
  EXPECT_EQ(message.number("batteryLevel"), 85);
  EXPECT_EQ(message.value("availableShots")->getType(), kKtLuaTypeNil);
  EXPECT_EQ(message.text("aeMode"), "Manual");
  EXPECT_EQ(message.text("aperture"), "f/5.6");
  EXPECT_EQ(message.text("shutter"), "1/125");
  EXPECT_EQ(message.text("whiteBalance"), "Auto");
}

TEST_F(Requests, ConnectingAnswersByteForByteAndIsFollowedByAllSettings) {
  startWithCamera(R"({"settings": {"FreeBytes": null}})");
  helper.send(
      "\x40\0\0\0\x07\0\0\0\x03\0\0\0\x0e\0\0\0connectDevice\0\x05\0\0\0\x01\0\0\0"
      "\x03\0\0\0\x0a\0\0\0device_id\0\x02\0\0\0\0\0\0\0\0\x10\x70\x40"s);
  const Received& ok = helper.await("ok");
  EXPECT_EQ(ok.bytes, "\x13\0\0\0\x07\0\0\0\x03\0\0\0\x03\0\0\0ok\0\x01\0\0\0"s);
  const Received& changed = helper.await("cameraSettingsChanged");
  EXPECT_EQ(changed.id, 0);
  EXPECT_GT(changed.place, ok.place);
  expectSettings(changed);

  // Again: no answer, and it stays connected.
  helper.send(request("connectDevice", 8, kStudio) + request("getCameraSettings", 9, kStudio));
  expectSettings(helper.awaitAnswer(9));
  // The camera that is named for the disconnection does not matter, as long as its module exists.
  helper.send(request("disconnectDevice", 6, 0x1102) + request("getCameraSettings", 10, kStudio) +
              request("disconnectDevice", 7, 0x0102) + request("getCameraSettings", 11, kStudio));
  EXPECT_EQ(helper.awaitAnswer(10).name, "ok");
  const Received& error = helper.awaitAnswer(11);
  EXPECT_EQ(error.entries(), 2U);
  EXPECT_EQ(error.number("error_code"), 65535);
  EXPECT_EQ(error.text("error_description"), "No camera is connected");
  expectOnly({"deviceAdded", "ok", "cameraSettingsChanged", "ok", "ok", "error"});
}

TEST_F(Requests, WhatIsNoRequestOrDoesNothingHasNoAnswerAndCostsNothingBehindIt) {
  startWithCamera();
  for (const char* name : {"getDeviceInfo", "downloadThumbnail", "getCaptureInfo", "startDownload", "listDevices",
                           "connectdevice", "Connectdevice", "connectDevice ", "heartbeat", "", "doCapture"}) {
    helper.send(request(name, 5, kStudio));
  }
  const std::string connecting = encodeElement(KtLuaTEString("connectDevice"));
  const std::string payload = encodeElement(KtLuaTENil());
  helper.send(frame(5, encodeElement(KtLuaTENumber(5)), payload));
  helper.send(frame(5, littleEndian(9), payload));  // no kind of element
  helper.send(frame(5, connecting, littleEndian(9)));
  helper.send(frame(5, connecting, littleEndian(kKtLuaTypeData) + littleEndian(0xFFFFFFFF)));  // can never be a message
  KtLuaTETable text;
  text.Set("device_id", new KtLuaTEString("257"));
  helper.send(frame(5, connecting, encodeElement(text)));
  for (const double device : {0.0, 1.0, 0x0201 + 0.0, 1e300, -1e300, std::numeric_limits<double>::quiet_NaN()}) {
    helper.send(request("connectDevice", 5, device) + request("getCameraSettings", 5, device) +
                request("disconnectDevice", 5, device));
  }
  helper.settle();
  expectOnly({"deviceAdded"});
}

}  // namespace
}  // namespace tether
