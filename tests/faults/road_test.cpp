// Each call of a road going wrong in turn, in each way that fits it: one process a run, which must neither crash nor
// hang nor leak, and must have told the host what is true.

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>

#include "Road.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/lsan_interface.h>
#endif

namespace {

// The sanitizers make a run slow: they get every so many-th of them.
#if defined(__SANITIZE_THREAD__)
constexpr std::size_t kStride = 61;
#elif defined(__SANITIZE_ADDRESS__)
constexpr std::size_t kStride = 13;
#else
constexpr std::size_t kStride = 1;
#endif
constexpr unsigned kLimit = 60;  // seconds

struct Group {
  const char* name;
  Course course;
  int first;
  int last;  // of the ways
};

void PrintTo(const Group& group, std::ostream* out) { *out << group.name; }

// What there is no sense in: a system that calls back, nonsense out of a call that gives nothing.
bool fits(const Place& place, int way) {
  const bool nonsense = way >= kNonsense && way < kStormBefore;
  if (place.command >= kOpen) return way == kRefused || way == kCondition;
  if (place.command == kDelivery || !nonsense) return true;
  const bool answersOnly = place.command != kNkMAIDCommand_CapGet && place.command != kNkMAIDCommand_CapGetArray &&
                           place.command != kNkMAIDCommand_GetCapCount && place.command != kNkMAIDCommand_GetCapInfo;
  return !answersOnly || way >= kNonsense + 4;
}

class Roads : public testing::TestWithParam<Group> {
 protected:
  // True when the run passed. The places of the run, if asked for.
  bool run(std::optional<Place> place, Way way, std::vector<Place>* places = nullptr) {
    std::string folder = testing::TempDir() + "tether-road-XXXXXX";
    int ends[2];
    if (mkdtemp(folder.data()) == nullptr || pipe(ends) != 0) return false;
    std::fflush(nullptr);
    const pid_t child = fork();
    if (child == 0) runAndExit(folder, place, way, ends[1]);
    close(ends[1]);
    Place read{};
    _reached = false;
    while (::read(ends[0], &read, sizeof read) == sizeof read) {
      if (places != nullptr) places->push_back(read);
      _reached = _reached || place == read;
    }
    close(ends[0]);
    int status = 0;
    waitpid(child, &status, 0);
    std::filesystem::remove_all(folder);
    return status == 0;
  }

  [[noreturn]] void runAndExit(const std::string& folder, std::optional<Place> place, Way way, int out) {
    alarm(kLimit);
    const int before = failures();
    setenv("TMPDIR", folder.c_str(), 1);
    {
      Road road(folder, GetParam().course, place, way);
      road.run();
      for (const Place& at : road.module.places()) {
        if (write(out, &at, sizeof at) != sizeof at) abort();
      }
    }
#if defined(__SANITIZE_ADDRESS__)
    if (__lsan_do_recoverable_leak_check() != 0) _exit(2);
#endif
    std::fflush(nullptr);
    _exit(failures() == before ? 0 : 1);
  }

  static int failures() { return testing::UnitTest::GetInstance()->current_test_info()->result()->total_part_count(); }

  bool _reached = false;
};

TEST_P(Roads, HoldWhateverGoesWrongOnce) {
  std::vector<Place> places;
  ASSERT_TRUE(run(std::nullopt, kRefused, &places)) << "without a fault";
  std::size_t number = 0;
  std::size_t runs = 0;
  std::size_t missed = 0;
  for (const Place& place : places) {
    for (int way = GetParam().first; way <= GetParam().last; ++way) {
      if (!fits(place, way) || ++number % kStride != 0) continue;
      ++runs;
      EXPECT_TRUE(run(place, static_cast<Way>(way))) << "way " << way << " of " << place.text();
      missed += _reached ? 0 : 1;
    }
  }
  std::printf("%zu places, %zu runs, %zu without the fault\n", places.size(), runs, missed);
}

INSTANTIATE_TEST_SUITE_P(Faults, Roads,
                         testing::Values(Group{"ShootingRefused", Course::kShooting, kRefused, kBufferSize},
                                         Group{"ShootingDoneOrNot", Course::kShooting, kDoneButRefused, kNothingDone},
                                         Group{"ShootingNonsense", Course::kShooting, kNonsense, kStormBefore - 1},
                                         Group{"ShootingStorms", Course::kShooting, kStormBefore, kStormElsewhere},
                                         Group{"UnpluggingRefused", Course::kUnplugging, kRefused, kNothingDone},
                                         Group{"UnpluggingNonsense", Course::kUnplugging, kNonsense, kStormBefore - 1},
                                         Group{"UnpluggingStorms", Course::kUnplugging, kStormBefore, kStormElsewhere},
                                         Group{"ShutdownRefused", Course::kShutdown, kRefused, kNothingDone},
                                         Group{"ShutdownNonsense", Course::kShutdown, kNonsense, kStormBefore - 1},
                                         Group{"ShutdownStorms", Course::kShutdown, kStormBefore, kStormElsewhere}),
                         [](const auto& test) { return test.param.name; });

}  // namespace
