// Every kind of fault does what it says, as often as it says.
#include <gtest/gtest.h>

#include "Client.h"
#include "VirtualCamera.h"

namespace virtualcamera::test {
namespace {

struct FaultTest : testing::Test {
  Model model;
  Camera& camera = model.addCamera(1, "Virtual One");
  Client module{Model::entryPoint(), nullptr, 0};
  Client device{module, 1};

  std::unique_ptr<Opened> shootAndOpen(uint64_t size = 40) {
    camera.setTransfer({.deliveryBytes = 10});
    return std::make_unique<Opened>(device, camera.shoot(Picture::pattern(kNkMAIDFileDataType_JPEG, size)));
  }
  static Fault acquire(Fault fault) {
    fault.level = Level::Data;
    fault.command = kNkMAIDCommand_CapStart;
    fault.parameter = kNkMAIDCapability_Acquire;
    return fault;
  }
};

TEST_F(FaultTest, AnswersHitTheCallsTheyAreAboutAfterSomeAndForAWhile) {
  model.faults().add({.level = Level::Camera,
                      .camera = 1,
                      .command = kNkMAIDCommand_CapGet,
                      .parameter = kNkMAIDCapability_IsAlive,
                      .skip = 1,
                      .times = 2,
                      .answer = kNkMAIDResult_HardwareError});
  std::vector<bool> alive;
  for (int i = 0; i < 5; ++i) alive.push_back(device.isAlive());
  EXPECT_EQ(alive, (std::vector<bool>{true, false, false, true, true}));

  const auto id =
      model.faults().add({.level = Level::Item, .command = kNkMAIDCommand_Open, .answer = kNkMAIDResult_NoMedia});
  camera.shoot(Picture::jpeg({1}));
  EXPECT_EQ(Client(device, 1).opened, kNkMAIDResult_NoMedia);
  model.faults().remove(id);
  EXPECT_EQ(Client(device, 1).opened, kNkMAIDResult_NoError);
}

TEST_F(FaultTest, EachCallInTurnCanFail) {
  const auto session = [] {
    Client top(Model::entryPoint(), nullptr, 0);
    if (top.opened != 0) return false;
    Client below(top, 1);
    return below.opened == 0 && below.getString(kNkMAIDCapability_Name) != "!";
  };
  model.failCall(0, 0, {.closes = false});
  EXPECT_TRUE(session());
  const uint64_t count = model.countedCalls();
  EXPECT_EQ(count, 7u);  // per object an open and two callbacks; the name
  std::vector<uint64_t> fatal;
  for (uint64_t k = 1; k <= count; ++k) {
    model.failCall(k, kNkMAIDResult_UnexpectedError, {.closes = false});
    if (!session()) fatal.push_back(k);
    EXPECT_EQ(model.openObjects(), 2u);
  }
  EXPECT_EQ(fatal, (std::vector<uint64_t>{1, 4, 7}));
}

TEST_F(FaultTest, HooksAndRecordsSeeTheCallsInOrder) {
  std::vector<uint32_t> before;
  model.beforeCall([&](const Call& call) { before.push_back(call.command); });
  model.record(true);
  auto open = shootAndOpen();
  module.poll();
  model.beforeCall(nullptr);
  open.reset();
  EXPECT_EQ(before.size(), 7u);
  EXPECT_EQ(before.back(), uint32_t{kNkMAIDCommand_Async});
  EXPECT_EQ(model.calls().front().target, (Target{Level::Item, 1, 1}));
  EXPECT_EQ(model.calls().size(), 8u);  // no polls
  EXPECT_EQ(model.closed(), (std::vector<Target>{{Level::Data, 1, 1}, {Level::Item, 1, 1}}));
}

TEST_F(FaultTest, ADelayHoldsItsCallButNoOther) {
  model.faults().add({.level = Level::Camera, .command = kNkMAIDCommand_Async, .delay = std::chrono::minutes(10)});
  std::thread hanging([this] { EXPECT_EQ(device.poll(), kNkMAIDResult_NoError); });
  EXPECT_EQ(module.poll(), kNkMAIDResult_NoError);
  EXPECT_TRUE(device.isAlive());
  model.faults().release();
  hanging.join();
}

TEST_F(FaultTest, ListsAndHeadersLie) {
  model.faults().add({.level = Level::Module,
                      .parameter = kNkMAIDCapability_Children,
                      .children = std::vector<uint32_t>{0, 256, 0xffffffff, 1, 1}});
  EXPECT_EQ(module.children(), (std::vector<uint32_t>{0, 256, 0xffffffff, 1, 1}));

  model.faults().add({.command = kNkMAIDCommand_CapGet,
                      .parameter = kNkMAIDCapability_Sensitivity,
                      .editEnum = [](tagNkMAIDEnum& header) { header.elementCount = 1000; }});
  EXPECT_EQ(device.getEnum(kNkMAIDCapability_Sensitivity).second.size(), 0u);
  model.faults().add({.command = kNkMAIDCommand_CapGetArray, .anyArraySize = true});
  EXPECT_EQ(device.getEnum(kNkMAIDCapability_Sensitivity).second.size(), 4000u);

  model.faults().add({.parameter = kNkMAIDCapability_Name, .unterminated = true});
  EXPECT_EQ(device.getString(kNkMAIDCapability_Name), std::string(256, 'X'));
}

TEST_F(FaultTest, CompletionsFailStayAwayComeLateTwiceOrAfterTheClose) {
  model.faults().add(acquire({.times = 1, .completionResult = kNkMAIDResult_SessionFailure, .stopAfter = 2}));
  auto failing = shootAndOpen();
  failing->data.start(kNkMAIDCapability_Acquire);
  EXPECT_EQ(failing->data.finish(), kNkMAIDResult_SessionFailure);
  EXPECT_EQ(failing->data.deliveries.size(), 2u);

  model.faults().clear();
  model.faults().add(acquire({.times = 1, .noCompletion = true}));
  auto silent = shootAndOpen();
  silent->data.start(kNkMAIDCapability_Acquire);
  for (int i = 0; i < 10; ++i) silent->data.poll();
  EXPECT_EQ(silent->data.deliveries.size(), 4u);
  EXPECT_TRUE(silent->data.completions.empty());

  model.faults().clear();
  model.faults().add(acquire({.completionPolls = 5, .completionTwice = true}));
  auto late = shootAndOpen(10);
  late->data.start(kNkMAIDCapability_Acquire);
  for (int i = 0; i < 6; ++i) late->data.poll();
  EXPECT_TRUE(late->data.completions.empty());
  late->data.poll();
  EXPECT_EQ(late->data.completions.size(), 1u);
  module.poll();
  EXPECT_EQ(late->data.completions.size(), 2u);

  model.faults().clear();
  model.faults().add(acquire({.completionAfterClose = true}));
  auto stray = shootAndOpen(10);
  stray->data.start(kNkMAIDCapability_Acquire);
  for (int i = 0; i < 6; ++i) stray->data.poll();
  stray->data.close();
  EXPECT_TRUE(stray->data.completions.empty());
  module.poll();
  EXPECT_EQ(stray->data.completions.size(), 1u);
}

TEST_F(FaultTest, ACaptureThatIsToFailTakesNoPicture) {
  model.faults().add({.level = Level::Camera,
                      .command = kNkMAIDCommand_CapStart,
                      .times = 1,
                      .completionResult = kNkMAIDResult_OutOfFocus});
  device.start(kNkMAIDCapability_Capture);
  EXPECT_EQ(device.finish(), kNkMAIDResult_OutOfFocus);
  EXPECT_TRUE(camera.items().empty());
  model.faults().add({.level = Level::Camera,
                      .command = kNkMAIDCommand_CapStart,
                      .answer = kNkMAIDResult_DeviceBusy,
                      .doAnyway = true});
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_DeviceBusy);
  EXPECT_EQ(device.finish(), kNkMAIDResult_NoError);
  EXPECT_EQ(camera.items().size(), 1u);
}

TEST_F(FaultTest, DeliveriesAreDroppedDoubledCutAndLiedAbout) {
  const auto starts = [this](DeliveryFault fault) {
    model.faults().clear();
    model.faults().add(acquire({.delivery = std::move(fault)}));
    auto open = shootAndOpen();
    open->data.start(kNkMAIDCapability_Acquire);
    EXPECT_EQ(open->data.finish(), kNkMAIDResult_NoError);
    std::vector<std::pair<uint32_t, size_t>> pieces;
    for (const Delivery& delivery : open->data.deliveries)
      pieces.emplace_back(delivery.info.ulStart, delivery.bytes.size());
    return pieces;
  };
  using Pieces = std::vector<std::pair<uint32_t, size_t>>;
  EXPECT_EQ(starts({.first = 1, .count = 2, .drop = true}), (Pieces{{0, 10}, {30, 10}}));
  EXPECT_EQ(starts({.first = 3, .count = 1, .twice = true}), (Pieces{{0, 10}, {10, 10}, {20, 10}, {30, 10}, {30, 10}}));
  EXPECT_EQ(starts({.first = 0, .count = 9, .cutTo = 3}), (Pieces{{0, 3}, {10, 3}, {20, 3}, {30, 3}}));
  EXPECT_EQ(starts({.first = 3,
                    .count = 1,
                    .edit =
                        [](tagNkMAIDFileInfo& info) {
                          info.ulStart = 0xfffffff0;
                          info.ulLength = 5000;  // beyond the picture, and still readable
                        }}),
            (Pieces{{0, 10}, {10, 10}, {20, 10}, {0xfffffff0, 5000}}));
}

}  // namespace
}  // namespace virtualcamera::test
