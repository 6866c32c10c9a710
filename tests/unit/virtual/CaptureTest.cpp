// Pictures: how they appear, how their bytes come, and that all of it happens inside polls.
#include <gtest/gtest.h>
#include <unistd.h>

#include <fstream>
#include <numeric>

#include "Client.h"
#include "VirtualCamera.h"

namespace virtualcamera::test {
namespace {

const Client::Events kNothing;

struct CaptureTest : testing::Test {
  Model model;
  Camera& camera = model.addCamera(1, "Virtual One");
  Client module{Model::entryPoint(), nullptr, 0};
  Client device{module, 1};

  static std::vector<uint8_t> bytes(size_t count) {
    std::vector<uint8_t> result(count);
    std::iota(result.begin(), result.end(), uint8_t{0});
    return result;
  }
  void deliverInPieces(uint32_t size) { camera.setTransfer({.deliveryBytes = size}); }
};

TEST_F(CaptureTest, ACaptureAnnouncesItsPictureThenCompletesAllInLaterPolls) {
  camera.load(Picture::jpeg(bytes(10)));
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_Pending);
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_DeviceBusy);
  EXPECT_EQ(camera.items().size(), 0u);
  device.poll();  // the shutter
  EXPECT_EQ(device.events, kNothing);
  EXPECT_TRUE(device.completions.empty());
  std::vector<size_t> eventsAtCompletion;
  device.inCallback = [&] {
    if (!device.completions.empty()) eventsAtCompletion.push_back(device.events.size());
  };
  device.poll();
  EXPECT_EQ(device.events, (Client::Events{{kNkMAIDEvent_AddChild, 1}, {kNkMAIDEvent_CaptureComplete, 0}}));
  EXPECT_EQ(device.completions, (std::vector<int32_t>{kNkMAIDResult_NoError}));
  EXPECT_EQ(eventsAtCompletion, (std::vector<size_t>{2}));
}

TEST_F(CaptureTest, ATransferComesInPiecesOnePerPollAndCompletesInThePollAfterTheLast) {
  deliverInPieces(400);
  const auto picture = bytes(1000);
  camera.shoot(Picture::raw(picture));
  module.poll();
  Opened open(device, 1);
  ASSERT_EQ(open.data.start(kNkMAIDCapability_Acquire), kNkMAIDResult_Pending);
  EXPECT_TRUE(open.data.deliveries.empty());
  for (size_t expected : {1, 2, 3}) {
    module.poll();  // not the transfer's
    open.data.poll();
    EXPECT_EQ(open.data.deliveries.size(), expected);
    EXPECT_TRUE(open.data.completions.empty());
  }
  EXPECT_EQ(camera.items().size(), 1u);
  open.item.poll();
  EXPECT_EQ(open.data.completions, (std::vector<int32_t>{kNkMAIDResult_NoError}));
  EXPECT_EQ(camera.items().size(), 0u);
  EXPECT_EQ(open.data.received(), picture);
  const tagNkMAIDFileInfo& last = open.data.deliveries.back().info;
  EXPECT_NE(last.dataType & kNkMAIDDataObjType_File, 0u);
  EXPECT_EQ(last.fileDataType, uint32_t{kNkMAIDFileDataType_NEF});
  EXPECT_EQ(last.totalLength, 1000u);
  EXPECT_EQ(last.ulStart, 800u);
  EXPECT_EQ(last.ulLength, 200u);
}

TEST_F(CaptureTest, APairIsTwoItemsThatBothSayTheyAreHalves) {
  camera.load(Shot{Picture::raw(bytes(3)), Picture::jpeg(bytes(2))});
  device.start(kNkMAIDCapability_Capture);
  EXPECT_EQ(device.finish(), kNkMAIDResult_NoError);
  EXPECT_EQ(device.events.size(), 3u);
  Opened raw(device, 1);
  Opened jpeg(device, 2);
  EXPECT_EQ(raw.data.getUnsigned(kNkMAIDCapability_RawJpegImageStatus), 1u);
  EXPECT_EQ(jpeg.data.getUnsigned(kNkMAIDCapability_RawJpegImageStatus), 1u);
  camera.shoot(Picture::jpeg({}));
  EXPECT_EQ(Opened(device, 3).data.getUnsigned(kNkMAIDCapability_RawJpegImageStatus), 0u);
}

TEST_F(CaptureTest, AnEmptyRollIsFollowedByTheMakerAndAFailingMakerByAFailedCapture) {
  std::vector<uint32_t> numbers;
  camera.setMaker([&](uint32_t number) {
    numbers.push_back(number);
    return number < 3 ? Shot{Picture::pattern(kNkMAIDFileDataType_TIFF, 10)} : Shot{};
  });
  camera.load(Picture::jpeg(bytes(1)));
  std::vector<int32_t> results;
  for (int i = 0; i < 3; ++i) {
    device.start(kNkMAIDCapability_Capture);
    results.push_back(device.finish());
  }
  EXPECT_EQ(numbers, (std::vector<uint32_t>{2, 3}));
  EXPECT_EQ(results, (std::vector<int32_t>{0, 0, kNkMAIDResult_CaptureFailure}));
  EXPECT_EQ(camera.items().size(), 2u);
}

