// Hosts that flood, do not read, or go away in the middle of something.

#include <fstream>
#include <string>
#include <thread>

#include "Helper.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

// What a narrowed pipe holds once it takes no more, and an ordinary one.
constexpr std::size_t kNearlyFull = 3000;
constexpr std::size_t kWideNearlyFull = 60'000;
constexpr double kNoCamera = 0x0109;
// Two seconds are promised; the rest is for a machine that has other things to do.
constexpr auto kGone = 2s + 4s;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr std::size_t kMostMemory = std::size_t{1} << 40;  // a sanitizer keeps what was given back
#else
constexpr std::size_t kMostMemory = std::size_t{32} << 20;
#endif

class Hostile : public HelperTest {
 protected:
  // The most memory that the helper has had at one time, in bytes. 0 where the system does not tell.
  std::size_t peakMemory() const {
    std::ifstream status("/proc/" + std::to_string(helper.pid()) + "/status");
    for (std::string line; std::getline(status, line);) {
      if (line.rfind("VmHWM:", 0) == 0) return std::stoul(line.substr(6)) << 10;
    }
    return 0;
  }
  // So many requests that are answered with an error each, from id 1'000 on.
  static std::string refused(std::int32_t count) {
    std::string requests;
    for (std::int32_t id = 1'000; id < 1'000 + count; ++id) requests += request("connectDevice", id, kNoCamera);
    return requests;
  }
  void holdUp() {
    helper.narrowOutput();
    helper.send(refused(200));
    awaitCondition("full pipe", [this] { return helper.unread() > kNearlyFull; });
  }
};

TEST_F(Hostile, AFloodThatNobodyReadsTheAnswersOfWaitsOutsideAndIsAnsweredInOrder) {
  startWithCamera();
  helper.narrowOutput();
  constexpr std::int32_t kRequests = 20'000;
  std::thread sender([&] { helper.send(refused(kRequests)); });
  awaitCondition("two full pipes",
                 [this] { return helper.unread() > kNearlyFull && helper.unreadByHelper() > kWideNearlyFull; });
  EXPECT_LT(peakMemory(), kMostMemory);
  helper.awaitAnswer(1'000 + kRequests - 1);
  sender.join();
  std::int32_t next = 1'000;
  for (const Message& message : helper.messages()) {
    if (message.id == next) ++next;
  }
  EXPECT_EQ(next, 1'000 + kRequests);
  EXPECT_LT(peakMemory(), kMostMemory);
}

TEST_F(Hostile, ALostReaderEndsAWriteThatWaitsForItAndNothingElse) {
  startWithCamera();
  holdUp();
  helper.closeOutput();
  helper.send(request("connectDevice", 1, kStudio) + request("doCapture", 2));
  awaitCondition("picture", [this] { return !fs::is_empty(helper.temporary()); });
  EXPECT_NE(helper.standardError().find("Writing to the host failed"), std::string::npos);
}

// Whatever the helper does, it is gone in time and leaves no part of a picture.
class InputsEnd : public Hostile {
 protected:
  void start(const std::string& cameraFile) {
    startWithCamera(cameraFile);
    connect(kStudio);
  }
  void drop() const { tether::drop(studio() / "a.jpg", _picture); }
  void endInput() {
    const auto begin = Clock::now();
    helper.closeInput();
    EXPECT_EQ(helper.wait(Helper::Reading::no), 0);
    EXPECT_LT(Clock::now() - begin, kGone);
    for (const auto& file : fs::directory_iterator(helper.temporary())) {
      EXPECT_EQ(readFile(file.path()), _picture) << file.path();
    }
  }
  const char* const _slow = R"({"transfer": {"deliveryBytes": 1000, "bytesPerSecond": 1000}})";

 private:
  const std::string _picture = pattern(1'000'000, 1);
};

TEST_F(InputsEnd, InAFlood) {
  startWithCamera();
  std::string flood;
  while (flood.size() < std::size_t{1} << 20) flood += request("getDeviceInfo", 2);
  helper.send(flood);
  endInput();
}

TEST_F(InputsEnd, InTheMiddleOfARequest) {
  startWithCamera();
  helper.send(request("connectDevice", 2, kStudio).substr(0, 20));
  awaitCondition("read part", [this] { return helper.unreadByHelper() == 0; });
  endInput();
}

TEST_F(InputsEnd, InACaptureThatDoesNotReturn) {
  start(R"({"faults": [{"object": "camera", "command": "CapStart", "capability": "Capture", "delayMs": 600000}]})");
  helper.send(request("doCapture", 2));
  awaitCondition("main thread that is held up", [this] {
    helper.send(request("getDeviceInfo", 3));
    return helper.unreadByHelper() > 1000;
  });
  endInput();
}

TEST_F(InputsEnd, InATransferWhoseModuleDoesNotReturn) {
  start(R"({"transfer": {"deliveryBytes": 100000},
    "faults": [{"object": "data", "command": "Async", "skip": 2, "delayMs": 600000}]})");
  drop();
  helper.await("objectWasAdded");
  endInput();
}

TEST_F(InputsEnd, InATransferWhileTheMainThreadDeletesItsCamera) {
  start(_slow);
  drop();
  helper.await("objectWasAdded");
  unplug("1-Studio");
  endInput();
}

TEST_F(InputsEnd, InATransferWhileTheMainThreadWaitsForAHostThatDoesNotRead) {
  start(_slow);
  drop();
  helper.await("objectWasAdded");
  holdUp();
  endInput();
}

}  // namespace
}  // namespace tether
