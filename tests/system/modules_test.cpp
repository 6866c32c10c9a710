// Several modules, a stranger's, broken ones, and what a module sees at the end.

#include <set>
#include <sstream>
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

constexpr double kOtherStudio = 0x0301;
constexpr double kStranger = 0x0501;

std::string strangersPicture() {
  std::string bytes(1000, '\0');
  for (std::size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<char>(i * 7);
  return bytes;
}

TEST_F(Modules, ConnectingACameraOfOneDisconnectsTheOthers) {
  helper.install("Type0003Module", VIRTUAL_CAMERA_MODULE);
  fs::create_directories(helper.cameras() / "2-Field");
  startWithCamera();
  for (const double device : {0x0102, 0x0301, 0x0302}) {
    EXPECT_EQ(helper.await("deviceAdded").number("device_id"), device);
  }
  connect(kStudio);
  EXPECT_EQ(settingsError(2, kOtherStudio), "Module specified was not connected");
  connect(kOtherStudio);
  EXPECT_EQ(settingsError(3, kStudio), "Module specified was not connected");
  EXPECT_EQ(settingsError(4, 0x0302), "Camera specified was not connected");
  helper.send(request("getCameraSettings", 5, kOtherStudio));
  EXPECT_EQ(helper.awaitAnswer(5).name, "ok");
  // Disconnected, not forgotten: a failed connection leaves its module without a camera.
  helper.send(request("connectDevice", 6, 0x0109));
  EXPECT_EQ(helper.awaitAnswer(6).number("error_code"), -1);
  EXPECT_EQ(settingsError(7, kStudio), "No camera is connected");
}

TEST_F(Modules, AStrangersIsLoadedListedReadFiredAndDelivers) {
  helper.install("Type0005Module", STRANGER_MODULE, "stranger");
  helper.start();
  const Message& added = helper.await("deviceAdded");
  EXPECT_EQ(added.number("device_id"), kStranger);
  EXPECT_EQ(added.text("name"), "Stranger");
  helper.send(request("connectDevice", 1, kStranger));
  EXPECT_EQ(helper.awaitAnswer(1).name, "ok");
  const Message& settings = helper.await("cameraSettingsChanged");
  EXPECT_EQ(settings.entries(), 7U);
  EXPECT_EQ(settings.number("isoSpeed"), 200);
  EXPECT_EQ(settings.number("batteryLevel"), -1);
  EXPECT_EQ(settings.text("aperture"), "f/4");
  EXPECT_EQ(settings.text("whiteBalance"), "Sunny");
  for (const char* missing : {"availableShots", "aeMode", "shutter"}) EXPECT_TRUE(settings.isNil(missing)) << missing;
  for (const char* name : {"Capture0001.tif", "Capture0002.tif"}) {
    helper.send(request("doCapture", 2));
    EXPECT_EQ(helper.await("objectWasAdded").text("file_name"), name);
    const fs::path path = helper.await("fileDownloadComplete").text("file_path");
    EXPECT_EQ(path, helper.temporary() / name);
    EXPECT_TRUE(readFile(path) == strangersPicture());
  }
}

TEST_F(Modules, ThatDoNotLoadOrOpenAreSkippedAndTheOthersWork) {
  writeExecutable("Type0002Module", "no library\n");
  helper.install("Type0003Module", STRANGER_WITHOUT_ENTRY);
  helper.install("Type0004Module", STRANGER_THAT_FAILS);
  fs::create_directories(helper.helpers() / "Type0006Module.bundle/Contents" / TETHER_BUNDLE_PLATFORM);
  writeExecutable("Type0007Module", readFile(TETHER_HELPER));                    // a program
  writeExecutable("Type0008Module", readFile(STRANGER_MODULE).substr(0, 5000));  // a copy that was cut short
  helper.install("Type0017Module", STRANGER_MODULE);
  helper.install("Type0018Module", STRANGER_MODULE);  // there is no such type
  startWithCamera();
  EXPECT_EQ(helper.await("deviceAdded").number("device_id"), 0x1101);
  connect(0x1101);
  connect(kStudio);
  for (const double device : {0x0201, 0x0301, 0x0401, 0x0601, 0x0701, 0x0801}) {
    helper.send(request("connectDevice", 9, device));
  }
  helper.settle();
  EXPECT_EQ(helper.count("deviceAdded"), 2U);
  for (const Message& message : helper.messages()) EXPECT_NE(message.id, 9);
}

// One picture is on its way and two are waiting when the end comes.
TEST_F(Modules, AreClosedObjectByObjectFromTheDeepestOnShutdownAndATransferEndsWhole) {
  const fs::path log = helper.folder() / "stranger.log";
  helper.install("Type0005Module", STRANGER_MODULE);
  helper.setEnvironment("STRANGER_LOG", log.string());
  helper.setEnvironment("STRANGER_PACE_MS", "200");
  helper.start();
  helper.send(request("connectDevice", 1, kStranger) + request("doCapture", 2) + request("doCapture", 3) +
              request("doCapture", 4));
  helper.await("objectWasAdded");
  helper.send(request("shutdown", 5));
  EXPECT_EQ(helper.wait(), 0);
  EXPECT_EQ(helper.count("objectWasAdded"), helper.count("fileDownloadComplete"));
  EXPECT_TRUE(readFile(helper.await("fileDownloadComplete").text("file_path")) == strangersPicture());

  std::set<std::string> open;
  std::istringstream lines(readFile(log));
  for (std::string what, path; lines >> what >> path;) {
    if (what == "open") {
      EXPECT_TRUE(open.insert(path).second) << path;
      continue;
    }
    EXPECT_EQ(open.erase(path), 1U) << path;
    const auto below = open.lower_bound(path + "/");
    EXPECT_TRUE(below == open.end() || below->rfind(path + "/", 0) != 0) << path << " before " << *below;
  }
  EXPECT_TRUE(open.empty()) << *open.begin() << " is still open";
  EXPECT_NE(readFile(log).find("open 0/1/3/1\n"), std::string::npos);
}

}  // namespace
}  // namespace tether
