#include "NameTables.h"

#include <gtest/gtest.h>

#include <set>
#include <string>

#include "MAID.h"
#include "Recorder.h"

namespace {

std::size_t rowsOf(const EnumMapEntry* table) {
  std::set<std::int32_t> values;
  std::size_t rows = 0;
  for (; table->name != nullptr; ++table, ++rows) values.insert(table->value);
  EXPECT_EQ(values.size(), rows) << "a value stands twice";
  return rows;
}

TEST(NameTables, HoldAllNamesAndNoValueTwice) {
  EXPECT_EQ(rowsOf(CommandDebugList), 16U);
  EXPECT_EQ(rowsOf(EventDebugList), 9U);
  EXPECT_EQ(rowsOf(ErrorDebugList), 47U);
  EXPECT_EQ(rowsOf(CapabilityDebugList), 365U);
  EXPECT_STREQ(errorToName(161), "kNkMAIDResult_UnformattedMedia");
  EXPECT_STREQ(eventToName(263), "kNkMAIDEvent_AddPreviewImage");
  EXPECT_STREQ(commandToName(15), "kNkMAIDCommand_ResetToDefault");
  EXPECT_STREQ(capabilityToName(1), "kNkMAIDCapability_AsyncRate");
  EXPECT_STREQ(capabilityToName(0x8306), "kNkMAIDCapability_MovieRecHiISO");
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
