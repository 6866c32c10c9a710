// Each call of a road going wrong in turn, in each way that fits it: one process a run, which must neither crash nor
// hang nor leak, and must have told the host what is true.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>

#include "Files.h"
#include "NameTables.h"
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

int failures() { return testing::UnitTest::GetInstance()->current_test_info()->result()->total_part_count(); }

[[noreturn]] void runAndExit(const std::string& folder, Course course, std::optional<Place> place, Way way, int out) {
  alarm(kLimit);
  const int before = failures();
  setenv("TMPDIR", folder.c_str(), 1);
  {
    Road road(folder, course, place, way);
    road.run();
    for (const Place& at : road.places()) {
      if (write(out, &at, sizeof at) != sizeof at) abort();
    }
  }
#if defined(__SANITIZE_ADDRESS__)
  if (__lsan_do_recoverable_leak_check() != 0) _exit(2);
#endif
  std::fflush(nullptr);
  _exit(failures() == before ? 0 : 1);
}

// True when the run passed. Its places, if asked for.
bool passes(Course course, std::optional<Place> place, Way way, std::vector<Place>* places = nullptr) {
  const testkit::Folder folder;
  int ends[2];
  if (pipe(ends) != 0) return false;
  std::fflush(nullptr);
  const pid_t child = fork();
  if (child == 0) runAndExit(folder.path(), course, place, way, ends[1]);
  close(ends[1]);
  Place at{};
  while (read(ends[0], &at, sizeof at) == sizeof at) {
    if (places == nullptr) continue;
    places->push_back(at);
    if (at.target.level != virtualcamera::Level::Data || at.command != kNkMAIDCommand_CapStart) continue;
    for (std::uint32_t nth = 1; nth <= kDeliveries; ++nth) places->push_back({at.target, kDelivery, 0, nth});
  }
  close(ends[0]);
  int status = 0;
  waitpid(child, &status, 0);
  return status == 0;
}

// What there is no sense in: a system that calls back, nonsense out of a call that gives nothing.
bool fits(const Place& place, int way) {
  const std::uint32_t command = place.command;
  const bool hasThree = command == kOpen || command == kFwrite || command == kReserve;
  if (place.isOfSystem()) return way <= (hasThree ? kBufferSize : kRefused);
  if (command == kDelivery || way < kNonsense || way >= kNonsense + 4) return true;
  return command == kNkMAIDCommand_CapGet || command == kNkMAIDCommand_CapGetArray ||
         command == kNkMAIDCommand_GetCapCount || command == kNkMAIDCommand_GetCapInfo;
}

std::string textOf(const Place& place) {
  const auto command = static_cast<std::int32_t>(place.command);
  std::string text = place.command < kDelivery ? commandToName(command) : std::to_string(command);
  for (const std::uint32_t number : {place.parameter, place.nth, static_cast<std::uint32_t>(place.target.level),
                                     place.target.camera, place.target.item})
    text += " " + std::to_string(number);
  return text;
}

struct Group {
  const char* name;
  int first, last;  // of the ways
};
void PrintTo(const Group& group, std::ostream* out) { *out << group.name; }
constexpr Group kGroups[] = {{"Refused", kRefused, kNothingDone},
                             {"Nonsense", kNonsense, kStormBefore - 1},
                             {"Storms", kStormBefore, kStormElsewhere}};

class Roads : public testing::TestWithParam<std::tuple<Course, Group>> {};

TEST_P(Roads, HoldWhateverGoesWrongOnce) {
  const auto& [course, ways] = GetParam();
  std::vector<Place> places;
  ASSERT_TRUE(passes(course, std::nullopt, kRefused, &places)) << "without a fault";
  std::size_t number = 0;
  for (const Place& place : places) {
    for (int way = ways.first; way <= ways.last; ++way) {
      if (!fits(place, way) || ++number % kStride != 0) continue;
      EXPECT_TRUE(passes(course, place, static_cast<Way>(way))) << "way " << way << " of " << textOf(place);
    }
  }
  std::printf("%zu places, %zu runs\n", places.size(), number / kStride);
  EXPECT_GT(number, 100U);
}

std::string nameOf(const testing::TestParamInfo<std::tuple<Course, Group>>& test) {
  const char* const courses[] = {"Shooting", "Unplugging", "Shutdown"};
  return std::string(courses[static_cast<int>(std::get<0>(test.param))]) + std::get<1>(test.param).name;
}

INSTANTIATE_TEST_SUITE_P(Faults, Roads,
                         testing::Combine(testing::Values(Course::kShooting, Course::kUnplugging, Course::kShutdown),
                                          testing::ValuesIn(kGroups)),
                         nameOf);

}  // namespace
