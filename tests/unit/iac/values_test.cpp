#include <gtest/gtest.h>

#include <limits>
#include <memory>
#include <vector>

#include "KtLuaTableMarshalling.h"

namespace {

std::vector<std::int32_t> kindsOf(const KtLuaTETable& table) {
  std::vector<std::int32_t> kinds;
  for (const auto& [key, value] : table.getEntries()) kinds.push_back(key->getType());
  return kinds;
}

template <typename As>
std::vector<As> keysOf(const KtLuaTETable& table) {
  std::vector<As> keys;
  for (const auto& [key, value] : table.getEntries()) keys.push_back(static_cast<As>(*key));
  return keys;
}

// Reports its own end.
class Watched : public KtLuaTE {
 public:
  Watched(std::int32_t kind, int& alive) : KtLuaTE(kind), _alive(alive) { ++_alive; }
  ~Watched() override { --_alive; }
  KtLuaTE* copy() override { return new Watched(getType(), _alive); }

 private:
  int& _alive;
};

TEST(Values, KeysOfEveryKindStandInTheOrderOfTheirKinds) {
  KtLuaTETable table;
  table.Set(new KtLuaTETable, new KtLuaTENil);
  table.Set(new KtLuaTEData("x", 1), new KtLuaTENil);
  table.Set(new KtLuaTEString("x"), new KtLuaTENil);
  table.Set(new KtLuaTENumber(std::numeric_limits<double>::infinity()), new KtLuaTENil);
  table.Set(new KtLuaTENil, new KtLuaTENil);
  EXPECT_EQ(kindsOf(table), (std::vector<std::int32_t>{1, 2, 3, 4, 5}));
}

TEST(Values, NumbersOrderByValueAndStringsByteByByteAsUnsigned) {
  KtLuaTETable numbers;
  for (const double number : {2.0, 10.0, -1.0}) numbers.Set(new KtLuaTENumber(number), new KtLuaTENil);
  EXPECT_EQ(keysOf<double>(numbers), (std::vector<double>{-1, 2, 10}));

  KtLuaTETable strings;
  for (const char* text : {"10", "2", "a", "B", "ab", "\xc3\xa4", ""}) strings.Set(text, new KtLuaTENil);
  EXPECT_EQ(keysOf<std::string>(strings), (std::vector<std::string>{"", "10", "2", "B", "a", "ab", "\xc3\xa4"}));
}

TEST(Values, DataAndTablesAreKeysByIdentityAndNilIsOneKey) {
  KtLuaTETable table;
  for (int round = 0; round < 2; ++round) {
    table.Set(new KtLuaTEData("same", 4), new KtLuaTENil);
    table.Set(new KtLuaTEData(nullptr, 0), new KtLuaTENil);
    table.Set(new KtLuaTETable, new KtLuaTENil);
    table.Set(new KtLuaTENil, new KtLuaTENumber(round));
  }
  EXPECT_EQ(kindsOf(table), (std::vector<std::int32_t>{1, 4, 4, 4, 4, 5, 5}));
  KtLuaTENil nil;
  EXPECT_EQ(static_cast<double>(*table.elementForKey(&nil)), 1.0);
}

TEST(Values, SetReplacesKeyAndValueAndDestroysTheOldOnes) {
  int alive = 0;
  {
    KtLuaTETable table;
    auto* const first = new Watched(kKtLuaTypeString, alive);
    auto* const second = new Watched(kKtLuaTypeString, alive);
    table.Set(first, new Watched(kKtLuaTypeNil, alive));
    table.Set(second, new KtLuaTENumber(2));
    EXPECT_EQ(alive, 1);
    ASSERT_EQ(table.getEntries().size(), 1U);
    EXPECT_EQ(table.getEntries().begin()->first, second);
    EXPECT_EQ(static_cast<double>(*table.elementForKey(second)), 2.0);
  }
  EXPECT_EQ(alive, 0);
}

TEST(Values, LookUpsFindByEqualKeyAndReportAbsenceAsNull) {
  KtLuaTETable table;
  table.Set(new KtLuaTENumber(3.0), new KtLuaTEString("three"));
  table.Set("name", new KtLuaTEString(std::string("a\0b", 3)));
  EXPECT_EQ(static_cast<std::string>(*table.elementForKey(3)), "three");
  EXPECT_EQ(table.elementForKey("3"), nullptr);
  EXPECT_EQ(table.elementForKey(4), nullptr);
  EXPECT_EQ(static_cast<std::string>(*table.elementForKey(std::string("name"))).size(), 3U);
  EXPECT_EQ(table.getEntries().size(), 2U);
}

TEST(Values, ConversionsToTheOtherKindGiveNothing) {
  KtLuaTENumber number(12);
  KtLuaTEString string("12");
  KtLuaTENil nil;
  EXPECT_EQ(static_cast<std::string>(number), "");
  EXPECT_EQ(static_cast<double>(string), 0.0);
  EXPECT_EQ(static_cast<double>(nil), 0.0);
  EXPECT_EQ(static_cast<std::string>(nil), "");
}

TEST(Values, ACopySharesNothingWithItsSource) {
  auto source = std::make_unique<KtLuaTETable>();
  auto* inner = new KtLuaTETable;
  inner->Set(new KtLuaTEData("\1\2\3", 3), new KtLuaTENumber(7));
  source->Set("inner", inner);
  source->Set(new KtLuaTENil, new KtLuaTEString(std::string("a\0b", 3)));
  const std::unique_ptr<KtLuaTE> copy(source->copy());
  source.reset();

  auto& table = dynamic_cast<KtLuaTETable&>(*copy);
  EXPECT_EQ(static_cast<std::string>(*table.getEntries().begin()->second).size(), 3U);
  const auto& entries = dynamic_cast<KtLuaTETable&>(*table.elementForKey("inner")).getEntries();
  const auto& data = dynamic_cast<KtLuaTEData&>(*entries.begin()->first);
  EXPECT_EQ(std::string(static_cast<const char*>(data.getBytes()), 3), "\1\2\3");
  EXPECT_EQ(static_cast<double>(*entries.begin()->second), 7.0);
}

TEST(Values, ADictionaryOfNumbersTruthValuesAndTextsIsImported) {
  KtLuaTETable table;
  table.addDictionary(
      {{std::string("text"), std::string("value")}, {std::string("cut\0off", 7), true}, {5LL, 2.5}, {false, 9LL}});
  EXPECT_EQ(static_cast<std::string>(*table.elementForKey("text")), "value");
  EXPECT_EQ(static_cast<double>(*table.elementForKey("cut")), 1.0);
  EXPECT_EQ(static_cast<double>(*table.elementForKey(5)), 2.5);
  EXPECT_EQ(static_cast<double>(*table.elementForKey(0)), 9.0);
}

TEST(ValuesDeathTest, ADictionaryThatHoldsAnythingElseStopsTheProgram) {
  KtLuaTETable table;
  EXPECT_DEATH(table.addDictionary({{std::string("none"), platform::Value()}}),
               "Could not convert either key or value to an KtLuaTE element - key: none, value: <null>");
}

}  // namespace