TEST_F(CaptureTest, PatternsAndFilesDeliverTheSameBytesAsMemory) {
  deliverInPieces(300);
  const std::string path = testing::TempDir() + "virtual-picture-" + std::to_string(getpid());
  std::vector<uint8_t> pattern(1000);
  for (size_t i = 0; i < pattern.size(); ++i) pattern[i] = Picture::patternByte(i);
  std::ofstream(path, std::ios::binary).write(reinterpret_cast<char*>(pattern.data()), 1000);
  camera.shoot(Picture::pattern(kNkMAIDFileDataType_JPEG, 1000));
  camera.shoot(Picture::file(kNkMAIDFileDataType_JPEG, path));
  for (const uint32_t id : {1u, 2u}) {
    Opened open(device, id);
    open.data.start(kNkMAIDCapability_Acquire);
    EXPECT_EQ(open.data.finish(), kNkMAIDResult_NoError);
    EXPECT_EQ(open.data.received(), pattern);
  }

  camera.shoot(Picture::file(kNkMAIDFileDataType_JPEG, path));
  ASSERT_EQ(truncate(path.c_str(), 350), 0);
  Opened cut(device, 3);
  cut.data.start(kNkMAIDCapability_Acquire);
  EXPECT_EQ(cut.data.finish(), kNkMAIDResult_DataTransFailure);
  EXPECT_EQ(cut.data.deliveries.size(), 1u);
  EXPECT_EQ(camera.items(), (std::vector<uint32_t>{3}));  // not transferred, so still there
  unlink(path.c_str());
}

TEST_F(CaptureTest, PaceIsInPollsAndModulePollsTransferOnlyWhereTold) {
  camera.setTransfer({.deliveryBytes = 10, .deliveriesPerPoll = 2, .pollsPerDelivery = 3, .inModulePolls = true});
  camera.shoot(Picture::jpeg(bytes(40)));
  Opened open(device, 1);
  open.data.start(kNkMAIDCapability_Acquire);
  std::vector<size_t> counts;
  for (int i = 0; i < 6; ++i) {
    module.poll();
    counts.push_back(open.data.deliveries.size());
  }
  EXPECT_EQ(counts, (std::vector<size_t>{0, 0, 2, 2, 2, 4}));
}

TEST_F(CaptureTest, AClientThatRefusesADeliveryEndsTheTransfer) {
  deliverInPieces(10);
  camera.shoot(Picture::jpeg(bytes(40)));
  Opened open(device, 1);
  open.data.answer = -1;
  open.data.start(kNkMAIDCapability_Acquire);
  EXPECT_EQ(open.data.finish(), kNkMAIDResult_Aborted);
  EXPECT_EQ(open.data.deliveries.size(), 1u);
}

TEST_F(CaptureTest, AReopenedCameraAnnouncesWhatIsStillOnIt) {
  camera.shoot(Picture::jpeg(bytes(4)));
  camera.shoot(Picture::jpeg(bytes(4)));
  module.poll();
  EXPECT_EQ(device.events.size(), 2u);
  device.listen();  // registering again is not opening again
  module.poll();
  EXPECT_EQ(device.events.size(), 2u);
  {
    Opened open(device, 1);
    open.data.start(kNkMAIDCapability_Acquire);
    ASSERT_EQ(open.data.finish(), kNkMAIDResult_NoError);
  }
  device.close();
  camera.shoot(Picture::jpeg(bytes(4)));
  Client again(module, 1);
  EXPECT_EQ(again.events, kNothing);
  module.poll();
  EXPECT_EQ(again.events, (Client::Events{{kNkMAIDEvent_AddChild, 2}, {kNkMAIDEvent_AddChild, 3}}));
  again.send(kNkMAIDCommand_EnumChildren);
  module.poll();
  EXPECT_EQ(again.events.size(), 4u);
}

TEST_F(CaptureTest, EventsOfAllObjectsComeInAnyPoll) {
  camera.shoot(Picture::jpeg(bytes(4)));
  Opened open(device, 1);
  open.data.poll();
  EXPECT_EQ(device.events, (Client::Events{{kNkMAIDEvent_AddChild, 1}}));
  camera.raise(1, Level::Item, kNkMAIDEvent_CapChange, 5);
  camera.raise(1, Level::Data, kNkMAIDEvent_CapChange, 6);
  model.raise(kNkMAIDEvent_WarmedUp, 7);
  module.poll();
  EXPECT_EQ(open.item.events, (Client::Events{{kNkMAIDEvent_CapChange, 5}}));
  EXPECT_EQ(open.data.events, (Client::Events{{kNkMAIDEvent_CapChange, 6}}));
  EXPECT_EQ(module.events, (Client::Events{{kNkMAIDEvent_WarmedUp, 7}}));
}

TEST(CaptureOptionsTest, EventsStayOutOfTransfersWhereTold) {
  Model model({.eventsInTransferPolls = false});
  Camera& camera = model.addCamera(1, "One");
  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  camera.shoot(Picture::jpeg({1}));
  Opened open(device, 1);
  open.data.poll();
  open.item.poll();
  EXPECT_EQ(device.events, kNothing);
  device.poll();
  EXPECT_EQ(device.events.size(), 1u);
}

TEST_F(CaptureTest, ACompletionMayCloseItsOwnObjects) {
  camera.shoot(Picture::jpeg(bytes(4)));
  Opened open(device, 1);
  open.data.inCallback = [&] {
    if (open.data.completions.empty()) return;
    EXPECT_EQ(open.data.close(), kNkMAIDResult_NoError);
    EXPECT_EQ(open.item.close(), kNkMAIDResult_NoError);
  };
  open.data.start(kNkMAIDCapability_Acquire);
  EXPECT_EQ(open.data.finish(), kNkMAIDResult_NoError);
  EXPECT_EQ(model.openObjects(), 2u);
}

}  // namespace
}  // namespace virtualcamera::test
