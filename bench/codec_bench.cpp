// Elements to bytes and back, beside another binary encoding of the same values, and beside plain copies.
#include <cstdlib>
#include <cstring>
#include <memory>
#include <nlohmann/json.hpp>

#include "KtLuaTableMarshalling.h"
#include "KtNSDataStreamBuf.h"
#include "Measure.h"
#include "Suites.h"

namespace {

using Json = nlohmann::json;
using Bytes = std::shared_ptr<const platform::Data>;

constexpr std::int32_t kBlock = 16 << 20;

// The same values twice.
struct Tables {
  KtLuaTETable ours;
  Json theirs = Json::object();

  void set(const std::string& key, double number) {
    ours.Set(key.c_str(), new KtLuaTENumber(number));
    theirs[key] = number;
  }
  void set(const std::string& key, const std::string& text) {
    ours.Set(key.c_str(), new KtLuaTEString(text));
    theirs[key] = text;
  }
};

std::unique_ptr<Tables> settings() {
  auto tables = std::make_unique<Tables>();
  tables->set("isoSpeed", "ISO 400");
  tables->set("batteryLevel", 85);
  tables->set("availableShots", 1234);
  tables->set("aeMode", "Manual");
  tables->set("aperture", "f/5.6");
  tables->set("shutter", "1/125");
  tables->set("whiteBalance", "Auto");
  return tables;
}

// Every tenth value is a table of five; the others are numbers and strings in turn.
std::unique_ptr<Tables> manyKeys() {
  auto tables = std::make_unique<Tables>();
  for (int index = 0; index < 10'000; ++index) {
    const std::string key = "key number " + std::to_string(index);
    if (index % 10 == 0) {
      Tables inner;
      for (int number = 0; number < 5; ++number) inner.set("inner " + std::to_string(number), number + 0.1);
      tables->ours.Set(key.c_str(), inner.ours.copy());
      tables->theirs[key] = inner.theirs;
    } else if (index % 2 == 0) {
      tables->set(key, index + 0.1);
    } else {
      tables->set(key, "value number " + std::to_string(index));
    }
  }
  return tables;
}

Bytes encoded(const KtLuaTE& element) {
  KtNSDataWriteStreamBuf buffer;
  std::ostream out(&buffer);
  element.writeToStream(out);
  return buffer.getNSData();
}

Body encoding(const KtLuaTE& element) {
  return [&element](benchmark::State& state) {
    for ([[maybe_unused]] auto _ : state) benchmark::DoNotOptimize(encoded(element)->bytes());
  };
}

Body decoding(const Bytes& bytes) {
  return [bytes](benchmark::State& state) {
    for ([[maybe_unused]] auto _ : state) {
      KtNSDataReadStreamBuf buffer(bytes);
      std::istream in(&buffer);
      const std::unique_ptr<KtLuaTE> element(KtLuaTE::createFromStream(in));
      benchmark::DoNotOptimize(element.get());
    }
  };
}

void compareTable(Report& report, const std::string& name, const Tables& tables, double decodeGoal, double encodeGoal) {
  const auto cbor = Json::to_cbor(tables.theirs);
  compare(report, "decode " + name + " / nlohmann-json, CBOR", decodeGoal, Count::processor,
          decoding(encoded(tables.ours)), [&](benchmark::State& state) {
            for ([[maybe_unused]] auto _ : state) benchmark::DoNotOptimize(Json::from_cbor(cbor));
          });
  compare(report, "encode " + name + " / nlohmann-json, CBOR", encodeGoal, Count::processor, encoding(tables.ours),
          [&](benchmark::State& state) {
            for ([[maybe_unused]] auto _ : state) benchmark::DoNotOptimize(Json::to_cbor(tables.theirs).data());
          });
}

}  // namespace

void measureCodec(Report& report) {
  compareTable(report, "the 7 settings", *settings(), 0.5, 1.0);
  compareTable(report, "10,000 keys", *manyKeys(), 0.6, 0.55);

  const std::vector<char> block(kBlock, 'x');
  const KtLuaTEData element(block.data(), kBlock);
  const Body copying = [&block](benchmark::State& state) {
    for ([[maybe_unused]] auto _ : state) {
      const std::unique_ptr<void, void (*)(void*)> copy(std::malloc(block.size()), std::free);
      std::memcpy(copy.get(), block.data(), block.size());
      benchmark::DoNotOptimize(copy.get());
      benchmark::ClobberMemory();
    }
  };
  compare(report, "decode 16 MiB of data / malloc and memcpy", 1.1, Count::processor, decoding(encoded(element)),
          copying);
  compare(report, "encode 16 MiB of data / malloc and memcpy", 1.1, Count::processor, encoding(element), copying);
}
