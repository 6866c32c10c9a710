// Frames that can never be messages cost their own bytes, and nothing behind them.

#include <limits>
#include <memory>

#include "Helper.h"

namespace tether {
namespace {

class Malformed : public HelperTest {
 protected:
  void expectDropped(const std::string& bytes) {
    ++_id;
    helper.send(bytes + request("getCameraSettings", _id, kStudio));
    EXPECT_EQ(helper.awaitAnswer(_id).name, "error");
  }
  const std::string _name = encoded(KtLuaTEString("connectDevice"));

 private:
  std::int32_t _id = 100;
};

std::string nested(int depth) {
  auto inner = std::make_unique<KtLuaTETable>();
  for (; depth > 1; --depth) {
    auto outer = std::make_unique<KtLuaTETable>();
    outer->Set("t", inner.release());
    inner = std::move(outer);
  }
  return encoded(*inner);
}

TEST_F(Malformed, FramesAreSkippedAndTheNextRequestIsAnswered) {
  startWithCamera();
  const std::string table = littleEndian(kKtLuaTypeTable) + littleEndian(1);
  const std::string notANumber = encoded(KtLuaTENumber(std::numeric_limits<double>::quiet_NaN()));
  expectDropped(frame(1, _name, littleEndian(kKtLuaTypeData) + littleEndian(0xFFFFFFFF)));
  expectDropped(frame(1, _name, littleEndian(kKtLuaTypeString) + littleEndian(0x7FFFFFFF)));
  expectDropped(frame(1, _name, table + littleEndian(77)));
  expectDropped(frame(1, _name, table + notANumber + encoded(KtLuaTENil())));
  expectDropped(frame(1, _name, table + encoded(KtLuaTEString("key")) + littleEndian(77)));
  expectDropped(frame(1, _name, nested(kKtLuaDeepestNesting + 1)));
  expectDropped(frame(1, littleEndian(kKtLuaTypeData) + littleEndian(0x80000000), std::string(5000, '\x7f')));
  EXPECT_EQ(helper.count("ok"), 0U);
  // At the limit it is a message, though one that names no device.
  expectDropped(frame(1, _name, nested(kKtLuaDeepestNesting)));
  const std::string log = helper.standardError();
  std::size_t lines = 0;
  for (std::size_t at = log.find("Dropped a frame"); at != std::string::npos;
       at = log.find("Dropped a frame", at + 1)) {
    ++lines;
  }
  EXPECT_EQ(lines, 7U);
}

TEST_F(Malformed, AFrameOfMoreThan64MiBIsSkippedAsItArrives) {
  startWithCamera();
  constexpr std::uint32_t kLength = 65 << 20;
  expectDropped(littleEndian(kLength) + std::string(kLength, '\x05'));
}

}  // namespace
}  // namespace tether
