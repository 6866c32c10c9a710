// The process: start, heartbeat, end, and a host that does not do its part.

#include <csignal>
#include <string>

#include "Helper.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

class Process : public HelperTest {};

// So much in a narrowed pipe leaves no room for what is still to be answered, and no frame is so long that less stays.
constexpr std::size_t kNearlyFull = 3000;

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

TEST_F(Process, EndsWithStatusZeroWhenItsInputEndsAndOnShutdown) {
  helper.start();
  helper.closeInput();
  EXPECT_EQ(helper.wait(), 0);

  Helper other;
  other.start();
  other.send(request("shutdown", 1));
  EXPECT_EQ(other.wait(), 0);
}

TEST_F(Process, EndsWithStatusZeroOnSignalsEvenInTheMiddleOfATransfer) {
  startWithCamera(R"({"transfer": {"deliveryBytes": 1000, "bytesPerSecond": 1000}})");
  drop(studio() / "a.jpg", pattern(1000000, 1));
  helper.await("objectWasAdded");
  kill(helper.pid(), SIGTERM);
  EXPECT_EQ(helper.wait(), 0);
  EXPECT_EQ(helper.count("fileDownloadComplete"), 0U);

  Helper other;
  other.install("Type0001Module", VIRTUAL_CAMERA_MODULE);
  fs::create_directories(other.cameras() / "1-Studio");
  other.start();
  other.await("deviceAdded");
  kill(other.pid(), SIGINT);
  EXPECT_EQ(other.wait(), 0);
}

TEST_F(Process, CarriesOutNothingBehindShutdown) {
  startWithCamera();
  helper.send(request("connectDevice", 1, kStudio) + request("shutdown", 2) + request("getCameraSettings", 3, kStudio));
  EXPECT_EQ(helper.wait(), 0);
  EXPECT_EQ(helper.awaitAnswer(1).name, "ok");
  for (const Message& message : helper.messages()) EXPECT_NE(message.id, 3);
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
  startWithCamera();
  connect(kStudio);
  helper.narrowOutput();
  constexpr std::int32_t kRequests = 200;
  constexpr int kPictures = 30;
  std::string requests;
  for (std::int32_t id = 10; id < 10 + kRequests; ++id) requests += request("connectDevice", id, 0x0109);
  for (int i = 0; i < kPictures; ++i) drop(studio() / (std::to_string(i) + ".jpg"), pattern(1000, 1));
  helper.send(requests);
  awaitCondition("full pipe", [&] { return helper.unread() > kNearlyFull; });
  std::size_t place = 0;
  for (std::int32_t id = 10; id < 10 + kRequests; ++id) {
    const Message& error = helper.awaitAnswer(id);
    EXPECT_GT(error.place, place);
    place = error.place;
  }
  for (int i = 1; i <= kPictures; ++i) EXPECT_EQ(helper.await("fileDownloadComplete").number("capture_id"), i);
}

// A helper whose main thread waits for a host that does not read.
class HeldUp : public Process {
 protected:
  HeldUp() {
    startWithCamera();
    helper.narrowOutput();
    std::string requests;
    for (std::int32_t id = 10; id < 210; ++id) requests += request("connectDevice", id, 0x0109);
    helper.send(requests);
    awaitCondition("full pipe", [&] { return helper.unread() > kNearlyFull; });
  }
};

TEST_F(HeldUp, EndsOnASignal) {
  kill(helper.pid(), SIGTERM);
  EXPECT_EQ(helper.wait(Helper::Reading::no), 0);
}

TEST_F(HeldUp, EndsWithItsInput) {
  helper.closeInput();
  EXPECT_EQ(helper.wait(Helper::Reading::no), 0);
}

TEST_F(Process, TakesAFileThatIsNotWholeAlongWhenItEnds) {
  startWithCamera(R"({"transfer": {"deliveryBytes": 1000, "bytesPerSecond": 1000}})");
  drop(studio() / "1.jpg", pattern(1'000'000, 1));
  helper.await("objectWasAdded");
  EXPECT_TRUE(fs::exists(helper.temporary() / "Capture0001.jpg"));
  helper.closeInput();
  EXPECT_EQ(helper.wait(), 0);
  EXPECT_TRUE(fs::is_empty(helper.temporary()));
}

}  // namespace
}  // namespace tether
