#include <gtest/gtest.h>

#include <future>

#include "ModuleLoading.h"
#include "NikonObject.h"
#include "Recorder.h"

namespace {

using virtualcamera::Level;
using virtualcamera::Model;
using virtualcamera::Picture;
using virtualcamera::Target;

class ObjectTree : public ::testing::Test {
 protected:
  // A module with two cameras, each with one picture, all opened.
  void openAll() {
    for (const std::uint32_t id : {1U, 2U}) model.addCamera(id, "Camera").shoot(Picture::jpeg({1, 2, 3}));
    root = std::make_unique<CNikonObject>(Model::entryPoint(), "module");
    for (const std::int32_t id : {1, 2}) {
      CNikonObject* const item = root->openChild(id, "camera")->openChild(1, "item");
      ASSERT_NE(item->openChild(kNkMAIDDataObjType_Image, "data"), nullptr);
    }
  }

  Recorder recorder;
  Model model;
  std::unique_ptr<CNikonObject> root;
};

TEST_F(ObjectTree, ADeletedObjectClosesTheDeepestFirstAndLeavesItsParent) {
  openAll();
  model.record(true);
  CNikonObject* const camera = root->openChild(2, "camera");
  EXPECT_EQ(camera, root->openChild(2, "camera")) << "it is opened once";
  EXPECT_TRUE(model.calls().empty());
  delete camera;
  EXPECT_NE(root->openChild(2, "camera"), nullptr);
  EXPECT_EQ(model.openObjects(), 5U);
  root.reset();
  const std::vector<Target> expected{{Level::Data, 2, 1},   {Level::Item, 2, 1},  {Level::Camera, 2, 0},
                                     {Level::Data, 1, 1},   {Level::Item, 1, 1},  {Level::Camera, 1, 0},
                                     {Level::Camera, 2, 0}, {Level::Module, 0, 0}};
  EXPECT_EQ(model.closed(), expected);
  EXPECT_EQ(recorder.logged("Did acquire lock - ACQLOCK - for deleting CNikonObject: 0x"), 8U);
  EXPECT_EQ(recorder.logged("Releasing lock - ACQLOCK - for deleting CNikonObject: 0x"), 8U);
}

TEST_F(ObjectTree, ADeletionUnregistersBeforeItClosesAndHoldsTheLockForTheWholeSubtree) {
  openAll();
  CNikonObject* const camera = root->openChild(2, "camera");
  std::string order;
  model.beforeCall([&](const virtualcamera::Call& call) {
    order += std::string(" ") + "?MCID"[static_cast<int>(call.target.level)];
    order += call.command == kNkMAIDCommand_Close ? "-" : call.parameter == kNkMAIDCapability_EventProc ? "e" : "d";
    EXPECT_TRUE(call.command == kNkMAIDCommand_Close || call.dataType == kNkMAIDDataType_Null);
    std::async(std::launch::async, [] { EXPECT_FALSE(gNikonObjectLock.try_lock_for(std::chrono::seconds(0))); }).get();
  });
  delete camera;
  EXPECT_EQ(order, " Ce Cd Ie Id De Dd D- I- C-");
  model.beforeCall({});
  ASSERT_TRUE(gNikonObjectLock.try_lock_for(std::chrono::seconds(0)));
  gNikonObjectLock.unlock();
}

TEST_F(ObjectTree, AFailedOpenReportsTheSdkResultAndLeavesNothing) {
  root = std::make_unique<CNikonObject>(Model::entryPoint(), "module");
  EXPECT_EQ(root->openChild(5, "camera"), nullptr);
  EXPECT_EQ(recorder.traced("Error opening child: "), 1U);
  model.faults().add({.times = 1, .answer = kNkMAIDResult_MissingComponent});
  EXPECT_EQ(InitializeNikonModule(Model::entryPoint(), "module"), kNkMAIDResult_MissingComponent);
  EXPECT_EQ(recorder.traced("Error from Command_Open: kNkMAIDResult_MissingComponent"), 1U);
  EXPECT_EQ(InitializeNikonModule(Model::entryPoint(), "module"), 0);
  EXPECT_EQ(model.openObjects(), 1U);
}

TEST_F(ObjectTree, AClosedObjectSendsNothingAndIsNoParent) {
  openAll();
  CNikonObject* const camera = root->openChild(1, "camera");
  camera->closeNikonObject();
  model.record(true);
  camera->closeNikonObject();
  std::vector<std::int32_t> ids{1, 2};
  std::int32_t number = 0;
  EXPECT_EQ(camera->enumChildren(), -1);
  EXPECT_EQ(camera->listChildren(ids), -1);
  EXPECT_EQ(camera->getIntCapability(kNkMAIDCapability_BatteryLevel, number), -1);
  EXPECT_EQ(camera->capStart(kNkMAIDCapability_Capture, nullptr, nullptr), -1);
  EXPECT_FALSE(camera->async() || camera->checkObject());
  EXPECT_EQ(camera->openChild(2, "item"), nullptr);
  EXPECT_TRUE(ids.empty());
  EXPECT_TRUE(model.calls().empty());
}

TEST_F(ObjectTree, ACallInProgressOnAnotherThreadPutsTheCloseOffAndNoneBeginsAfterIt) {
  openAll();
  model.record(true);
  CNikonObject* const camera = root->openChild(1, "camera");
  CNikonObject* const item = camera->openChild(1, "item");
  std::promise<void> inside;
  std::promise<void> mayReturn;
  model.beforeCall([&](const virtualcamera::Call& call) {
    if (call.command != kNkMAIDCommand_Async) return;
    inside.set_value();
    mayReturn.get_future().wait();
  });
  auto poller = std::async(std::launch::async, [&] { return item->async(); });
  inside.get_future().wait();
  item->closeNikonObject();
  camera->closeNikonObject();
  EXPECT_FALSE(item->async());
  EXPECT_TRUE(model.closed().empty());
  mayReturn.set_value();
  EXPECT_TRUE(poller.get());
  EXPECT_EQ(model.closed(), (std::vector<Target>{{Level::Item, 1, 1}, {Level::Camera, 1, 0}}));
}

TEST_F(ObjectTree, ChildrenAreListedInTheOrderOfTheSdkAndFailuresEmptyTheList) {
  openAll();
  std::vector<std::int32_t> ids;
  model.faults().add({.level = Level::Module, .times = 2, .children = {{7, 2, 5}}});
  EXPECT_EQ(root->listChildren(ids), 0);
  EXPECT_EQ(ids, (std::vector<std::int32_t>{7, 2, 5}));
  model.faults().add(
      {.level = Level::Module, .command = kNkMAIDCommand_CapGetArray, .answer = kNkMAIDResult_DeviceBusy});
  EXPECT_EQ(root->listChildren(ids), kNkMAIDResult_DeviceBusy);
  EXPECT_TRUE(ids.empty());
  EXPECT_EQ(recorder.traced("Error detected: (152) kNkMAIDResult_DeviceBusy"), 1U);
}

}  // namespace
