// Pictures on their way from a camera to a file.

#include <sys/stat.h>

#include <string>

#include "Helper.h"

namespace tether {
namespace {

namespace fs = std::filesystem;

class Capture : public HelperTest {
 protected:
  void shoot() { helper.send(request("doCapture", 2)); }
  void expectPicture(const std::string& bytes, const std::string& name, double id, double sidecar = 0) {
    const Received& added = helper.await("objectWasAdded");
    const Received& complete = helper.await("fileDownloadComplete");
    EXPECT_LT(added.place, complete.place);
    EXPECT_TRUE(added.id == 0 && complete.id == 0);
    EXPECT_TRUE(added.entries() == 4 && complete.entries() == 2);
    EXPECT_EQ(added.number("capture_id"), id);
    EXPECT_EQ(complete.number("capture_id"), id);
    EXPECT_EQ(added.text("file_name"), name);
    EXPECT_EQ(added.number("has_sidecar"), sidecar);
    EXPECT_EQ(added.number("file_size"), static_cast<double>(bytes.size()));
    const fs::path path = complete.text("file_path");
    EXPECT_EQ(path, helper.temporary() / name);
    EXPECT_TRUE(readFile(path) == bytes) << path;
    struct stat status {};
    EXPECT_EQ(lstat(path.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode, S_IFREG | 0600U) << path;
  }
};

TEST_F(Capture, IsAnnouncedThenCompleteUnderNumbersThatGoOnAndAPairSharesABaseName) {
  const std::string large = pattern(64 << 20, 1);
  const std::string raw = pattern(300'000, 2);
  const std::string jpeg = pattern(100'001, 3);
  const std::string tiny = pattern(1, 4);
  drop(studio() / "roll/1.TIF", tiny);
  drop(studio() / "roll/2.jpg", jpeg);
  drop(studio() / "roll/2.nef", raw);
  drop(studio() / "roll/3.ndf", jpeg);
  startWithCamera();
  connect();
  shoot();
  expectPicture(tiny, "Capture0001.tif", 1);
  shoot();
  expectPicture(raw, "Capture0002.nef", 2, 1);
  expectPicture(jpeg, "Capture0002.jpg", 3, 1);
  shoot();
  expectPicture(jpeg, "Capture0003.ndf", 4);
  drop(studio() / "DSC_0001.NEF", large);
  expectPicture(large, "Capture0004.nef", 5);
  helper.settle();
  EXPECT_EQ(helper.count("objectWasAdded"), 5U);
}

TEST_F(Capture, WorksWithoutAFolderOfCameras) {
  helper.setEnvironment("TETHER_VIRTUAL_CAMERAS", "");
  helper.install("Type0001Module", VIRTUAL_CAMERA_MODULE);
  helper.start();
  EXPECT_EQ(helper.await("deviceAdded").text("name"), "Virtual Camera");
  connect();
  shoot();
  const std::string jpeg = readFile(helper.await("fileDownloadComplete").text("file_path"));
  EXPECT_EQ(static_cast<double>(jpeg.size()), helper.await("objectWasAdded").number("file_size"));
  EXPECT_EQ(jpeg.substr(0, 3), "\xff\xd8\xff");
}

}  // namespace
}  // namespace tether
