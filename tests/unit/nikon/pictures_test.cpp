// How deliveries become a file, and what becomes of those that are wrong.

#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
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
  void faultDelivery(DeliveryFault delivery) { faultTransfer({.delivery = std::move(delivery)}); }
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

TEST_F(PictureTest, TheFileTypeGivesTheExtension) {
  start();
  for (const std::uint32_t type : {1U, 2U, 3U, 4U, 257U}) camera.shoot(Picture::memory(type, bytes(4)));
  idleUntil("fileDownloadComplete", 5);
  EXPECT_EQ(files(), (std::vector<std::string>{"Capture0001.jpg", "Capture0002.tif", "Capture0003.dat",
                                               "Capture0004.nef", "Capture0005.ndf"}));
}

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

TEST_F(PictureTest, BytesThatAreNeverDeliveredAreZeroAndNotOfThePictureBefore) {
  EXPECT_EQ(completeFilesOf(Picture::jpeg(bytes(60, 2))), 1U);
  faultDelivery({.first = 1, .drop = true});
  camera.shoot(Picture::jpeg(bytes(30)));
  idleUntil("fileDownloadComplete", 3);
  auto expected = bytes(30);
  std::fill(expected.begin() + 10, expected.begin() + 20, 0);
  EXPECT_EQ(read(folder + "/Capture0003.jpg"), expected);
}

TEST_F(PictureTest, ADeliveryOutsideTheFileDoesNotReachIt) {
  for (const auto& [start, length] : {std::pair{0xFFFFFFFCU, 10U}, std::pair{25U, 10U}, std::pair{0x7FFFFFFFU, 1U}}) {
    faultDelivery({.edit = [start = start, length = length](tagNkMAIDFileInfo& info) {
      info.ulStart = start;
      info.ulLength = length;
      info.totalLength = 0xFFFFFFFF;
    }});
  }
  start();
  for (int shot = 0; shot < 3; ++shot) camera.shoot(Picture::jpeg(bytes(30)));
  idleUntil("fileDownloadComplete", 3);
  for (const std::string& name : files()) {
    const auto written = read(folder + "/" + name);
    ASSERT_EQ(written.size(), 30U);
    EXPECT_TRUE(std::equal(written.begin() + 10, written.end(), bytes(30).begin() + 10));
    EXPECT_EQ(written[0], 0);
  }
}

TEST_F(PictureTest, DeliveriesThatAreNoFileOrComeBehindTheEndAreIgnored) {
  faultDelivery({.first = 2, .twice = true});
  faultDelivery({.first = 0, .edit = [](tagNkMAIDFileInfo& info) { info.dataType = kNkMAIDDataObjType_Image; }});
  start();
  for (int shot = 0; shot < 2; ++shot) camera.shoot(Picture::jpeg(bytes(30)));
  idleUntil("fileDownloadComplete", 2);
  EXPECT_EQ(files().size(), 2U) << "the repeated last delivery made no file";
  EXPECT_EQ(read(folder + "/Capture0001.jpg"), bytes(30));
  EXPECT_EQ(read(folder + "/Capture0002.jpg")[0], 0);
}

TEST_F(PictureTest, ATransferThatBreaksOffIsNotReportedAsComplete) {
  faultTransfer({.completionResult = kNkMAIDResult_DataTransFailure, .stopAfter = 2});
  EXPECT_EQ(completeFilesOf(Picture::jpeg(bytes(30))), 0U);
  EXPECT_EQ(recorder.traced("CContentData completionCallback,failed to finish data transfer, err=141"), 1U);
  EXPECT_EQ(recorder.await("objectWasAdded").strings.at("file_name"), "Capture0001.jpg");
}

TEST_F(PictureTest, AFileThatCannotBeCreatedIsNeitherAddedNorCompleteAndTheNextOneIs) {
  start();
  rmdir(folder.c_str());
  camera.shoot(Picture::jpeg(bytes(30)));
  idleUntil([&] { return recorder.logged("Could not create a file for Capture0001.jpg: ") == 1; });
  mkdir(folder.c_str(), 0700);
  camera.shoot(Picture::jpeg(bytes(20)));
  idleUntil("fileDownloadComplete");
  EXPECT_EQ(recorder.names(), "deviceAdded objectWasAdded fileDownloadComplete");
  EXPECT_EQ(files(), (std::vector<std::string>{"Capture0002.jpg"}));
}

TEST_F(PictureTest, AShortWriteRemovesTheFileAndIsNotReportedAsComplete) {
  signal(SIGXFSZ, SIG_IGN);
  rlimit limit{50, RLIM_INFINITY};
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
  EXPECT_EQ(completeFilesOf(Picture::jpeg(bytes(95))), 0U);
  EXPECT_EQ(files(), (std::vector<std::string>{"Capture0002.dat"}));
  EXPECT_EQ(recorder.logged("Writing " + folder + "/Capture0001.jpg failed: "), 1U);
}

TEST_F(PictureTest, AnItemWithoutImageDataIsLetGoOfAndADataObjectIsOpenedASecondTime) {
  Picture other = Picture::jpeg(bytes(30));
  other.dataTypes = 2;
  model.faults().add(
      {.level = Level::Data, .command = kNkMAIDCommand_Open, .times = 1, .answer = kNkMAIDResult_DeviceBusy});
  EXPECT_EQ(completeFilesOf(other), 0U);
  EXPECT_EQ(recorder.traced("could not open data type: 1"), 1U);
  EXPECT_EQ(recorder.names(), "deviceAdded objectWasAdded fileDownloadComplete");
  EXPECT_EQ(model.openObjects(), 2U) << "the module and the camera";
}

}  // namespace
