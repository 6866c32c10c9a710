// A host that floods, dawdles, or dies at the wrong moment.

#include <fstream>
#include <string>
#include <thread>

#include "Helper.h"

namespace tether {
namespace {

using namespace std::chrono_literals;

// A sanitizer keeps freed memory.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr std::size_t kRoom = std::size_t{1} << 30;
#else
constexpr std::size_t kRoom = std::size_t{24} << 20;
#endif

class HostileHost : public HelperTest {
 protected:
  std::size_t peakMemory() const {
    std::ifstream status("/proc/" + std::to_string(helper.pid()) + "/status");
    for (std::string line; std::getline(status, line);) {
      if (line.rfind("VmHWM:", 0) == 0) return std::stoul(line.substr(6)) * 1024;
    }
    return 0;
  }
};

TEST_F(HostileHost, AFloodWithoutReadingWaitsInThePipeAndIsAnsweredInOrder) {
  constexpr std::int32_t kRequests = 5000;
  startWithCamera();
  helper.narrowOutput();
  const std::size_t before = peakMemory();
  std::string flood;
  for (std::int32_t id = 1; id <= kRequests; ++id) flood += request("connectDevice", id, 0x0109);
  std::thread sending([&] { helper.send(flood); });
  awaitCondition("a full pipe to the helper", [&] { return helper.unreadByHelper() > 60'000; });
  EXPECT_LT(peakMemory(), before + kRoom);
  for (std::int32_t id = 1; id <= kRequests; ++id) EXPECT_EQ(helper.await("error").id, id);
  sending.join();
}

TEST_F(HostileHost, ARequestAByteAtATimeIsARequest) {
  startWithCamera();
  for (const char byte : request("connectDevice", 7, kStudio)) helper.send(std::string(1, byte));
  EXPECT_EQ(helper.awaitAnswer(7).name, "ok");
}

// Its pipes close in any order, with half a request in them, while frames go out.
TEST_F(HostileHost, AHostThatDiesInTheMiddleOfAFrameLeavesNoHelperAndNoHalfFile) {
  for (const std::size_t sent : {std::size_t{0}, std::size_t{3}, std::size_t{20}}) {
    for (const bool outputFirst : {false, true}) {
      Helper other;
      other.install("Type0001Module", VIRTUAL_CAMERA_MODULE);
      drop(other.cameras() / "1-Studio/camera.json",
           R"({"transfer": {"deliveryBytes": 1000, "bytesPerSecond": 1000}})");
      drop(other.cameras() / "1-Studio/1.jpg", pattern(1'000'000, 1));
      other.start();
      other.await("objectWasAdded");
      if (outputFirst) other.closeOutput();
      other.send(request("connectDevice", 1, kStudio) + request("connectDevice", 2, kStudio).substr(0, sent));
      const auto end = Clock::now();
      other.closeInput();
      EXPECT_EQ(other.wait(), 0);
      EXPECT_LT(Clock::now() - end, 10s);  // 2 seconds, on a machine that is not busy
      EXPECT_TRUE(std::filesystem::is_empty(other.temporary()));
    }
  }
}

}  // namespace
}  // namespace tether
