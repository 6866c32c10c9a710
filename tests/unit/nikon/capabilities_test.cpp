#include <gtest/gtest.h>

#include "NikonObject.h"
#include "Recorder.h"

namespace {

using virtualcamera::Capability;
using virtualcamera::Level;
using virtualcamera::Model;

constexpr std::int32_t kSomething = 0x8200;

class Capabilities : public ::testing::Test {
 protected:
  Capabilities() : camera(model.addCamera(1, "Camera")) {}
  // The camera as the object tree sees it now.
  CNikonObject& object() {
    if (!root) {
      root = std::make_unique<CNikonObject>(Model::entryPoint(), "module");
      root->openChild(1, "camera");
    }
    return *root->openChild(1, "camera");
  }
  void set(Capability capability) {
    root.reset();
    camera.set(std::move(capability));
  }
  std::string asText() {
    const auto value = object().getCapabilityAsTE(kSomething);
    if (!value) return "null";
    return value->getType() == kKtLuaTypeNumber ? std::to_string(static_cast<int>(static_cast<double>(*value)))
                                                : static_cast<std::string>(*value);
  }

  Recorder recorder;
  Model model;
  virtualcamera::Camera& camera;
  std::unique_ptr<CNikonObject> root;
};

TEST_F(Capabilities, EveryValueTypeBecomesItsTableElement) {
  const std::vector<std::pair<Capability, std::string>> table{
      {Capability::boolean(kSomething, true), "1"},
      {Capability::integer(kSomething, -5), "-5"},
      {Capability::unsignedInteger(kSomething, 0xFFFFFFFFU), "-1"},  // values are signed 32-bit numbers
      {Capability::string(kSomething, "text"), "text"},
      {Capability::integers(kSomething, {10, -20, 30}, 1), "-20"},
      {Capability::unsigneds(kSomething, {10, 20, 30}, 2), "30"},
      {Capability::packedStrings(kSomething, {"A", "BB", "CCC"}, 2), "CCC"},
      {Capability::strings(kSomething, {"A", "BB"}, 1), "BB"},
      // Without elements.
      {Capability::unsigneds(kSomething, {}), "0"},
      {Capability::packedStrings(kSomething, {}), ""},
      {Capability::strings(kSomething, {}), ""},
      // An index beyond the end.
      {Capability::unsigneds(kSomething, {1, 2, 3}, 3), "null"},
      {Capability::packedStrings(kSomething, {"A", "BB", "CCC"}, 3), "null"},
      {Capability::strings(kSomething, {"A"}, 0x10000000), "null"}};
  for (const auto& [capability, text] : table) {
    set(capability);
    EXPECT_EQ(asText(), text);
  }
  EXPECT_EQ(recorder.traced("enum had no elements for parameter: 33280"), 1U);
  EXPECT_EQ(recorder.traced("Ran out of space in packed string while attempting to get enum value for parameter 33280"),
            1U);
}

TEST_F(Capabilities, WhatIsNotAnnouncedOrOfAnUnknownTypeOrFailsIsNotRead) {
  EXPECT_EQ(object().getCapabilityAsTE(kSomething), nullptr);
  std::int32_t number = 77;
  std::string text = "kept";
  EXPECT_EQ(object().getIntCapability(kSomething, number), 50000);
  EXPECT_EQ(object().getStringCapability(kSomething, text), 50000);
  EXPECT_EQ(object().getEnumIntCapability(kSomething, number), -1);
  EXPECT_EQ(object().setCapability(kSomething, 0, 0), 50000);

  set(Capability::ofValueType(kSomething, 4));
  EXPECT_EQ(asText(), "null");
  EXPECT_EQ(recorder.traced("Unhandled parameter type for parameter "), 1U);
  EXPECT_EQ(recorder.traced("Parameter type was 4"), 1U);
  EXPECT_EQ(object().getIntCapability(kSomething, number), -1);
  EXPECT_EQ(number, 77);

  set(Capability::unsignedInteger(kSomething, 5));
  model.faults().add({.parameter = kSomething, .times = 1, .answer = kNkMAIDResult_DeviceBusy});
  EXPECT_EQ(object().getIntCapability(kSomething, number), kNkMAIDResult_DeviceBusy);
  EXPECT_EQ(number, 77);

  set(Capability::unsigneds(kSomething, {1}));
  model.faults().add({.parameter = kSomething, .editEnum = [](tagNkMAIDEnum& record) { record.elementType = 3; }});
  EXPECT_EQ(asText(), "null");
  EXPECT_EQ(recorder.traced("enum type was 3"), 1U);
}

TEST_F(Capabilities, EnumerationsThatLieAreNotBelieved) {
  struct Lie {
    Capability capability;
    std::function<void(tagNkMAIDEnum&)> edit;
    std::string read;
  };
  const std::vector<Lie> lies{
      {Capability::unsigneds(kSomething, {1}), [](auto& record) { record.elementSize = 2; }, "null"},
      {Capability::unsigneds(kSomething, {1}), [](auto& record) { record.elementSize = -4; }, "null"},
      {Capability::unsigneds(kSomething, {1}), [](auto& record) { record.elementCount = 0xFFFFFFFF; }, "null"},
      {Capability::strings(kSomething, {"A"}), [](auto& record) { record.elementCount = 0x1000000; }, "null"},
      {Capability::strings(kSomething, {"A"}), [](auto& record) { record.elementSize = 100; }, ""},
      {Capability::packedStrings(kSomething, {"A"}), [](auto& record) { record.elementSize = 4; }, "null"},
      {Capability::packedStrings(kSomething, {"A"}), [](auto& record) { record.elementCount = 0x7FFFFFFF; }, "null"},
  };
  for (const Lie& lie : lies) {
    model.faults().clear();
    set(lie.capability);
    model.faults().add({.parameter = kSomething, .editEnum = lie.edit, .anyArraySize = true});
    EXPECT_EQ(asText(), lie.read);
  }
}

TEST_F(Capabilities, StringsWithoutAnEndStopAtTheirBuffersEnd) {
  model.faults().add({.parameter = kSomething, .unterminated = true});
  for (const auto& [capability, length] : {std::pair(Capability::string(kSomething, "text"), 256),
                                           std::pair(Capability::packedStrings(kSomething, {"A", "BB"}), 5),
                                           std::pair(Capability::strings(kSomething, {"A", "BB"}, 1), 256)}) {
    set(capability);
    EXPECT_EQ(asText(), std::string(static_cast<std::size_t>(length), 'X'));
  }
}

TEST_F(Capabilities, AListThatChangesIsReadAgainAndOneThatCannotBeReadAnnouncesNothing) {
  model.faults().add(
      {.level = Level::Camera, .command = kNkMAIDCommand_GetCapInfo, .times = 1, .answer = kNkMAIDResult_BufferSize});
  EXPECT_TRUE(object().hasCapability(kNkMAIDCapability_Name));
  EXPECT_EQ(recorder.traced("Error from kNkMAIDCommand_GetCapInfo"), 0U);
  object().debugDumpCapabilities();
  EXPECT_EQ(recorder.traced("\t9\tkNkMAIDCapability_Name\t8"), 1U);
  for (const std::uint32_t command : {kNkMAIDCommand_GetCapCount, kNkMAIDCommand_GetCapInfo}) {
    for (const std::int32_t result : {kNkMAIDResult_HardwareError, kNkMAIDResult_BufferSize}) {
      root.reset();
      model.faults().clear();
      model.faults().add({.level = Level::Camera, .command = command, .answer = result});
      EXPECT_FALSE(object().hasCapability(kNkMAIDCapability_Name));
    }
  }
  EXPECT_EQ(recorder.traced("Error from kNkMAIDCommand_GetCapInfo: -124"), 2U);
  EXPECT_EQ(recorder.traced("Error from kNkMAIDCommand_GetCapInfo: -116"), 2U);
}

TEST_F(Capabilities, AnActionIsWaitedForByPollingUntilItsCompletionOrAFailedPoll) {
  SpyObject module(Model::entryPoint());
  auto* const spy = new SpyObject(&module, 1);
  int completions = 0;
  spy->onCompletion = [&](std::int32_t, std::int32_t, void*) { ++completions; };
  EXPECT_EQ(spy->issueCommand(kNkMAIDCapability_Capture, spy, nullptr), 0) << "pending counts as success";
  EXPECT_EQ(completions, 1);
  EXPECT_EQ(spy->issueCommand(kSomething, spy, nullptr), 0) << "not announced: nothing is done";
  EXPECT_EQ(spy->capStart(kNkMAIDCapability_Capture, nullptr, nullptr), kNkMAIDResult_Pending);
  EXPECT_EQ(completions, 1) << "without a receiver nothing is waited for";
  while (camera.items().size() < 2) EXPECT_TRUE(spy->async());
  EXPECT_TRUE(spy->async());

  const auto start = model.faults().add({.command = kNkMAIDCommand_CapStart, .answer = kNkMAIDResult_OutOfFocus});
  EXPECT_EQ(spy->issueCommand(kNkMAIDCapability_Capture, spy, nullptr), kNkMAIDResult_OutOfFocus);
  model.faults().remove(start);
  // The completion comes later than the wait for it: it finds nothing any more.
  model.faults().add(
      {.level = Level::Camera, .command = kNkMAIDCommand_Async, .times = 1, .answer = kNkMAIDResult_HardwareError});
  EXPECT_EQ(spy->issueCommand(kNkMAIDCapability_Capture, spy, nullptr), 0);
  for (int poll = 0; poll < 5; ++poll) EXPECT_TRUE(spy->async());
  EXPECT_EQ(completions, 1);
}

}  // namespace
