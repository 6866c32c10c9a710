#include <gtest/gtest.h>

#include <memory>
#include <random>

#include "Hex.h"
#include "KtLuaTableMarshalling.h"
#include "KtNSDataStreamBuf.h"

namespace {

std::shared_ptr<const platform::Data> dataOf(const std::string& bytes) {
  return std::make_shared<const platform::Data>(std::vector<char>(bytes.begin(), bytes.end()));
}

std::string encode(const KtLuaTE& element) {
  KtNSDataWriteStreamBuf buffer;
  std::ostream out(&buffer);
  element.writeToStream(out);
  const auto data = buffer.getNSData();
  return {data->bytes(), data->length()};
}

struct Decoded {
  std::unique_ptr<KtLuaTE> element;
  std::int64_t consumed;
};

Decoded decode(const std::string& bytes) {
  KtNSDataReadStreamBuf buffer(dataOf(bytes));
  std::istream in(&buffer);
  std::unique_ptr<KtLuaTE> element(KtLuaTE::createFromStream(in));
  return {std::move(element), in.tellg()};
}

Decoded decodeHex(const std::string& hex) { return decode(bytesFromHex(hex)); }

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

const std::string kWorkedExample = bytesFromHex(
    "05 00 00 00 02 00 00 00"
    " 03 00 00 00 0a 00 00 00 64 65 76 69 63 65 5f 69 64 00 02 00 00 00 00 00 00 00 00 00 08 40"
    " 03 00 00 00 05 00 00 00 6e 61 6d 65 00 03 00 00 00 04 00 00 00 63 61 6d 00");

TEST(Encoding, TheWorkedExampleReadsAndWritesTheSame63Bytes) {
  KtLuaTETable table;
  table.Set("name", new KtLuaTEString("cam"));
  table.Set("device_id", new KtLuaTENumber(3));
  EXPECT_EQ(encode(table), kWorkedExample);
  const auto decoded = decode(kWorkedExample);
  EXPECT_EQ(decoded.consumed, 63);
  EXPECT_EQ(encode(*decoded.element), kWorkedExample);
}

TEST(Encoding, EveryPrefixRunsOutAndNeverClaimsMoreThanIsMissing) {
  for (std::size_t length = 0; length < kWorkedExample.size(); ++length) {
    const std::int64_t missing = missingFrom(kWorkedExample.substr(0, length));
    EXPECT_GT(missing, 0) << length;
    EXPECT_LE(missing, static_cast<std::int64_t>(kWorkedExample.size() - length)) << length;
  }
  // Two entries, of which there is nothing: two keys and two values at least.
  EXPECT_EQ(missingFrom(bytesFromHex("05 00 00 00 02 00 00 00")), 16);
}

TEST(Encoding, StringsEndAtTheirFirstNulWhenWrittenAndWhenRead) {
  EXPECT_EQ(encode(KtLuaTEString("")), bytesFromHex("03 00 00 00 01 00 00 00 00"));
  EXPECT_EQ(encode(KtLuaTEString(std::string("a\0b", 3))), bytesFromHex("03 00 00 00 02 00 00 00 61 00"));

  const auto string = [](const std::string& hex, std::int64_t consumed) {
    const auto decoded = decodeHex(hex);
    EXPECT_EQ(decoded.consumed, consumed);
    return static_cast<std::string>(*decoded.element);
  };
  EXPECT_EQ(string("03 00 00 00 00 00 00 00", 8), "");
  EXPECT_EQ(string("03 00 00 00 ff ff ff ff", 8), "");
  EXPECT_EQ(string("03 00 00 00 04 00 00 00 61 00 62 63", 12), "a");
  EXPECT_EQ(string("03 00 00 00 02 00 00 00 61 62", 10), "ab");
}

TEST(Encoding, DataCarriesItsBytesUnchanged) {
  const std::string bytes = bytesFromHex("04 00 00 00 03 00 00 00 00 ff 00");
  EXPECT_EQ(encode(KtLuaTEData(bytes.data() + 8, 3)), bytes);
  EXPECT_EQ(encode(*decode(bytes).element), bytes);
  const std::string empty = bytesFromHex("04 00 00 00 00 00 00 00");
  EXPECT_EQ(encode(*decode(empty).element), empty);
}

TEST(Encoding, ARepeatedKeyKeepsItsFirstObjectAndTakesTheLaterValue) {
  // Keys "b", "a", "b": out of order, and one of them twice, with the values 1, 2 and 3.
  const std::string entry = "03 00 00 00 02 00 00 00 %1 00 02 00 00 00 00 00 00 00 00 00 %2 ";
  const auto with = [&](const char* letter, const char* value) {
    std::string filled = entry;
    filled.replace(filled.find("%1"), 2, letter);
    return filled.replace(filled.find("%2"), 2, value);
  };
  const auto decoded =
      decodeHex("05 00 00 00 03 00 00 00 " + with("62", "f0 3f") + with("61", "00 40") + with("62", "08 40"));
  const auto& table = dynamic_cast<const KtLuaTETable&>(*decoded.element);
  EXPECT_EQ(table.getEntries().size(), 2U);
  EXPECT_EQ(static_cast<double>(*table.elementForKey("a")), 2.0);
  EXPECT_EQ(static_cast<double>(*table.elementForKey("b")), 3.0);
}

TEST(Encoding, AnUnknownTagIsNullOnItsOwnAndMalformedInsideATable) {
  const auto decoded = decodeHex("07 00 00 00");
  EXPECT_EQ(decoded.element, nullptr);
  EXPECT_EQ(decoded.consumed, 4);
  EXPECT_THROW(decodeHex("05 00 00 00 01 00 00 00 07 00 00 00 01 00 00 00"), KtMalformedElement);
  EXPECT_THROW(decodeHex("05 00 00 00 01 00 00 00 01 00 00 00 00 00 00 00"), KtMalformedElement);
}

TEST(Encoding, WhatCanNeverBeAnElementIsToldApartFromWhatIsNotThereYet) {
  EXPECT_THROW(decodeHex("04 00 00 00 ff ff ff ff"), KtMalformedElement);
  EXPECT_THROW(decodeHex("04 00 00 00 01 00 00 04"), KtMalformedElement);  // a byte above the limit
  EXPECT_THROW(decodeHex("03 00 00 00 ff ff ff 7f"), KtMalformedElement);
  EXPECT_THROW(decodeHex("05 00 00 00 ff ff ff 7f"), KtMalformedElement);
  // A NaN as a key.
  EXPECT_THROW(decodeHex("05 00 00 00 01 00 00 00 02 00 00 00 00 00 00 00 00 00 f8 7f 01 00 00 00"),
               KtMalformedElement);
  EXPECT_EQ(missingFrom(bytesFromHex("04 00 00 00 00 00 00 04")), 64 << 20);
  EXPECT_EQ(dynamic_cast<KtLuaTETable&>(*decodeHex("05 00 00 00 fe ff ff ff").element).getEntries().size(), 0U);
}

TEST(Encoding, TablesNestTwoHundredDeepAndNoDeeper) {
  const auto nested = [](int depth) {
    std::string bytes;
    for (int level = 1; level < depth; ++level) bytes += bytesFromHex("05 00 00 00 01 00 00 00 01 00 00 00");
    return bytes + bytesFromHex("05 00 00 00 00 00 00 00");
  };
  EXPECT_EQ(encode(*decode(nested(200)).element), nested(200));
  EXPECT_THROW(decode(nested(201)), KtMalformedElement);
  EXPECT_EQ(encode(*decode(nested(200)).element), nested(200)) << "the refusal left its mark";
}

TEST(Encoding, NoSingleCorruptedByteDoesHarmAndWhatDecodesWritesWhatItRead) {
  for (std::size_t place = 0; place < kWorkedExample.size(); ++place) {
    for (int flip = 1; flip < 256; flip <<= 1) {
      std::string bytes = kWorkedExample;
      bytes[place] = static_cast<char>(bytes[place] ^ flip);
      try {
        const auto decoded = decode(bytes);
        if (!decoded.element) continue;
        const std::string once = encode(*decoded.element);
        EXPECT_EQ(encode(*decode(once).element), once);
      } catch (const platform::Exception&) {
      }
    }
  }
}

TEST(StreamBuffers, SeekingClampsAndCountsBackwardsFromTheEnd) {
  KtNSDataReadStreamBuf buffer(dataOf("0123456789"));
  std::istream in(&buffer);
  EXPECT_EQ(in.seekg(4).tellg(), 4);
  EXPECT_EQ(in.seekg(3, std::ios::cur).tellg(), 7);
  EXPECT_EQ(in.seekg(12).tellg(), 10);
  EXPECT_EQ(in.seekg(1).seekg(-3, std::ios::cur).tellg(), 0);
  EXPECT_EQ(in.seekg(2, std::ios::end).tellg(), 8);
  EXPECT_EQ(in.seekg(-2, std::ios::end).tellg(), 10);
}

TEST(StreamBuffers, AShortReadDeliversWhatIsThereAndEndsTheStream) {
  KtNSDataReadStreamBuf buffer(dataOf("0123456789"));
  std::istream in(&buffer);
  char got[8] = {};
  in.seekg(6).read(got, 8);
  EXPECT_EQ(in.gcount(), 4);
  EXPECT_EQ(std::string(got, 4), "6789");
  EXPECT_TRUE(in.eof() && in.fail());
  EXPECT_EQ(buffer.available(), 0);
}

}  // namespace
