// Elements to bytes and back, beside another binary encoding of the same values, and beside plain copies.
#include <cstdlib>
#include <cstring>
#include <memory>
#include <optional>
#include <vector>

#include "KtLuaTableMarshalling.h"
#include "KtNSDataStreamBuf.h"
#include "Measure.h"
#include "Suites.h"
#include "Tables.h"

namespace {

using Json = nlohmann::json;
using Bytes = std::shared_ptr<const platform::Data>;

constexpr std::int32_t kBlock = 16 << 20;

Bytes encoded(const KtLuaTE& element) {
  KtNSDataWriteStreamBuf buffer;
  std::ostream out(&buffer);
  element.writeToStream(out);
  return buffer.getNSData();
}

// Into memory that is kept, as the one who sends keeps it and its stream. The peers' is kept too.
Body encoding(const KtLuaTE& element) {
  return [&element](benchmark::State& state) {
    KtNSDataWriteStreamBuf buffer;
    std::ostream out(&buffer);
    for ([[maybe_unused]] auto _ : state) {
      buffer.bytes().clear();
      element.writeToStream(out);
      benchmark::DoNotOptimize(buffer.bytes().bytes());
    }
  };
}

Body decoding(const Bytes& bytes) {
  return [bytes](benchmark::State& state) {
    std::istream in(nullptr);  // kept, as the frame reader keeps its own
    for ([[maybe_unused]] auto _ : state) {
      KtNSDataReadStreamBuf buffer(bytes);
      in.rdbuf(&buffer);
      const std::unique_ptr<KtLuaTE> element(KtLuaTE::createFromStream(in));
      benchmark::DoNotOptimize(element.get());
    }
  };
}

void compareTable(Report& report, const std::string& name, const Tables& tables, double decodeGoal, double encodeGoal,
                  std::optional<double> packedGoal) {
  const auto cbor = Json::to_cbor(tables.theirs);
  compare(report, "decode " + name + " / nlohmann-json, CBOR", decodeGoal, Count::processor,
          decoding(encoded(tables.ours)), [&](benchmark::State& state) {
            for ([[maybe_unused]] auto _ : state) benchmark::DoNotOptimize(Json::from_cbor(cbor));
          });
  const auto object = packable(tables);
  const Body asCbor = [&](benchmark::State& state) {
    std::vector<std::uint8_t> bytes;
    for ([[maybe_unused]] auto _ : state) {
      bytes.clear();
      Json::to_cbor(tables.theirs, bytes);
      benchmark::DoNotOptimize(bytes.data());
    }
  };
  const Body asMessagePack = [&](benchmark::State& state) {
    msgpack::sbuffer buffer;
    for ([[maybe_unused]] auto _ : state) {
      buffer.clear();
      msgpack::pack(buffer, object.get());
      benchmark::DoNotOptimize(buffer.data());
    }
  };
  const auto encode = medians(Count::processor, {encoding(tables.ours), asCbor, asMessagePack});
  report.add({"encode " + name + " / nlohmann-json, CBOR", encode[0], encode[1], Unit::seconds, encodeGoal});
  report.add({"encode " + name + " / msgpack-cxx", encode[0], encode[2], Unit::seconds, packedGoal});
}

}  // namespace

void measureCodec(Report& report) {
  compareTable(report, "the 7 settings", *settings(), 0.5, 1.0, 1.0);
  compareTable(report, "10,000 keys", *manyKeys(10'000), 0.6, 0.55, {});

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
  const Body encodingAnew = [&element](benchmark::State& state) {
    for ([[maybe_unused]] auto _ : state) benchmark::DoNotOptimize(encoded(element)->bytes());
  };
  compare(report, "encode 16 MiB of data / malloc and memcpy", 1.1, Count::processor, encodingAnew, copying);
}
