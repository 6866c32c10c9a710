// What a module's author may do: be slow, refuse, and report from a thread of the author's own.
#include <gtest/gtest.h>

#include <future>

#include "Client.h"

namespace camerakit::test {

// Asked three times for each piece; the fourth one never comes.
struct Late final : PictureSource {
  uint64_t size() const override { return 4; }
  Piece piece(uint64_t offset, uint32_t, std::vector<uint8_t>& scratch) const override {
    scratch.assign(2, offset == 0 ? 'a' : 'b');
    if (++asked % 3 != 0) return Piece::notYet();
    return asked < 12 ? scratch.data() : Piece::failed(kNkMAIDResult_BusReset);
  }
  mutable int asked = 0;
};

struct Author final : Camera {
  using Camera::Camera;
  int32_t opened() override { return opens++ == 0 ? kNkMAIDResult_DeviceBusy : kNkMAIDResult_NoError; }
  int32_t fire(const Exposure& exposure) override {
    if (fate == kNkMAIDResult_MediaFull) return fate;
    exposing = std::async(std::launch::async, [=, this] { add({Picture{.source = late}}), exposure.end(fate); });
    return kNkMAIDResult_Pending;
  }
  int32_t change(uint32_t, uint32_t value) override { return value > 1 ? kNkMAIDResult_ValueOutOfBounds : 0; }
  void transferred(uint32_t, const Picture&, int32_t result) override { results.push_back(result); }
  const std::shared_ptr<Late> late = std::make_shared<Late>();
  int32_t opens = 0, fate = 0;
  std::future<void> exposing;
  std::vector<int32_t> results;
};

TEST(KitTest, AnAuthorMayBeSlowAndRefuseAndReportFromAnotherThread) {
  Model model;
  const auto camera = std::make_shared<Author>(model, 1, "One");
  model.plug(camera);
  camera->setTransfer({.deliveryBytes = 2});
  camera->set(Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 0));
  Client module, early(module, 1), device(module, 1);
  EXPECT_EQ(early.opened, kNkMAIDResult_DeviceBusy);
  for (const uintptr_t value : {1, 2})
    device.send(kNkMAIDCommand_CapSet, kNkMAIDCapability_SaveMedia, kNkMAIDDataType_Unsigned,
                reinterpret_cast<void*>(value));
  EXPECT_EQ(device.number(kNkMAIDCapability_SaveMedia), 1u);
  for (const int32_t fate : {0, +kNkMAIDResult_MediaFull, +kNkMAIDResult_OutOfFocus}) {
    camera->fate = fate;
    const int32_t answer = device.start(kNkMAIDCapability_Capture);
    EXPECT_EQ(answer == kNkMAIDResult_Pending ? device.finish() : answer, fate);
  }
  Opened whole(device, 1), part(device, 2);
  EXPECT_EQ(whole.transfer(), kNkMAIDResult_NoError);
  EXPECT_EQ(whole.data.received, "aabb");
  EXPECT_EQ(part.transfer(), kNkMAIDResult_BusReset);
  part.data.start(kNkMAIDCapability_Acquire);
  EXPECT_EQ(model.unplug(1).size(), 1u);
  EXPECT_EQ(camera->results, (std::vector<int32_t>{0, kNkMAIDResult_BusReset, kNkMAIDResult_Aborted}));
}

}  // namespace camerakit::test
