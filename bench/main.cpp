// Measures what the program is to be fast at, and prints one table: tether_bench [--json FILE] [--only GROUP].
#include <benchmark/benchmark.h>

#include <malloc.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>

#include "Log.h"
#include "Suites.h"

namespace {

struct Suite {
  const char* name;
  void (*run)(Report&);
};

// Whole processes first, while this one is small and has no other thread.
constexpr std::array kSuites{Suite{"process", measureProcesses},  Suite{"pictures", measurePictures},
                             Suite{"reader", measureFrameReader}, Suite{"codec", measureCodec},
                             Suite{"sdk", measureSdkSide},        Suite{"task", measureTask}};

}  // namespace

int main(int argc, char** argv) {
  std::string file;
  std::string only;
  for (int index = 1; index + 1 < argc; index += 2) {
    if (std::strcmp(argv[index], "--json") == 0) file = argv[index + 1];
    if (std::strcmp(argv[index], "--only") == 0) only = argv[index + 1];
  }
  if (argc % 2 == 0 || (argc > 1 && file.empty() && only.empty())) {
    std::fputs("usage: tether_bench [--json FILE] [--only process|pictures|reader|codec|sdk|task]\n", stderr);
    return 2;
  }
  std::string turns = "--benchmark_enable_random_interleaving=true";
  std::array<char*, 2> options{argv[0], turns.data()};
  int optionCount = options.size();
  benchmark::Initialize(&optionCount, options.data());

  setenv("TETHER_VIRTUAL_CAMERAS", "", 1);  // one camera that makes its own pictures

  // Large blocks always come fresh from the system, as for a process that needs one now and then.
  mallopt(M_MMAP_THRESHOLD, 4 << 20);
  platform::setLogSink([](const std::string&) {});
  Report report;
  for (const Suite& suite : kSuites) {
    malloc_trim(0);  // of what the suite before has left
    if (only.empty() || only == suite.name) suite.run(report);
  }
  std::fputs(report.table().c_str(), stdout);
  if (file.empty()) return 0;
  std::ofstream out(file);
  out << report.json();
  out.close();
  if (out.fail()) std::fprintf(stderr, "%s could not be written\n", file.c_str());
  return out.fail() ? 1 : 0;
}
