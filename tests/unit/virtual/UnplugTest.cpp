// Cameras and pictures that come and go while a client has them open.
#include <gtest/gtest.h>

#include "Client.h"
#include "VirtualCamera.h"

namespace virtualcamera::test {
namespace {

TEST(UnplugTest, CamerasComeAndGoWithEventsInTheNextPoll) {
  Model model;
  Client module(Model::entryPoint(), nullptr, 0);
  model.addCamera(3, "Three");
  model.addCamera(300, "Beyond the ids");
  EXPECT_TRUE(module.events.empty());
  EXPECT_EQ(module.children(), (std::vector<uint32_t>{3, 300}));
  module.poll();
  model.removeCamera(3);
  EXPECT_EQ(module.children(), (std::vector<uint32_t>{300}));
  model.addCamera(4, "Four");
  model.removeCamera(4);  // nobody heard of it
  module.poll();
  EXPECT_EQ(module.events,
            (Client::Events{{kNkMAIDEvent_AddChild, 3}, {kNkMAIDEvent_AddChild, 300}, {kNkMAIDEvent_RemoveChild, 3}}));
}

struct UnplugDuringTransfer : testing::Test {
  void begin(Options options = {}) {
    model = std::make_unique<Model>(options);
    Camera& camera = model->addCamera(1, "One");
    camera.setTransfer({.deliveryBytes = 10});
    camera.shoot(Picture::pattern(kNkMAIDFileDataType_JPEG, 100));
    module = std::make_unique<Client>(Model::entryPoint(), nullptr, 0);
    device = std::make_unique<Client>(*module, 1);
    open = std::make_unique<Opened>(*device, 1);
    open->data.start(kNkMAIDCapability_Acquire);
    open->data.poll();
  }

  std::unique_ptr<Model> model;
  std::unique_ptr<Client> module, device;
  std::unique_ptr<Opened> open;
};

TEST_F(UnplugDuringTransfer, PollsAnswerZombieAndNoCompletionComes) {
  begin();
  model->removeCamera(1);
  EXPECT_FALSE(device->isAlive());
  EXPECT_EQ(device->getString(kNkMAIDCapability_Name), "!");
  EXPECT_EQ(open->data.poll(), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(open->item.poll(), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(module->poll(), kNkMAIDResult_NoError);
  EXPECT_EQ(open->data.deliveries.size(), 1u);
  EXPECT_TRUE(open->data.completions.empty());
  EXPECT_EQ(Client(*device, 1).opened, kNkMAIDResult_ZombieObject);
  EXPECT_EQ(open->data.close(), kNkMAIDResult_NoError);

  model->addCamera(1, "One again");
  EXPECT_EQ(device->poll(), kNkMAIDResult_ZombieObject);  // the new camera is another
  Client again(*module, 1);
  EXPECT_EQ(again.getString(kNkMAIDCapability_Name), "One again");
}

TEST_F(UnplugDuringTransfer, WhereToldTheCompletionComesWithAResultInTheLastPoll) {
  begin({.unplugResult = kNkMAIDResult_DataTransFailure});
  model->removeCamera(1);
  module->poll();
  EXPECT_TRUE(open->data.completions.empty());
  EXPECT_EQ(open->data.poll(), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(open->data.completions, (std::vector<int32_t>{kNkMAIDResult_DataTransFailure}));
}

TEST_F(UnplugDuringTransfer, FromInsideADeliveryItIsTheLast) {
  begin({.unplugResult = kNkMAIDResult_BusReset});
  open->data.inCallback = [this] { model->removeCamera(1); };
  EXPECT_EQ(open->data.poll(), kNkMAIDResult_NoError);
  EXPECT_EQ(open->data.finish(), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(open->data.deliveries.size(), 2u);
  EXPECT_EQ(open->data.completions.size(), 1u);
}

TEST_F(UnplugDuringTransfer, APictureRemovedTakesItsObjectsAlong) {
  begin();
  module->poll();
  model->camera(1)->removeItem(1);
  EXPECT_EQ(open->data.poll(), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(device->poll(), kNkMAIDResult_NoError);
  EXPECT_EQ(device->events.back(), (std::pair<uint32_t, uint64_t>{kNkMAIDEvent_RemoveChild, 1}));
}

}  // namespace
}  // namespace virtualcamera::test
