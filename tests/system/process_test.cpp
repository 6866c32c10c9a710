// The process: start, heartbeat, end, and a host that does not do its part.

#include <csignal>
#include <cstdlib>
#include <string>

#include "Helper.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

const char* const kSlow = R"({"transfer": {"deliveryBytes": 1000, "bytesPerSecond": 1000}})";

class Process : public HelperTest {
 protected:
  // Answers fill the narrowed pipe, so that the main thread waits for a host that does not read.
  void fillOutput(std::int32_t requests) {
    helper.narrowOutput();
    std::string all;
    for (std::int32_t id = 10; id < 10 + requests; ++id) all += request("connectDevice", id, 0x0109);
    helper.send(all);
    awaitCondition("full pipe", [&] { return helper.unread() > 3000; });  // no frame is so long that less stays
  }
};

TEST_F(Process, WithoutModulesSendsHeartbeatsAndAnswersNoRequestThatNamesADevice) {
  using namespace std::string_literals;
  const auto begin = Clock::now();
  helper.start();
  for (const char* name : {"connectDevice", "getCameraSettings", "disconnectDevice", "listDevices", "doCapture"}) {
    helper.send(request(name, 5, kStudio));
  }
  EXPECT_EQ(helper.await("heartbeat").bytes, "\x1a\0\0\0\0\0\0\0\x03\0\0\0\x0a\0\0\0heartbeat\0\x01\0\0\0"s);
  const Message& second = helper.await("heartbeat");
  EXPECT_GE(second.arrived - begin, 3.9s);
  EXPECT_LE(second.arrived - begin, 15s);
  EXPECT_EQ(helper.count("heartbeat"), helper.messages().size());
}

TEST_F(Process, EndsWithItsInputOrASignalAndTakesAFileThatIsNotWholeAlong) {
  const int kTermInShutdown = -SIGTERM;
  for (const int signal : {0, SIGTERM, SIGINT, kTermInShutdown}) {
    Helper other;
    other.install("Type0001Module", VIRTUAL_CAMERA_MODULE);
    drop(other.cameras() / "1-Studio/camera.json", kSlow);
    other.start();
    other.await("deviceAdded");
    drop(other.cameras() / "1-Studio/1.jpg", pattern(1'000'000, 1));
    other.await("objectWasAdded");
    EXPECT_TRUE(fs::exists(other.temporary() / "Capture0001.jpg"));
    if (signal == kTermInShutdown) {
      other.send(request("shutdown", 1));
      awaitCondition("shutdown read", [&] { return other.unreadByHelper() == 0; });
    }
    if (signal <= 0) other.closeInput();
    if (signal != 0) kill(other.pid(), std::abs(signal));
    EXPECT_EQ(other.wait(), 0);
    EXPECT_EQ(other.count("fileDownloadComplete"), 0U);
    EXPECT_TRUE(fs::is_empty(other.temporary()));
  }
}

// The pipe is closed at once, and the transfer takes longer than its end alone would leave it.
TEST_F(Process, BringsATransferToItsEndOnShutdownAndCarriesOutNothingBehindIt) {
  startWithCamera(R"({"transfer": {"deliveryBytes": 1000, "bytesPerSecond": 1500}})");
  for (const char* name : {"1.jpg", "2.jpg", "3.jpg"}) drop(studio() / name, pattern(5000, 1));
  helper.await("objectWasAdded");
  helper.send(request("connectDevice", 1, kStudio) + request("shutdown", 2) + request("connectDevice", 3, 0x0109));
  helper.closeInput();
  EXPECT_EQ(helper.wait(), 0);
  EXPECT_EQ(helper.awaitAnswer(1).name, "ok");
  for (const Message& message : helper.messages()) EXPECT_NE(message.id, 3);
  EXPECT_EQ(helper.count("objectWasAdded"), helper.count("fileDownloadComplete"));
  EXPECT_TRUE(readFile(helper.await("fileDownloadComplete").text("file_path")) == pattern(5000, 1));
}

TEST_F(Process, OutlivesAHostThatStoppedReadingUntilItsInputEnds) {
  startWithCamera();
  helper.closeOutput();
  helper.send(request("connectDevice", 1, kStudio) + request("getCameraSettings", 2, kStudio) +
              request("doCapture", 3));
  for (const char* name : {"Capture0001.jpg", "Capture0002.jpg"}) {
    const fs::path file = helper.temporary() / name;
    awaitCondition(name, [&] { return fs::exists(file) && fs::file_size(file) > 0; });
    helper.send(request("doCapture", 4));
  }
}

TEST_F(Process, LosesNothingOfEitherThreadWhileTheHostDoesNotRead) {
  constexpr std::int32_t kRequests = 200;
  constexpr int kPictures = 30;
  startWithCamera();
  connect(kStudio);
  for (int i = 0; i < kPictures; ++i) drop(studio() / (std::to_string(i) + ".jpg"), pattern(1000, 1));
  fillOutput(kRequests);
  std::size_t place = 0;
  for (std::int32_t id = 10; id < 10 + kRequests; ++id) {
    const Message& error = helper.awaitAnswer(id);
    EXPECT_GT(error.place, place);
    place = error.place;
  }
  for (int i = 1; i <= kPictures; ++i) EXPECT_EQ(helper.await("fileDownloadComplete").number("capture_id"), i);
}

TEST_F(Process, EndsOnASignalWhileItWaitsForAHostThatDoesNotRead) {
  startWithCamera();
  fillOutput(200);
  kill(helper.pid(), SIGTERM);
  EXPECT_EQ(helper.wait(Helper::Reading::no), 0);
}

TEST_F(Process, EndsWithItsInputWhileItWaitsForAHostThatDoesNotRead) {
  startWithCamera();
  fillOutput(200);
  helper.closeInput();
  EXPECT_EQ(helper.wait(Helper::Reading::no), 0);
}

}  // namespace
}  // namespace tether
