// The process: start, heartbeat, end, and hosts that flood, do not read, or go away in the middle of something.

#include <csignal>
#include <cstdlib>
#include <thread>

#include "Helper.h"

namespace tether {
namespace {

using namespace std::chrono_literals;
using namespace std::string_literals;
namespace fs = std::filesystem;

// What a narrowed pipe holds once it takes no more, and an ordinary one.
constexpr std::size_t kNearlyFull = 3000;
constexpr std::size_t kWideNearlyFull = 60'000;
// Two seconds are promised; the rest is for a machine that has other things to do.
constexpr auto kGone = 2s + 8s;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
constexpr std::size_t kMostMemory = std::size_t{1} << 40;  // what was given back is kept
#else
constexpr bool kSanitized = false;
constexpr std::size_t kMostMemory = std::size_t{32} << 20;
#endif

class Process : public HelperTest {
 protected:
  // So many requests that are answered with an error each, from id 1'000 on.
  static std::string refused(std::int32_t count) {
    std::string requests;
    for (std::int32_t id = 1'000; id < 1'000 + count; ++id) requests += request("connectDevice", id, 0x0109);
    return requests;
  }
  // The main thread waits for a host that does not read.
  void holdUp() {
    helper.narrowOutput();
    helper.send(refused(200));
    awaitCondition("full pipe", [this] { return helper.unread() > kNearlyFull; });
  }
  // The most memory that the helper has had at one time, in bytes. 0 where the system does not tell.
  std::size_t peakMemory() const {
    std::ifstream status("/proc/" + std::to_string(helper.pid()) + "/status");
    for (std::string line; std::getline(status, line);) {
      if (line.rfind("VmHWM:", 0) == 0) return std::stoul(line.substr(6)) << 10;
    }
    return 0;
  }
};

TEST_F(Process, WithoutModulesSendsHeartbeatsAndAnswersNoRequestThatNamesADevice) {
  const auto begin = Clock::now();
  helper.start();
  for (const char* name : {"connectDevice", "getCameraSettings", "disconnectDevice", "listDevices", "doCapture"}) {
    helper.send(request(name, 5, kStudio));
  }
  EXPECT_EQ(helper.await("heartbeat").bytes, "\x1a\0\0\0\0\0\0\0\x03\0\0\0\x0a\0\0\0heartbeat\0\x01\0\0\0"s);
  EXPECT_GE(helper.await("heartbeat").arrived - begin, 3.9s);
  EXPECT_EQ(helper.count("heartbeat"), helper.messages().size());
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
  for (const Received& message : helper.messages()) EXPECT_NE(message.id, 3);
  EXPECT_EQ(helper.count("objectWasAdded"), helper.count("fileDownloadComplete"));
  EXPECT_TRUE(readFile(helper.await("fileDownloadComplete").text("file_path")) == pattern(5000, 1));
}

TEST_F(Process, AFloodThatNobodyReadsTheAnswersOfWaitsOutsideAndNothingOfEitherThreadIsLost) {
  constexpr std::int32_t kRequests = 20'000;
  constexpr int kPictures = 30;
  startWithCamera();
  for (int i = 0; i < kPictures; ++i) drop(studio() / (std::to_string(i) + ".jpg"), pattern(1000, 1));
  helper.narrowOutput();
  std::thread sender([&] { helper.send(refused(kRequests)); });
  awaitCondition("two full pipes",
                 [this] { return helper.unread() > kNearlyFull && helper.unreadByHelper() > kWideNearlyFull; });
  EXPECT_LT(peakMemory(), kMostMemory);
  helper.awaitAnswer(1'000 + kRequests - 1);
  sender.join();
  std::int32_t next = 1'000;
  for (const Received& message : helper.messages()) next += message.id == next ? 1 : 0;
  EXPECT_EQ(next, 1'000 + kRequests);
  for (int i = 1; i <= kPictures; ++i) EXPECT_EQ(helper.await("fileDownloadComplete").number("capture_id"), i);
  EXPECT_LT(peakMemory(), kMostMemory);
}

TEST_F(Process, ALostReaderEndsAWriteThatWaitsForItAndNothingElse) {
  startWithCamera();
  holdUp();
  helper.closeOutput();
  helper.send(request("connectDevice", 1, kStudio) + request("doCapture", 2));
  awaitCondition("picture", [this] { return !fs::is_empty(helper.temporary()); });
  EXPECT_NE(helper.standardError().find("Writing to the host failed"), std::string::npos);
}

TEST_F(Process, ThatHasNoDescriptorsLeftSaysSoInOneLineAndEnds) {
  if (kSanitized) GTEST_SKIP() << "the sanitizers need descriptors of their own";
  for (int descriptors = 3, refusals = 0;; ++descriptors) {
    Helper other;
    other.limit("-n " + std::to_string(descriptors));
    other.start();
    other.closeInput();
    const int status = other.wait();
    const std::string log = other.standardError();
    if (status == 0) {
      EXPECT_GT(refusals, 2);
      break;
    }
    const bool loaded = status != 127;  // else it never began
    refusals += loaded ? 1 : 0;
    ASSERT_TRUE(!loaded || (status == 1 && log.find("could not start") != std::string::npos)) << status << log;
    ASSERT_LT(descriptors, 64);
  }
}

// What the helper is doing when its input, or a signal, ends it. Whatever it is, it is gone in time, and leaves no part
// of a picture.
enum Doing { kFlood, kHalfARequest, kHangingCapture, kHangingModule, kDeletion, kTransfer, kHeldUp, kShuttingDown };
struct End {
  const char* name;
  Doing doing;
  int signal = 0;
};
void PrintTo(const End& end, std::ostream* out) { *out << end.name; }

class EndsInTime : public Process, public testing::WithParamInterface<End> {
 protected:
  void begin(Doing doing) {
    const auto fault = [](const std::string& what) { return R"({"faults": [{)" + what + R"(, "delayMs": 600000}]})"; };
    if (doing == kHangingCapture) {
      startWithCamera(fault(R"("object": "camera", "command": "CapStart", "capability": "Capture")"));
      connect();
      helper.send(request("doCapture", 2));
      awaitCondition("main thread that is held up", [this] {
        helper.send(request("getDeviceInfo", 3));
        return helper.unreadByHelper() > 1000;
      });
      return;
    }
    startWithCamera(doing == kHangingModule ? fault(R"("object": "data", "command": "Async", "skip": 2)")
                                            : R"({"transfer": {"deliveryBytes": 1000, "bytesPerSecond": 1000}})");
    if (doing == kFlood || doing == kHalfARequest) {
      std::string flood;
      while (flood.size() < std::size_t{1} << 20) flood += request("getDeviceInfo", 2);
      helper.send(doing == kFlood ? flood : flood.substr(0, 20));
      awaitCondition("read part", [&] { return doing == kFlood || helper.unreadByHelper() == 0; });
      return;
    }
    drop(studio() / "a.jpg", _picture);
    helper.await("objectWasAdded");
    EXPECT_TRUE(fs::exists(helper.temporary() / "Capture0001.jpg"));
    if (doing == kDeletion) unplug("1-Studio");
    if (doing == kHeldUp) holdUp();
    if (doing != kShuttingDown) return;
    helper.send(request("shutdown", 1));
    awaitCondition("shutdown read", [&] { return helper.unreadByHelper() == 0; });
  }
  const std::string _picture = pattern(1'000'000, 1);
};

TEST_P(EndsInTime, AndLeavesNoPartOfAPicture) {
  const auto& [name, doing, signal] = GetParam();
  begin(doing);
  const auto begun = Clock::now();
  if (signal != 0) kill(helper.pid(), signal);
  if (signal == 0 || doing == kShuttingDown) helper.closeInput();
  EXPECT_EQ(helper.wait(Helper::Reading::no), 0);
  EXPECT_LT(Clock::now() - begun, kGone);
  for (const auto& file : fs::directory_iterator(helper.temporary())) {
    EXPECT_EQ(readFile(file.path()), _picture) << file.path();
  }
}

INSTANTIATE_TEST_SUITE_P(Process, EndsInTime,
                         testing::Values(End{"InAFlood", kFlood}, End{"InHalfARequest", kHalfARequest},
                                         End{"InACaptureThatDoesNotReturn", kHangingCapture},
                                         End{"InATransferWhoseModuleDoesNotReturn", kHangingModule},
                                         End{"WhileTheMainThreadDeletesACamera", kDeletion},
                                         End{"InATransfer", kTransfer}, End{"ByATermSignal", kTransfer, SIGTERM},
                                         End{"ByAnIntSignal", kTransfer, SIGINT},
                                         End{"WhileTheHostDoesNotRead", kHeldUp},
                                         End{"ByASignalWhileTheHostDoesNotRead", kHeldUp, SIGTERM},
                                         End{"ByASignalInAShutdown", kShuttingDown, SIGTERM}),
                         [](const auto& made) { return made.param.name; });

}  // namespace
}  // namespace tether
