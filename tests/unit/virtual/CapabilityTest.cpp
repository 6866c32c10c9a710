// Reading a camera: the tree, the capability list, every value type.
#include <gtest/gtest.h>

#include "Client.h"
#include "VirtualCamera.h"

namespace virtualcamera::test {
namespace {

struct CapabilityTest : testing::Test {
  Model model;
  Camera& camera = model.addCamera(7, "Virtual Seven");
  Client module{Model::entryPoint(), nullptr, 0};
  Client device{module, 7};
};

TEST_F(CapabilityTest, TheTreeOpensLevelByLevelAndIsEmptyAfterItsCloses) {
  EXPECT_EQ(module.children(), (std::vector<uint32_t>{7}));
  EXPECT_EQ(device.getString(kNkMAIDCapability_Name), "Virtual Seven");
  camera.shoot(Picture::jpeg({1, 2, 3}));
  EXPECT_EQ(device.children(), (std::vector<uint32_t>{1}));
  {
    Opened picture(device, 1);
    ASSERT_EQ(picture.data.opened, kNkMAIDResult_NoError);
    EXPECT_EQ(picture.item.getUnsigned(kNkMAIDCapability_DataTypes), 1u);
    EXPECT_EQ(picture.data.getUnsigned(kNkMAIDCapability_StoredBytes), 3u);
    EXPECT_EQ(model.openObjects(), 4u);
    EXPECT_EQ(Client(picture.item, 2).opened, kNkMAIDResult_ValueOutOfBounds);
  }
  EXPECT_EQ(Client(module, 8).opened, kNkMAIDResult_ValueOutOfBounds);
  EXPECT_EQ(Client(device, 9).opened, kNkMAIDResult_ValueOutOfBounds);
  EXPECT_EQ(device.close(), kNkMAIDResult_NoError);
  EXPECT_EQ(module.close(), kNkMAIDResult_NoError);
  EXPECT_EQ(model.openObjects(), 0u);
}

TEST_F(CapabilityTest, ClosedAndForeignRecordsAreZombies) {
  tagNkMAIDObject foreign{};
  foreign.sdkHead = 1;  // the module's, but not in the module's record
  NkMAIDEntryPoint* entry = Model::entryPoint();
  EXPECT_EQ(entry(&foreign, kNkMAIDCommand_Async, 0, 0, 0, nullptr, nullptr), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(entry(nullptr, kNkMAIDCommand_Async, 0, 0, 0, nullptr, nullptr), kNkMAIDResult_ZombieObject);
  device.close();
  EXPECT_EQ(device.poll(), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(device.send(kNkMAIDCommand_Close), kNkMAIDResult_ZombieObject);
  EXPECT_EQ(module.send(kNkMAIDCommand_Abort), kNkMAIDResult_NotSupported);
}

TEST_F(CapabilityTest, AParentClosedFirstLeavesOrphansThatCanOnlyBeClosed) {
  EXPECT_EQ(module.close(), kNkMAIDResult_OrphanedChildren);
  EXPECT_EQ(device.poll(), kNkMAIDResult_ZombieObject);
  EXPECT_FALSE(device.isAlive());
  EXPECT_EQ(device.close(), kNkMAIDResult_NoError);
  EXPECT_EQ(model.openObjects(), 0u);
}

TEST_F(CapabilityTest, ACapabilityListThatChangedInBetweenIsReadAgain) {
  uint32_t count = 0;
  ASSERT_EQ(device.send(kNkMAIDCommand_GetCapCount, 0, kNkMAIDDataType_UnsignedPtr, &count), 0);
  camera.set(Capability::ofValueType(0x9000, 4));
  std::vector<tagNkMAIDCapInfo> list(count + 1);
  EXPECT_EQ(device.send(kNkMAIDCommand_GetCapInfo, count, kNkMAIDDataType_CapInfoPtr, list.data()),
            kNkMAIDResult_BufferSize);
  EXPECT_EQ(device.send(kNkMAIDCommand_GetCapInfo, count + 1, kNkMAIDDataType_CapInfoPtr, list.data()), 0);
  EXPECT_EQ(list.back().id, 0x9000u);
  EXPECT_EQ(list.back().valueType, 4u);
  camera.remove(kNkMAIDCapability_Capture);
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_NotSupported);
  EXPECT_EQ(device.send(kNkMAIDCommand_GetCapCount, 0, kNkMAIDDataType_UnsignedPtr, &count), 0);
  EXPECT_EQ(count, list.size() - 1);
}

TEST_F(CapabilityTest, EveryValueTypeReadsWithItsDataTypeOnly) {
  int32_t battery = 0;
  EXPECT_EQ(device.get(kNkMAIDCapability_BatteryLevel, kNkMAIDDataType_IntegerPtr, &battery), 0);
  EXPECT_EQ(battery, 85);
  EXPECT_EQ(device.get(kNkMAIDCapability_BatteryLevel, kNkMAIDDataType_UnsignedPtr, &battery),
            kNkMAIDResult_UnexpectedDataType);
  EXPECT_EQ(device.getUnsigned(kNkMAIDCapability_FreeBytes), 1'234'567'168u);
  EXPECT_TRUE(device.isAlive());
  camera.setAlive(false);
  EXPECT_FALSE(device.isAlive());
  camera.set(Capability::string(kNkMAIDCapability_Name, std::string(300, 'n')));
  EXPECT_EQ(device.getString(kNkMAIDCapability_Name), std::string(255, 'n'));
  EXPECT_EQ(device.get(0x7777, kNkMAIDDataType_UnsignedPtr, &battery), kNkMAIDResult_NotSupported);
}

TEST_F(CapabilityTest, EnumerationsOfNumbersAndOfBothKindsOfStrings) {
  const auto [iso, isoBytes] = device.getEnum(kNkMAIDCapability_Sensitivity);
  EXPECT_EQ(iso.elementType, uint32_t{kNkMAIDArrayType_Unsigned});
  uint32_t value = 0;
  std::memcpy(&value, isoBytes.data() + iso.currentIndex * 4, 4);
  EXPECT_EQ(value, 400u);

  camera.set(Capability::packedStrings(kNkMAIDCapability_Aperture, {"A", "BB", "CCC"}, 2));
  const auto [packed, packedBytes] = device.getEnum(kNkMAIDCapability_Aperture);
  EXPECT_EQ(packed.elementType, uint32_t{kNkMAIDArrayType_PackedString});
  EXPECT_EQ(packed.elementCount, 9u);
  EXPECT_EQ(packed.elementSize, 1);
  EXPECT_EQ(packed.currentIndex, 2u);
  EXPECT_EQ(std::string(packedBytes.begin(), packedBytes.end()), std::string("A\0BB\0CCC\0", 9));

  const auto [list, listBytes] = device.getEnum(kNkMAIDCapability_WBMode);
  EXPECT_EQ(list.elementType, uint32_t{kNkMAIDArrayType_String});
  EXPECT_EQ(list.elementSize, kNkMAIDStringSize);
  EXPECT_STREQ(reinterpret_cast<const char*>(listBytes.data() + 256), "Incandescent");

  camera.set(Capability::unsigneds(kNkMAIDCapability_Sensitivity, {}));
  EXPECT_EQ(device.getEnum(kNkMAIDCapability_Sensitivity).first.elementCount, 0u);
}

TEST_F(CapabilityTest, AnArrayThatDoesNotFitAnyMoreIsNotFilled) {
  tagNkMAIDEnum header{};
  ASSERT_EQ(device.get(kNkMAIDCapability_Sensitivity, kNkMAIDDataType_EnumPtr, &header), 0);
  std::vector<uint32_t> room(header.elementCount, 42);
  header.elements = room.data();
  camera.set(Capability::unsigneds(kNkMAIDCapability_Sensitivity, std::vector<uint32_t>(20, 1)));
  EXPECT_EQ(device.send(kNkMAIDCommand_CapGetArray, kNkMAIDCapability_Sensitivity, kNkMAIDDataType_EnumPtr, &header),
            kNkMAIDResult_BufferSize);
  EXPECT_EQ(room, std::vector<uint32_t>(room.size(), 42));
}

TEST_F(CapabilityTest, SaveMediaIsSetByValueAndSettingsByScriptRaiseEvents) {
  EXPECT_EQ(device.getUnsigned(kNkMAIDCapability_SaveMedia), 0u);
  EXPECT_EQ(device.send(kNkMAIDCommand_CapSet, kNkMAIDCapability_SaveMedia, kNkMAIDDataType_Unsigned,
                        reinterpret_cast<void*>(1)),
            0);
  EXPECT_EQ(device.getUnsigned(kNkMAIDCapability_SaveMedia), 1u);
  EXPECT_EQ(std::get<uint32_t>(camera.get(kNkMAIDCapability_SaveMedia)->value), 1u);

  camera.set(Capability::integer(kNkMAIDCapability_BatteryLevel, 10));
  camera.set(Capability::unsignedInteger(kNkMAIDCapability_BatteryLevel, 10));
  module.poll();
  EXPECT_EQ(device.events, (Client::Events{{kNkMAIDEvent_CapChangeValueOnly, kNkMAIDCapability_BatteryLevel},
                                           {kNkMAIDEvent_CapChange, kNkMAIDCapability_BatteryLevel}}));
}

}  // namespace
}  // namespace virtualcamera::test
