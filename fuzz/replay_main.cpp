// Runs a fuzz target without a fuzzer: every file named, or in a folder named, and then `--runs N` changed ones of
// them, the same for the same `--seed S`.
#include <algorithm>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <random>
#include <set>
#include <string>
#include <vector>

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
  std::signal(SIGABRT, tellWhatRan);
  std::signal(SIGSEGV, tellWhatRan);
  std::set<fs::path> files;
  unsigned long runs = 0;
  unsigned long seed = 1;
  for (int index = 1; index < argc; ++index) {
    const std::string argument = argv[index];
    if ((argument == "--runs" || argument == "--seed") && index + 1 < argc) {
      (argument == "--runs" ? runs : seed) = std::strtoul(argv[++index], nullptr, 10);
    } else if (fs::is_directory(argument)) {
      files.insert(fs::directory_iterator(argument), fs::directory_iterator());
    } else {
      files.insert(argument);
    }
  }
  std::vector<Bytes> corpus;
  for (const fs::path& path : files) {
    std::ifstream file(path, std::ios::binary);
    corpus.emplace_back(std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>());
    run(corpus.back(), path.string());
  }
  if (corpus.empty()) {
    std::fprintf(stderr, "usage: %s FILE_OR_FOLDER... [--runs N] [--seed S]\n", argv[0]);
    return 2;
  }
  std::mt19937_64 random(seed);
  for (unsigned long number = 1; number <= runs; ++number) {
    Bytes bytes = corpus[random() % corpus.size()];
    for (auto changes = 1 + random() % 8; changes > 0; --changes) {
      change(bytes, corpus[random() % corpus.size()], random);
    }
    bytes.resize(std::min(bytes.size(), kLongestInput));
    run(bytes, "run " + std::to_string(number) + " of seed " + std::to_string(seed));
  }
  std::printf("%zu files and %lu changed ones\n", corpus.size(), runs);
  return 0;
}
