// The numbers of the binary interface as literals: helper and virtual camera share the header, so that a wrong one
// would pass everything else.
#include "NameTables.h"

#include <gtest/gtest.h>

#include <set>

#include "MAID.h"
#include "Recorder.h"

namespace {

TEST(Interface, HasTheNumbersThatModulesWereBuiltWith) {
  // clang-format off
  const std::pair<std::int64_t, std::int64_t> numbers[] = {
      {kNkMAIDCapType_Process, 0}, {kNkMAIDCapType_Boolean, 1}, {kNkMAIDCapType_Integer, 2},
      {kNkMAIDCapType_Unsigned, 3}, {kNkMAIDCapType_String, 8}, {kNkMAIDCapType_Enum, 12}, {kNkMAIDDataType_Null, 0},
      {kNkMAIDDataType_Unsigned, 3}, {kNkMAIDDataType_BooleanPtr, 4}, {kNkMAIDDataType_IntegerPtr, 5},
      {kNkMAIDDataType_UnsignedPtr, 6}, {kNkMAIDDataType_StringPtr, 11}, {kNkMAIDDataType_CallbackPtr, 13},
      {kNkMAIDDataType_EnumPtr, 16}, {kNkMAIDDataType_ObjectPtr, 17}, {kNkMAIDDataType_CapInfoPtr, 18},
      {kNkMAIDArrayType_Integer, 1}, {kNkMAIDArrayType_Unsigned, 2}, {kNkMAIDArrayType_PackedString, 7},
      {kNkMAIDArrayType_String, 8}, {kNkMAIDDataObjType_Image, 1}, {kNkMAIDDataObjType_File, 16},
      {kNkMAIDFileDataType_JPEG, 1}, {kNkMAIDFileDataType_TIFF, 2}, {kNkMAIDFileDataType_NEF, 4},
      {kNkMAIDFileDataType_NDF, 257}, {kNkMAIDStringSize, 256}, {kNkMAIDCapability_EventProc, 3},
      {kNkMAIDCapability_DataProc, 4}, {kNkMAIDCapability_IsAlive, 6}, {kNkMAIDCapability_Children, 7},
      {kNkMAIDCapability_Name, 9}, {kNkMAIDCapability_DataTypes, 12}, {kNkMAIDCapability_StoredBytes, 14},
      {kNkMAIDCapability_Capture, 17}, {kNkMAIDCapability_Acquire, 20}, {kNkMAIDCapability_BatteryLevel, 49},
      {kNkMAIDCapability_FreeBytes, 50}, {kNkMAIDCapability_ExposureMode, 0x8111},
      {kNkMAIDCapability_ShutterSpeed, 0x8112}, {kNkMAIDCapability_Aperture, 0x8113},
      {kNkMAIDCapability_Sensitivity, 0x8117}, {kNkMAIDCapability_WBMode, 0x8118},
      {kNkMAIDCapability_RawJpegImageStatus, 0x81b5}, {kNkMAIDCapability_SaveMedia, 0x8305}, {kNkMAIDCommand_Async, 0},
      {kNkMAIDCommand_Open, 1}, {kNkMAIDCommand_Close, 2}, {kNkMAIDCommand_GetCapCount, 3},
      {kNkMAIDCommand_GetCapInfo, 4}, {kNkMAIDCommand_CapStart, 5}, {kNkMAIDCommand_CapSet, 6},
      {kNkMAIDCommand_CapGet, 7}, {kNkMAIDCommand_CapGetArray, 9}, {kNkMAIDCommand_EnumChildren, 13},
      {kNkMAIDEvent_AddChild, 0}, {kNkMAIDEvent_RemoveChild, 1}, {kNkMAIDEvent_CapChange, 4},
      {kNkMAIDEvent_CapChangeValueOnly, 6}, {kNkMAIDEvent_CaptureComplete, 264}, {kNkMAIDResult_NotSupported, -127},
      {kNkMAIDResult_BufferSize, -124}, {kNkMAIDResult_ZombieObject, -119}, {kNkMAIDResult_NoError, 0},
      {kNkMAIDResult_Pending, 1}, {kNkMAIDResult_OrphanedChildren, 2}, {kNkMAIDResult_DataTransFailure, 141},
      {kNkMAIDResult_DeviceBusy, 152}};
  // clang-format on
  for (const auto& [number, value] : numbers) EXPECT_EQ(number, value);
}

TEST(NameTables, HoldAllNamesFromTheFirstToTheLastAndNoValueTwice) {
  const struct {
    const EnumMapEntry* table;
    std::size_t rows;
    std::int32_t first;
    const char* firstName;
    std::int32_t last;
    const char* lastName;
  } tables[] = {
      {CommandDebugList, 16, 0, "kNkMAIDCommand_Async", 15, "kNkMAIDCommand_ResetToDefault"},
      {EventDebugList, 9, 0, "kNkMAIDEvent_AddChild", 0x108, "kNkMAIDEvent_CaptureComplete"},
      {ErrorDebugList, 47, -127, "kNkMAIDResult_NotSupported", 161, "kNkMAIDResult_UnformattedMedia"},
      {CapabilityDebugList, 365, 1, "kNkMAIDCapability_AsyncRate", 0x8306, "kNkMAIDCapability_MovieRecHiISO"}};
  for (const auto& [table, rows, first, firstName, last, lastName] : tables) {
    std::set<std::int32_t> values;
    std::size_t count = 0;
    for (; table[count].name != nullptr; ++count) values.insert(table[count].value);
    EXPECT_EQ(count, rows);
    EXPECT_EQ(values.size(), rows) << "a value stands twice";
    EXPECT_EQ(table[0].value, first);
    EXPECT_STREQ(table[0].name, firstName);
    EXPECT_EQ(table[rows - 1].value, last);
    EXPECT_STREQ(table[rows - 1].name, lastName);
  }
}

TEST(NameTables, NameAnUnknownValueByItsNumberAndZeroWithoutARowByNothing) {
  const char* const first = errorToName(99);
  EXPECT_EQ(first, capabilityToName(0x810d)) << "all unknown values share one buffer";
  EXPECT_STREQ(first, "<unknown value: 33037>");
  EXPECT_EQ(capabilityToName(0), nullptr);
  Recorder recorder;
  debugDumpError(99);
  EXPECT_EQ(recorder.traced("Error detected: (99) <unknown value: 99>"), 1U);
}

}  // namespace
