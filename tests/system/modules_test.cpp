// Several modules, an example in C, and broken ones.

#include <string>

#include "Helper.h"

namespace tether {
namespace {

namespace fs = std::filesystem;

class Modules : public HelperTest {
 protected:
  std::string settingsError(std::int32_t id, double deviceId) {
    helper.send(request("getCameraSettings", id, deviceId));
    return helper.awaitAnswer(id).text("error_description");
  }
  void writeExecutable(const std::string& bundle, const std::string& bytes) const {
    drop(helper.helpers() / (bundle + ".bundle") / "Contents" / TETHER_BUNDLE_PLATFORM / bundle, bytes);
  }
};

TEST_F(Modules, ConnectingACameraOfOneDisconnectsTheOthers) {
  helper.install("Type0003Module", VIRTUAL_CAMERA_MODULE);
  fs::create_directories(helper.cameras() / "2-Field");
  startWithCamera();
  for (const double device : {0x0102, 0x0301, 0x0302}) {
    EXPECT_EQ(helper.await("deviceAdded").number("device_id"), device);
  }
  connect();
  EXPECT_EQ(settingsError(2, 0x0301), "Module specified was not connected");
  connect(0x0301);
  EXPECT_EQ(settingsError(3, kStudio), "Module specified was not connected");
  EXPECT_EQ(settingsError(4, 0x0302), "Camera specified was not connected");
  helper.send(request("getCameraSettings", 5, 0x0301));
  EXPECT_EQ(helper.awaitAnswer(5).name, "ok");
  // Disconnected, not forgotten: a failed connection leaves its module without a camera.
  helper.send(request("connectDevice", 6, 0x0109));
  EXPECT_EQ(helper.awaitAnswer(6).number("error_code"), -1);
  EXPECT_EQ(settingsError(7, kStudio), "No camera is connected");
}

TEST_F(Modules, TheExampleInCIsLoadedListedReadFiredAndDelivers) {
  constexpr double kExample = 0x0501;
  helper.install("Type0005Module", EXAMPLE_MODULE, "example");
  helper.start();
  EXPECT_EQ(helper.await("deviceAdded").text("name"), "Example");
  helper.send(request("connectDevice", 1, kExample));
  const Received& settings = helper.await("cameraSettingsChanged");
  EXPECT_EQ(settings.number("isoSpeed"), 200);
  EXPECT_EQ(settings.number("batteryLevel"), -1);
  EXPECT_EQ(settings.text("aperture"), "f/4");
  EXPECT_EQ(settings.text("whiteBalance"), "Sunny");
  EXPECT_EQ(settings.value("shutter")->getType(), kKtLuaTypeNil);
  std::string picture(1000, '\0');
  for (std::size_t i = 0; i < picture.size(); ++i) picture[i] = static_cast<char>(i * 7);
  for (const char* name : {"Capture0001.tif", "Capture0002.tif"}) {
    helper.send(request("doCapture", 2));
    EXPECT_EQ(helper.await("fileDownloadComplete").text("file_path"), helper.temporary() / name);
    EXPECT_TRUE(readFile(helper.temporary() / name) == picture);
  }
}

TEST_F(Modules, ThatPrintReadAndCloseWhereTheHostsPipesWereDoNotTouchThem) {
  helper.install("Type0005Module", BROKEN_MODULE);
  helper.setEnvironment("BROKEN", "pipes");
  helper.start();
  helper.await("deviceAdded");
  helper.send(request("connectDevice", 1, 0x0501) + request("getDeviceInfo", 2));
  EXPECT_EQ(helper.await("cameraSettingsChanged").number("isoSpeed"), 200);
  helper.send(request("getCameraSettings", 3, 0x0501));
  EXPECT_EQ(helper.awaitAnswer(3).name, "ok");
}

TEST_F(Modules, ThatDoNotLoadOrOpenAreSkippedAndTheOthersWork) {
  writeExecutable("Type0002Module", "no library\n");
  helper.install("Type0003Module", MODULE_WITHOUT_ENTRY);
  helper.install("Type0004Module", BROKEN_MODULE);
  helper.setEnvironment("BROKEN", "fails");
  fs::create_directories(helper.helpers() / "Type0006Module.bundle/Contents" / TETHER_BUNDLE_PLATFORM);
  writeExecutable("Type0007Module", readFile(TETHER_HELPER));                          // a program
  writeExecutable("Type0008Module", readFile(VIRTUAL_CAMERA_MODULE).substr(0, 5000));  // a copy that was cut short
  helper.install("Type0017Module", VIRTUAL_CAMERA_MODULE, "AnyName");
  helper.install("Type0018Module", VIRTUAL_CAMERA_MODULE);  // there is no such type
  startWithCamera();
  EXPECT_EQ(helper.await("deviceAdded").number("device_id"), 0x1101);
  connect(0x1101);
  connect();
  for (const double device : {0x0201, 0x0301, 0x0401, 0x0601, 0x0701, 0x0801}) {
    helper.send(request("connectDevice", 9, device));
  }
  helper.settle();
  EXPECT_EQ(helper.count("deviceAdded"), 2U);
  for (const Received& message : helper.messages()) EXPECT_NE(message.id, 9);
}

}  // namespace
}  // namespace tether
