// How deliveries become a file, and what becomes of those that are wrong.

#include <unistd.h>

#include "ServiceTest.h"

namespace {

using virtualcamera::DeliveryFault;
using virtualcamera::Fault;
using virtualcamera::Level;
using virtualcamera::Picture;

class PictureTest : public ServiceTest {
 protected:
  PictureTest() { camera.setTransfer({.deliveryBytes = 10}); }

  // The n-th fault is the n-th transfer's.
  void faultTransfer(Fault fault) {
    fault.level = Level::Data;
    fault.command = kNkMAIDCommand_CapStart;
    fault.skip = transfersWithFault++;
    fault.times = 1;
    model.faults().add(std::move(fault));
  }
  // Transfers a picture and then a good one behind it, and returns the files that were complete before that.
  std::size_t completeFilesOf(Picture picture) {
    start();
    camera.shoot(std::move(picture));
    camera.shoot(Picture::memory(99, bytes(3)));
    idleUntil([&] {
      const auto sent = recorder.messages();
      if (sent.empty() || sent.back().name != "fileDownloadComplete") return false;
      return sent.back().strings.at("file_path").find(".dat") != std::string::npos;
    });
    std::size_t complete = 0;
    for (const Message& message : recorder.messages()) complete += message.name == "fileDownloadComplete" ? 1 : 0;
    return complete - 1;
  }

  std::uint32_t transfersWithFault = 0;
  virtualcamera::Camera& camera = model.addCamera(1, "One");
};

TEST_F(PictureTest, NoFileIsTakenOverAndNoLinkFollowed) {
  std::ofstream(folder + "/Capture0001.jpg") << "kept";
  ASSERT_EQ(symlink((folder + "/elsewhere").c_str(), (folder + "/Capture0001-2.jpg").c_str()), 0);
  EXPECT_EQ(completeFilesOf(Picture::jpeg(bytes(20))), 1U);
  EXPECT_EQ(recorder.await("objectWasAdded").strings.at("file_name"), "Capture0001.jpg");
  EXPECT_EQ(recorder.await("fileDownloadComplete").strings.at("file_path"), folder + "/Capture0001-3.jpg");
  EXPECT_EQ(read(folder + "/Capture0001.jpg").size(), 4U);
  EXPECT_EQ(access((folder + "/elsewhere").c_str(), F_OK), -1);
}

TEST_F(PictureTest, WithoutAReadableSizeTheDeliveriesTellIt) {
  Picture picture = Picture::jpeg(bytes(35));
  picture.withoutCapabilities = {kNkMAIDCapability_StoredBytes, kNkMAIDCapability_RawJpegImageStatus,
                                 kNkMAIDCapability_Name};
  EXPECT_EQ(completeFilesOf(picture), 1U);
  EXPECT_EQ(recorder.traced("Error getting kNkMAIDCapability_StoredBytes on data object: 50000"), 1U);
  EXPECT_EQ(recorder.traced("Error getting kNkMAIDCapability_RawJpegImageStatus on data object: 50000"), 1U);
  EXPECT_EQ(recorder.await("objectWasAdded").numbers.at("file_size"), 35);
  EXPECT_EQ(read(folder + "/Capture0001.jpg"), bytes(35));
}

// One transfer a row: what is wrong with its deliveries, and what the file of 30 bytes lacks, which then is zero.
TEST_F(PictureTest, NothingButDeliveriesOfTheFileInsideItsBoundsReachesTheFile) {
  const auto outside = [](std::uint32_t start, std::uint32_t length) {
    return DeliveryFault{.edit = [=](tagNkMAIDFileInfo& info) {
      info.ulStart = start;
      info.ulLength = length;
      info.totalLength = 0xFFFFFFFF;
    }};
  };
  const struct {
    DeliveryFault fault;
    std::size_t zeroFrom, zeroTo;
  } table[] = {{{.first = 1, .drop = true}, 10, 20},
               {outside(0xFFFFFFFCU, 10), 0, 10},
               {outside(25, 10), 0, 10},
               {outside(0x7FFFFFFFU, 1), 0, 10},
               {{.edit = [](tagNkMAIDFileInfo& info) { info.dataType = kNkMAIDDataObjType_Image; }}, 0, 10},
               {{.first = 2, .twice = true}, 0, 0}};
  start();
  for (const auto& row : table) {
    faultTransfer({.delivery = row.fault});
    camera.shoot(Picture::jpeg(bytes(30)));
  }
  idleUntil("fileDownloadComplete", std::size(table));
  for (std::size_t n = 0; n < std::size(table); ++n) {
    auto expected = bytes(30);
    std::fill(expected.begin() + static_cast<long>(table[n].zeroFrom),
              expected.begin() + static_cast<long>(table[n].zeroTo), 0);
    EXPECT_EQ(read(recorder.await("fileDownloadComplete", n + 1).strings.at("file_path")), expected) << n;
  }
  EXPECT_EQ(files().size(), std::size(table)) << "the repeated last delivery made no file";
}

TEST_F(PictureTest, ATransferThatIsRefusedOrBreaksOffIsOneLogLineAndNotReportedAsComplete) {
  faultTransfer({.completionResult = kNkMAIDResult_DataTransFailure, .stopAfter = 2});
  faultTransfer({.answer = kNkMAIDResult_DeviceBusy});
  faultTransfer({.noCompletion = true, .stopAfter = 1});
  model.faults().add(
      {.level = Level::Data, .item = 3, .command = kNkMAIDCommand_Async, .skip = 5, .answer = kNkMAIDResult_BusReset});
  start();
  for (int shot = 0; shot < 3; ++shot) camera.shoot(Picture::jpeg(bytes(30)));
  camera.shoot(Picture::jpeg(bytes(20)));
  idleUntil("fileDownloadComplete");
  EXPECT_EQ(read(recorder.await("fileDownloadComplete").strings.at("file_path")), bytes(20));
  EXPECT_EQ(recorder.traced("CContentData completionCallback,failed to finish data transfer, err=141"), 1U);
  for (const char* line : {"1 of camera 1 (One) broke off: kNkMAIDResult_DataTransFailure",
                           "2 of camera 1 (One) was refused: kNkMAIDResult_DeviceBusy",
                           "3 of camera 1 (One) broke off: kNkMAIDResult_BusReset"}) {
    EXPECT_EQ(recorder.logged(std::string("Transfer of item ") + line), 1U) << line;
  }
  EXPECT_EQ(recorder.logged("Transfer of item"), 3U);
}

TEST_F(PictureTest, AnItemWithoutImageDataIsLetGoOfAndADataObjectIsOpenedASecondTime) {
  Picture other = Picture::jpeg(bytes(30));
  other.dataTypes = 2;
  model.faults().add(
      {.level = Level::Data, .command = kNkMAIDCommand_Open, .times = 1, .answer = kNkMAIDResult_DeviceBusy});
  EXPECT_EQ(completeFilesOf(other), 0U);
  EXPECT_EQ(recorder.traced("could not open data type: 1"), 1U);
  EXPECT_EQ(recorder.names(), "deviceAdded objectWasAdded fileDownloadComplete");
  idleUntil([&] { return model.openObjects() == 2; });  // the module and the camera
}

}  // namespace
