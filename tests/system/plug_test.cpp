// Cameras that come and go.

#include <string>

#include "Helper.h"

namespace tether {
namespace {

namespace fs = std::filesystem;

class Plug : public HelperTest {
 protected:
  void expectNext(const std::string& name, double deviceId) {
    EXPECT_EQ(helper.await(name).number("device_id"), deviceId) << name;
  }
  void expectNoCameraConnected(std::int32_t id) {
    helper.send(request("getCameraSettings", id, kStudio));
    EXPECT_EQ(helper.awaitAnswer(id).text("error_description"), "No camera is connected");
  }
};

constexpr double kField = 258;

TEST_F(Plug, EveryCameraIsAnnouncedOnceWhenItComesAndOnceWhenItGoes) {
  // Ids that do not fit are no cameras.
  for (const char* name : {"0-None", "256-Far", "257-Farther"}) fs::create_directories(helper.cameras() / name);
  startWithCamera();
  connect();
  plugIn("2-Field");
  expectNext("deviceAdded", kField);
  helper.send(request("listDevices", 2));
  unplug("2-Field");
  expectNext("deviceRemoved", kField);
  // The other one was not touched.
  helper.send(request("getCameraSettings", 3, kStudio));
  EXPECT_EQ(helper.awaitAnswer(3).name, "ok");
  unplug("1-Studio");
  expectNext("deviceRemoved", kStudio);
  expectNoCameraConnected(4);
  plugIn("1-Studio");
  expectNext("deviceAdded", kStudio);
  expectNoCameraConnected(5);
  connect();
  EXPECT_EQ(helper.count("deviceAdded"), 3U);
  EXPECT_EQ(helper.count("deviceRemoved"), 2U);
}

}  // namespace
}  // namespace tether
