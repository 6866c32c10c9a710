// A service with two modules, both of them the one model.
#include "ServiceTest.h"

// What the forwarding modules call.
extern "C" __attribute__((visibility("default"))) std::int32_t testEntryPoint(
    tagNkMAIDObject* object, std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType, std::uint64_t data,
    NkMAIDCompletionProc* completion, void* reference) {
  return virtualcamera::entryPoint(object, command, parameter, dataType, data, completion, reference);
}

namespace {

TEST_F(ServiceTest, OneEventHasAllModulesScannedInOneIdlePass) {
  // Neither hears of its cameras: the service is told.
  model.faults().add(
      {.level = virtualcamera::Level::Module, .command = kNkMAIDCommand_CapSet, .answer = kNkMAIDResult_NotSupported});
  model.addCamera(1, "One");
  start();
  ASSERT_EQ(recorder.names(), "deviceAdded deviceAdded");
  model.addCamera(2, "Two");
  model.removeCamera(1);
  idle();
  ASSERT_EQ(recorder.count("deviceAdded"), 2U);
  service->doCameraScanOnIdle();
  idle();
  std::string told;
  for (const Message& message : recorder.messages())
    told += " " + message.name.substr(6) + std::to_string(static_cast<int>(message.numbers.at("device_id")) - 0x300);
  EXPECT_EQ(told, " Added1 Added513 Added2 Removed1 Added514 Removed513");
}

}  // namespace
