// Runs a fuzz target without a fuzzer: the file named, or those in a folder named, and then so many changed ones of
// them, the same for the same seed.
#include <algorithm>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "Files.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t count);

namespace {

using Bytes = std::vector<uint8_t>;
namespace fs = std::filesystem;

constexpr std::size_t kLongestInput = 4096;
constexpr uint32_t kInteresting[] = {0, 1, 4, 5, 0xff, 0xffff, 0x4000000, 0x7fffffff, 0x80000000, 0xffffffff};

std::string running;

void tellWhatRan(int signal) {
  std::fprintf(stderr, "While running %s\n", running.c_str());
  std::signal(signal, SIG_DFL);
  std::raise(signal);
}

void run(const Bytes& bytes, std::string name) {
  running = std::move(name);
  // A block of its own: what is read beyond the end is seen.
  const auto exact = std::make_unique<uint8_t[]>(bytes.size());
  std::copy(bytes.begin(), bytes.end(), exact.get());
  LLVMFuzzerTestOneInput(exact.get(), bytes.size());
}

// A change anywhere: bytes put in, taken out, replaced by a number that matters or by the end of another input.
void change(Bytes& bytes, const Bytes& other, std::mt19937_64& random) {
  const auto below = [&](std::size_t end) { return static_cast<std::ptrdiff_t>(random() % end); };
  const auto at = bytes.begin() + below(bytes.size() + 1);
  const auto rest = bytes.end() - at;
  switch (below(5)) {
    case 0:
      if (rest > 0) *at = static_cast<uint8_t>(random());
      break;
    case 1:
      if (rest >= 4) std::memcpy(&*at, &kInteresting[below(std::size(kInteresting))], 4);
      break;
    case 2:
      bytes.insert(at, static_cast<std::size_t>(1 + below(8)), static_cast<uint8_t>(random()));
      break;
    case 3:
      bytes.erase(at, at + std::min(rest, below(16)));
      break;
    default:
      bytes.insert(at, other.begin() + below(other.size() + 1), other.end());
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 4) {
    std::fprintf(stderr, "usage: %s FILE_OR_FOLDER RUNS SEED\n", argv[0]);
    return 2;
  }
  std::signal(SIGABRT, tellWhatRan);
  std::signal(SIGSEGV, tellWhatRan);
  std::set<fs::path> files{argv[1]};
  if (fs::is_directory(argv[1])) files = {fs::directory_iterator(argv[1]), fs::directory_iterator()};
  std::vector<Bytes> corpus;
  for (const fs::path& path : files) {
    corpus.push_back(testkit::readFile<Bytes>(path));
    run(corpus.back(), path.string());
  }
  std::mt19937_64 random(std::strtoul(argv[3], nullptr, 10));
  const unsigned long runs = std::strtoul(argv[2], nullptr, 10);
  for (unsigned long number = 1; number <= runs; ++number) {
    Bytes bytes = corpus[random() % corpus.size()];
    for (auto changes = 1 + random() % 8; changes > 0; --changes) {
      change(bytes, corpus[random() % corpus.size()], random);
    }
    bytes.resize(std::min(bytes.size(), kLongestInput));
    run(bytes, "run " + std::to_string(number));
  }
  std::printf("%zu files and %lu changed ones\n", corpus.size(), runs);
  return 0;
}
