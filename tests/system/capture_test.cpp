// Pictures on their way from a camera to a file.

#include <sys/stat.h>

#include <string>

#include "Helper.h"

namespace tether {
namespace {

namespace fs = std::filesystem;

class Capture : public HelperTest {
 protected:
  // What the next picture is announced and completed with.
  struct Picture {
    std::string name;
    fs::path path;
    int id;
    bool sidecar;
  };
  Picture awaitPicture(const std::string& expected) {
    const Message& added = helper.await("objectWasAdded");
    const Message& complete = helper.await("fileDownloadComplete");
    EXPECT_LT(added.place, complete.place);
    EXPECT_EQ(added.id, 0);
    EXPECT_EQ(complete.id, 0);
    EXPECT_EQ(added.entries(), 4U);
    EXPECT_EQ(complete.entries(), 2U);
    EXPECT_EQ(added.number("capture_id"), complete.number("capture_id"));
    EXPECT_EQ(added.number("file_size"), static_cast<double>(expected.size()));
    Picture picture{added.text("file_name"), complete.text("file_path"), static_cast<int>(added.number("capture_id")),
                    added.number("has_sidecar") != 0};
    EXPECT_EQ(picture.path.parent_path(), helper.temporary());
    EXPECT_TRUE(readFile(picture.path) == expected) << picture.path;
    struct stat status {};
    EXPECT_EQ(lstat(picture.path.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode, S_IFREG | 0600U) << picture.path;
    return picture;
  }
  void shoot() { helper.send(request("doCapture", 2)); }
};

TEST_F(Capture, OfTheRollIsAnnouncedThenCompleteUnderNumbersThatGoOn) {
  const std::string first = pattern(3'000'001, 1);
  const std::string second = pattern(1, 2);
  const std::string third = pattern(1000, 3);
  drop(studio() / "roll/1.jpg", first);
  drop(studio() / "roll/2.TIF", second);
  drop(studio() / "roll/3.ndf", third);
  startWithCamera();
  connect(kStudio);
  int id = 0;
  for (const auto& [bytes, name] : {std::pair(first, "Capture0001.jpg"), std::pair(second, "Capture0002.tif"),
                                    std::pair(third, "Capture0003.ndf")}) {
    shoot();
    const Picture picture = awaitPicture(bytes);
    EXPECT_EQ(picture.name, name);
    EXPECT_EQ(picture.path.filename(), name);
    EXPECT_EQ(picture.id, ++id);
    EXPECT_FALSE(picture.sidecar);
  }
  helper.settle();
  EXPECT_EQ(helper.count("objectWasAdded"), 3U);
}

TEST_F(Capture, OfARawAndJpegPairSharesABaseNameAndTakesTwoIds) {
  const std::string raw = pattern(300'000, 1);
  const std::string jpeg = pattern(100'000, 2);
  drop(studio() / "roll/1.jpg", jpeg);
  drop(studio() / "roll/1.nef", raw);
  drop(studio() / "roll/2.jpg", jpeg);
  startWithCamera();
  connect(kStudio);
  shoot();
  const Picture first = awaitPicture(raw);
  EXPECT_EQ(first.name, "Capture0001.nef");
  EXPECT_EQ(first.id, 1);
  EXPECT_TRUE(first.sidecar);
  const Picture second = awaitPicture(jpeg);
  EXPECT_EQ(second.name, "Capture0001.jpg");
  EXPECT_EQ(second.id, 2);
  EXPECT_TRUE(second.sidecar);
  shoot();
  const Picture third = awaitPicture(jpeg);
  EXPECT_EQ(third.name, "Capture0002.jpg");
  EXPECT_FALSE(third.sidecar);
}

TEST_F(Capture, NeitherOverwritesAFileNorFollowsALink) {
  const std::string bytes = pattern(5000, 1);
  for (const char* name : {"1.jpg", "2.jpg", "3.jpg"}) drop(studio() / "roll" / name, bytes);
  const fs::path own = helper.temporary() / "Capture0001.jpg";
  const fs::path victim = helper.folder() / "victim";
  drop(own, "mine");
  drop(victim, "theirs");
  fs::create_symlink(helper.folder() / "nowhere", helper.temporary() / "Capture0002.jpg");
  fs::create_symlink(victim, helper.temporary() / "Capture0003.jpg");
  startWithCamera();
  connect(kStudio);
  for (const char* base : {"Capture0001", "Capture0002", "Capture0003"}) {
    shoot();
    const Picture picture = awaitPicture(bytes);
    EXPECT_EQ(picture.name, std::string(base) + ".jpg");
    EXPECT_EQ(picture.path.filename(), std::string(base) + "-2.jpg");
  }
  EXPECT_EQ(readFile(own), "mine");
  EXPECT_EQ(readFile(victim), "theirs");
  EXPECT_FALSE(fs::exists(helper.folder() / "nowhere"));
}

TEST_F(Capture, BringsTheCamerasOwnJpegAndARealOneThatIsDroppedInBitForBit) {
  startWithCamera();
  connect(kStudio);
  shoot();
  const std::string jpeg = readFile(helper.await("fileDownloadComplete").text("file_path"));
  ASSERT_GT(jpeg.size(), 1000U);
  EXPECT_EQ(jpeg.substr(0, 3), "\xff\xd8\xff");
  EXPECT_EQ(jpeg.substr(jpeg.size() - 2), "\xff\xd9");
  helper.await("objectWasAdded");
  drop(studio() / "DSC_0001.JPG", jpeg);
  EXPECT_EQ(awaitPicture(jpeg).name, "Capture0002.jpg");
}

TEST_F(Capture, OfUpTo64MiBArrivesWhole) {
  const std::string bytes = pattern(64 << 20, 1);
  drop(studio() / "large.nef", bytes);
  startWithCamera();
  EXPECT_EQ(awaitPicture(bytes).name, "Capture0001.nef");
}

TEST_F(Capture, ABurstArrivesInFullAndInOrder) {
  startWithCamera();
  // The folder is filled out of the camera's sight, so that no picture overtakes another.
  unplug("1-Studio");
  helper.await("deviceRemoved");
  for (unsigned i = 10; i < 60; ++i) {
    drop(helper.folder() / "drawer/1-Studio" / (std::to_string(i) + ".jpg"), pattern(20000U + i, i));
  }
  plugIn("1-Studio");
  for (unsigned i = 10; i < 60; ++i) EXPECT_EQ(awaitPicture(pattern(20000U + i, i)).id, static_cast<int>(i) - 9);
}

TEST_F(Capture, ThatCannotBeWrittenWholeIsNeverCompleteAndLeavesNoFile) {
  const std::string small = pattern(100'000, 2);
  drop(studio() / "roll/1.jpg", pattern(1'000'000, 1));
  drop(studio() / "roll/2.jpg", small);
  helper.limitFileSize(300'000);
  startWithCamera();
  connect(kStudio);
  shoot();
  EXPECT_EQ(helper.await("objectWasAdded").number("file_size"), 1'000'000);
  shoot();
  const Picture picture = awaitPicture(small);
  EXPECT_EQ(picture.id, 2);
  EXPECT_EQ(helper.count("fileDownloadComplete"), 1U);
  EXPECT_EQ(std::distance(fs::directory_iterator(helper.temporary()), fs::directory_iterator()), 1);
}

TEST_F(Capture, WithoutAFolderToGoToIsNotAnnouncedAndTheNextOneWithItIs) {
  const std::string bytes = pattern(100'000, 1);
  drop(studio() / "roll/1.jpg", bytes);
  drop(studio() / "roll/2.jpg", bytes);
  startWithCamera();
  connect(kStudio);
  fs::remove(helper.temporary());
  shoot();
  awaitCondition("log line", [&] { return helper.standardError().find("Could not create") != std::string::npos; });
  fs::create_directory(helper.temporary());
  shoot();
  EXPECT_EQ(awaitPicture(bytes).id, 1);
}

TEST_F(Capture, WhoseTransferFailsIsNeverCompleteAndTheNextOneIs) {
  startWithCamera(R"({"transfer": {"deliveryBytes": 1000}, "faults": [
    {"object": "data", "item": 1, "command": "CapStart", "capability": "Acquire", "stopAfter": 3},
    {"object": "item", "item": 2, "command": "Open", "answer": "HardwareError"}]})");
  const std::string bytes = pattern(5500, 1);
  for (const char* name : {"1.jpg", "2.jpg", "3.jpg"}) drop(studio() / name, bytes);
  EXPECT_EQ(helper.await("objectWasAdded").number("capture_id"), 1);
  EXPECT_EQ(awaitPicture(bytes).id, 2);
  EXPECT_EQ(helper.count("fileDownloadComplete"), 1U);
}

// From a thread of the module's, and from polls of the helper's main thread.
TEST_F(Capture, ArrivesWholeWhicheverThreadBringsItsPieces) {
  for (const char* file : {R"({"transfer": {"deliveryBytes": 5000, "inModulePolls": true}})",
                           R"({"faults": [{"object": "data", "command": "CapStart", "ownThread": true}]})"}) {
    Helper other;
    other.install("Type0001Module", VIRTUAL_CAMERA_MODULE);
    drop(other.cameras() / "1-Studio/camera.json", file);
    for (unsigned i = 1; i <= 5; ++i) {
      drop(other.cameras() / "1-Studio" / (std::to_string(i) + ".jpg"), pattern(1'500'000, i));
    }
    other.start();
    for (unsigned i = 1; i <= 5; ++i) {
      EXPECT_TRUE(readFile(other.await("fileDownloadComplete").text("file_path")) == pattern(1'500'000, i)) << file;
    }
    other.closeInput();
    EXPECT_EQ(other.wait(), 0);
  }
}

}  // namespace
}  // namespace tether
