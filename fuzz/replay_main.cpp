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
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t count);

namespace {

using Bytes = std::vector<uint8_t>;
namespace fs = std::filesystem;

constexpr std::size_t kLongestInput = 4096;
constexpr uint32_t kInteresting[] = {0,     1,      4,         5,          0x7f,       0xff,
                                     0x100, 0xffff, 0x4000000, 0x7fffffff, 0x80000000, 0xffffffff};

std::string running;

void tellWhatRan(int signal) {
  std::fprintf(stderr, "While running %s\n", running.c_str());
  std::signal(signal, SIG_DFL);
  std::raise(signal);
}

Bytes contents(const fs::path& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

std::vector<fs::path> filesAt(const fs::path& path) {
  if (!fs::is_directory(path)) return {path};
  std::vector<fs::path> files;
  for (const auto& entry : fs::directory_iterator(path)) files.push_back(entry.path());
  std::sort(files.begin(), files.end());
  return files;
}

void run(const Bytes& bytes, std::string name) {
  running = std::move(name);
  // A block of its own: what is read beyond the end is seen.
  const auto exact = std::make_unique<uint8_t[]>(bytes.size());
  std::copy(bytes.begin(), bytes.end(), exact.get());
  LLVMFuzzerTestOneInput(exact.get(), bytes.size());
}

class Mutator {
 public:
  Mutator(const std::vector<Bytes>& corpus, std::uint64_t seed) : _corpus(corpus), _random(seed) {}

  Bytes next() {
    Bytes bytes = any();
    for (std::size_t changes = 1 + below(8); changes > 0; --changes) change(bytes);
    if (bytes.size() > kLongestInput) bytes.resize(kLongestInput);
    return bytes;
  }

 private:
  std::size_t below(std::size_t end) { return static_cast<std::size_t>(_random() % end); }
  const Bytes& any() { return _corpus[below(_corpus.size())]; }

  void change(Bytes& bytes) {
    const auto at = static_cast<std::ptrdiff_t>(below(bytes.size() + 1));
    const auto rest = static_cast<std::size_t>(bytes.end() - (bytes.begin() + at));
    switch (below(6)) {
      case 0:
        if (rest > 0) bytes[static_cast<std::size_t>(at)] = static_cast<uint8_t>(_random());
        break;
      case 1:
        if (rest > 0) bytes[static_cast<std::size_t>(at)] ^= static_cast<uint8_t>(1U << below(8));
        break;
      case 2:
        bytes.insert(bytes.begin() + at, 1 + below(8), static_cast<uint8_t>(_random()));
        break;
      case 3:
        bytes.erase(bytes.begin() + at, bytes.begin() + at + static_cast<std::ptrdiff_t>(std::min(rest, below(16))));
        break;
      case 4:
        if (rest >= 4) std::memcpy(&*(bytes.begin() + at), &kInteresting[below(std::size(kInteresting))], 4);
        break;
      default: {
        const Bytes& other = any();
        const auto from = other.begin() + static_cast<std::ptrdiff_t>(below(other.size() + 1));
        bytes.insert(bytes.begin() + at, from, other.end());
      }
    }
  }

  const std::vector<Bytes>& _corpus;
  std::mt19937_64 _random;
};

}  // namespace

int main(int argc, char** argv) {
  std::signal(SIGABRT, tellWhatRan);
  std::signal(SIGSEGV, tellWhatRan);
  std::vector<Bytes> corpus;
  unsigned long runs = 0;
  unsigned long seed = 1;
  for (int index = 1; index < argc; ++index) {
    const std::string argument = argv[index];
    if ((argument == "--runs" || argument == "--seed") && index + 1 < argc) {
      (argument == "--runs" ? runs : seed) = std::strtoul(argv[++index], nullptr, 10);
      continue;
    }
    for (const auto& file : filesAt(argument)) {
      corpus.push_back(contents(file));
      run(corpus.back(), file.string());
    }
  }
  if (corpus.empty()) {
    std::fprintf(stderr, "usage: %s FILE_OR_FOLDER... [--runs N] [--seed S]\n", argv[0]);
    return 2;
  }
  Mutator mutator(corpus, seed);
  for (unsigned long number = 1; number <= runs; ++number) {
    run(mutator.next(), "run " + std::to_string(number) + " of seed " + std::to_string(seed));
  }
  std::printf("%zu files and %lu changed ones\n", corpus.size(), runs);
  return 0;
}
