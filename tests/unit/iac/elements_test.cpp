// Elements: tables and their keys, and their bytes. What any bytes do to the decoder, the fuzz target `wire` tells.
#include <gtest/gtest.h>

#include <limits>
#include <memory>

#include "FrameWriter.h"

namespace {

using namespace std::string_literals;

struct Decoded {
  std::unique_ptr<KtLuaTE> element;
  std::int64_t consumed;
};

Decoded decode(const std::string& bytes) {
  KtNSDataReadStreamBuf buffer(std::make_shared<const platform::Data>(std::vector<char>(bytes.begin(), bytes.end())));
  std::istream in(&buffer);
  std::unique_ptr<KtLuaTE> element(KtLuaTE::createFromStream(in));
  return {std::move(element), in.tellg()};
}

std::int64_t missingFrom(const std::string& bytes) {
  try {
    decode(bytes);
  } catch (const KtStreamError& error) {
    EXPECT_EQ(error.name(), "Stream Error");
    EXPECT_EQ(error.reason(), "Stream Error");
    return error.missing();
  }
  return 0;
}

std::string keysOf(const KtLuaTETable& table) {
  std::string keys;
  for (const auto& [key, value] : table.getEntries()) {
    const std::int32_t kind = key->getType();
    keys += " " + std::to_string(kind);
    if (kind == kKtLuaTypeNumber) keys += ":" + std::to_string(static_cast<int>(static_cast<double>(*key)));
    if (kind == kKtLuaTypeString) keys += ":" + static_cast<std::string>(*key);
  }
  return keys;
}

TEST(Elements, KeysStandInOrderOfTheirKindsThenOfValueUnsignedBytesOrIdentity) {
  KtLuaTETable table;
  for (int round = 0; round < 2; ++round) {
    table.Set(new KtLuaTETable, new KtLuaTENil);
    table.Set(new KtLuaTEData("same", 4), new KtLuaTENil);
    table.Set(new KtLuaTEData(nullptr, 0), new KtLuaTENil);
    for (const char* text : {"10", "2", "a", "B", "ab", "\xc3\xa4", ""}) table.Set(text, new KtLuaTENil);
    for (const double number : {2.0, 10.0, -1.0}) table.Set(new KtLuaTENumber(number), new KtLuaTENil);
    table.Set(new KtLuaTENil, new KtLuaTENumber(round));
  }
  EXPECT_EQ(keysOf(table), " 1 2:-1 2:2 2:10 3: 3:10 3:2 3:B 3:a 3:ab 3:\xc3\xa4 4 4 4 4 5 5");
  KtLuaTENil nil;
  EXPECT_EQ(static_cast<double>(*table.elementForKey(&nil)), 1.0);
  EXPECT_EQ(table.elementForKey("3"), nullptr);
  EXPECT_NE(table.elementForKey(2), nullptr);
  EXPECT_EQ(table.elementForKey(3), nullptr);
  EXPECT_EQ(static_cast<std::string>(*table.elementForKey(&nil)), "") << "a number is no text";
}

TEST(Encoding, TheWorkedExampleReadsAndWritesTheSame63Bytes) {
  const std::string example =
      "\5\0\0\0\2\0\0\0"
      "\3\0\0\0\x0a\0\0\0device_id\0\2\0\0\0\0\0\0\0\0\0\x08\x40"
      "\3\0\0\0\5\0\0\0name\0\3\0\0\0\4\0\0\0cam\0"s;
  KtLuaTETable table;
  table.Set("name", new KtLuaTEString("cam"));
  table.Set("device_id", new KtLuaTENumber(3));
  EXPECT_EQ(encodeElement(table), example);
  const auto decoded = decode(example);
  EXPECT_EQ(decoded.consumed, 63);
  EXPECT_EQ(encodeElement(*decoded.element), example);
}

TEST(Encoding, StringsEndAtTheirFirstNulAndDataDoesNot) {
  EXPECT_EQ(encodeElement(KtLuaTEString("")), "\3\0\0\0\1\0\0\0\0"s);
  EXPECT_EQ(encodeElement(KtLuaTEString("a\0b"s)), "\3\0\0\0\2\0\0\0a\0"s);
  const struct {
    std::string bytes;
    std::int64_t consumed;
    std::string text;
  } table[] = {{"\3\0\0\0\0\0\0\0"s, 8, ""},
               {"\3\0\0\0\xff\xff\xff\xff"s, 8, ""},
               {"\3\0\0\0\4\0\0\0a\0bc"s, 12, "a"},
               {"\3\0\0\0\2\0\0\0ab"s, 10, "ab"}};
  for (const auto& row : table) {
    const auto decoded = decode(row.bytes);
    EXPECT_EQ(decoded.consumed, row.consumed);
    EXPECT_EQ(static_cast<std::string>(*decoded.element), row.text);
  }
  const std::string data = "\4\0\0\0\3\0\0\0\0\xff\0"s;
  EXPECT_EQ(encodeElement(KtLuaTEData(data.data() + 8, 3)), data);
  EXPECT_THROW(KtLuaTEData(data.data(), -1), int);
  EXPECT_EQ(encodeElement(*decode(data).element), data);
}

TEST(Encoding, ARepeatedKeyTakesTheLaterValue) {
  // Keys "b", "a", "b": out of order, and one of them twice, with the values 1, 2 and 3.
  const auto entry = [](const char* letter, const std::string& value) {
    return "\3\0\0\0\2\0\0\0"s + letter + "\0\2\0\0\0\0\0\0\0\0\0"s + value;
  };
  const auto decoded =
      decode("\5\0\0\0\3\0\0\0"s + entry("b", "\xf0\x3f") + entry("a", "\0\x40"s) + entry("b", "\x08\x40"));
  const auto& table = dynamic_cast<const KtLuaTETable&>(*decoded.element);
  EXPECT_EQ(keysOf(table), " 3:a 3:b");
  EXPECT_EQ(static_cast<double>(*table.elementForKey("a")), 2.0);
  EXPECT_EQ(static_cast<double>(*table.elementForKey("b")), 3.0);
}

TEST(Encoding, WhatCanNeverBeAnElementIsToldApartFromWhatIsNotThereYet) {
  const std::string table = "\5\0\0\0\1\0\0\0"s;
  for (const std::string& bytes :
       {"\4\0\0\0\xff\xff\xff\xff"s, "\4\0\0\0\1\0\0\4"s /* a byte above the limit */, "\3\0\0\0\xff\xff\xff\x7f"s,
        "\5\0\0\0\xff\xff\xff\x7f"s, table + "\7\0\0\0\1\0\0\0"s, table + "\1\0\0\0\0\0\0\0"s,
        table + "\2\0\0\0\0\0\0\0\0\0\xf8\x7f\1\0\0\0"s /* a NaN as a key */}) {
    EXPECT_THROW(decode(bytes), KtMalformedElement);
  }
  EXPECT_EQ(missingFrom("\4\0\0\0\0\0\0\4"s), 64 << 20);
  EXPECT_EQ(missingFrom("\5\0\0\0\2\0\0\0"s), 16) << "two keys and two values at the least";
  EXPECT_EQ(dynamic_cast<KtLuaTETable&>(*decode("\5\0\0\0\xfe\xff\xff\xff"s).element).getEntries().size(), 0U);
  const auto unknown = decode("\7\0\0\0"s);
  EXPECT_EQ(unknown.element, nullptr);
  EXPECT_EQ(unknown.consumed, 4);
}

TEST(Encoding, TablesNestTwoHundredDeepAndNoDeeper) {
  const auto nested = [](int depth) {
    std::string bytes;
    for (int level = 1; level < depth; ++level) bytes += "\5\0\0\0\1\0\0\0\1\0\0\0"s;
    return bytes + "\5\0\0\0\0\0\0\0"s;
  };
  EXPECT_EQ(encodeElement(*decode(nested(200)).element), nested(200));
  EXPECT_THROW(decode(nested(201)), KtMalformedElement);
  EXPECT_EQ(encodeElement(*decode(nested(200)).element), nested(200)) << "the refusal left its mark";
}

TEST(StreamBuffers, SeekingClampsCountsBackwardsFromTheEndAndAShortReadEndsTheStream) {
  const std::string digits = "0123456789";
  KtNSDataReadStreamBuf buffer(std::make_shared<const platform::Data>(std::vector<char>(digits.begin(), digits.end())));
  std::istream in(&buffer);
  EXPECT_EQ(in.seekg(4).tellg(), 4);
  EXPECT_EQ(in.seekg(3, std::ios::cur).tellg(), 7);
  EXPECT_EQ(in.seekg(12).tellg(), 10);
  EXPECT_EQ(in.seekg(1).seekg(-3, std::ios::cur).tellg(), 0);
  EXPECT_EQ(in.seekg(2, std::ios::end).tellg(), 8);
  EXPECT_EQ(in.seekg(-2, std::ios::end).tellg(), 10);
  char got[8] = {};
  in.seekg(6).read(got, 8);
  EXPECT_EQ(std::string(got, static_cast<std::size_t>(in.gcount())), "6789");
  EXPECT_TRUE(in.eof() && in.fail());
  EXPECT_EQ(buffer.available(), 0);
}

}  // namespace
