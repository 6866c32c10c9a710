#include "ModuleLoading.h"

#include <gtest/gtest.h>

#include "Bundle.h"
#include "ServiceTest.h"

namespace {

TEST(Loading, AModulesPathIsInTheMainBundleWhetherItIsThereOrNot) {
  std::string path;
  EXPECT_EQ(FindNikonModulePath("Type0009Module", path), 0);
  EXPECT_EQ(path, platform::Bundle::mainBundlePath() + "/Contents/Helpers/Type0009Module.bundle");
  EXPECT_EQ(LoadNikonModule(path), nullptr);
  EXPECT_EQ(FindNikonModulePath("Type0003Module", path), 0);
  EXPECT_NE(LoadNikonModule(path), nullptr);
}

TEST_F(ServiceTest, SkipsModulesThatCannotBeLoadedOrOpened) {
  model.failCall(1, kNkMAIDResult_HardwareError);
  start();
  EXPECT_EQ(recorder.traced("could not be loaded"), 16U);
  EXPECT_EQ(recorder.traced("Nikon library Type0003Module could not be opened"), 1U);
  connect(1, 1);
  service->listDevices(2, nullptr);
  service->doCapture(3, nullptr);
  service->idle();
  EXPECT_EQ(recorder.traced("could not find module id 768"), 1U);
  EXPECT_EQ(recorder.names(), "");
}

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

}  // namespace
