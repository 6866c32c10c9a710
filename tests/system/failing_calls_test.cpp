// System calls that fail, each in turn. What they do to a picture's road, and to the start.

#include <cerrno>
#include <iterator>
#include <list>
#include <map>
#include <ostream>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "Helper.h"

namespace tether {
namespace {

namespace fs = std::filesystem;

struct Failure {
  const char* name;
  const char* kind;
  int error;
  bool losesAPicture = false;
  bool losesTheHost = false;
};

void PrintTo(const Failure& failure, std::ostream* out) { *out << failure.name; }

const Failure kOnTheRoad[] = {
    {"OpenNoSpace", "open", ENOSPC, true},   {"OpenInterrupted", "open", EINTR},
    {"WriteNoSpace", "write", ENOSPC, true}, {"WriteInterrupted", "write", EINTR},
    {"HalfWriteFailed", "half", EIO, true},  {"HalfWriteInterrupted", "half", EINTR},
    {"NoMemory", "memory", ENOMEM, true},    {"NoRoom", "room", ENOSPC, true},
    {"RoomInterrupted", "room", EINTR},      {"RoomUnknown", "room", EOPNOTSUPP},
    {"OutputInterrupted", "output", EINTR},  {"OutputFull", "output", EAGAIN},
    {"OutputHalf", "halfoutput", 0},         {"OutputFailed", "output", EIO, false, true},
};
const Failure kAtTheStart[] = {{"Thread", "thread", EAGAIN}, {"Pipe", "pipe", EMFILE}};

// Together at once, to be done soon.
constexpr int kAtOnce = 4;
// Its calls do not fail: it comes after the others.
constexpr const char* kLast = "9.tif";

struct Trial {
  Trial(const Failure& failed, int number, std::vector<std::string> names) : failure(failed), files(std::move(names)) {
    helper.install("Type0001Module", VIRTUAL_CAMERA_MODULE);
    helper.setEnvironment("LD_PRELOAD", FAILING_CALLS);
    helper.setEnvironment(
        "TETHER_FAIL", std::string(failure.kind) + " " + std::to_string(number) + " " + std::to_string(failure.error));
    files.emplace_back(kLast);
    std::filesystem::create_directories(helper.cameras() / "1-Studio");
    helper.start();
  }

  bool injected() const { return helper.standardError().find("injected") != std::string::npos; }

  // Before the camera is there they would be on its card. The host that is lost may not hear of it.
  void shoot() {
    if (!failure.losesTheHost) helper.await("deviceAdded");
    awaitCondition("camera", [this] { return !failure.losesTheHost || helper.unread() > 0 || injected(); });
    for (const std::string& file : files) {
      // Each needs a larger buffer than the one before, and room on the disk.
      const std::string bytes = file == kLast ? pattern(1000, 9) : pattern(1'100'000 + 100'000 * sent.size(), 1);
      drop(helper.cameras() / "1-Studio" / file, bytes);
      sent.insert(bytes);
    }
  }

  void awaitTheLast() {
    if (!failure.losesTheHost) {
      while (!helper.await("fileDownloadComplete").text("file_path").ends_with(".tif")) continue;
      return;
    }
    awaitCondition("last file", [this] {
      for (const auto& file : fs::directory_iterator(helper.temporary())) {
        if (file.path().extension() == ".tif" && file.file_size() > 0) return true;
      }
      return false;
    });
  }

  void expectWhatWasToldAgreesWithTheFiles() {
    std::map<double, std::string> announced;
    std::set<std::string> names;
    for (const Message& message : helper.messages()) {
      if (message.name == "objectWasAdded") {
        announced[message.number("capture_id")] = message.text("file_name");
        names.insert(message.text("file_name"));
      } else if (message.name == "fileDownloadComplete") {
        const fs::path path = message.text("file_path");
        EXPECT_EQ(announced[message.number("capture_id")], path.filename());
        EXPECT_EQ(sent.erase(readFile(path)), 1U) << path;
      }
    }
    if (failure.losesTheHost) return;
    EXPECT_EQ(sent.size(), failure.losesAPicture && injected() ? 1U : 0U) << "not complete";
    for (const auto& file : fs::directory_iterator(helper.temporary())) {
      EXPECT_TRUE(names.contains(file.path().filename())) << file.path();
    }
  }

  const Failure& failure;
  std::vector<std::string> files;
  std::set<std::string> sent{};
  Helper helper{};
};

class FailingCall : public testing::TestWithParam<Failure> {};

// Whether one of the calls did not fail, because there are no more of its kind.
bool allAreThrough(std::list<Trial>& runs) {
  bool through = false;
  for (Trial& run : runs) run.shoot();
  for (Trial& run : runs) {
    run.awaitTheLast();
    run.helper.closeInput();
    EXPECT_EQ(run.helper.wait(), 0);
    run.expectWhatWasToldAgreesWithTheFiles();
    through |= !run.injected();
    if (testing::Test::HasFailure()) ADD_FAILURE() << run.helper.standardError();
  }
  return through;
}

TEST_P(FailingCall, LosesThatPictureAtMostAndTellsTheHostWhatIsThere) {
  for (const std::vector<std::string>& road :
       {std::vector<std::string>{"1.jpg"}, {"1.jpg", "1.nef"}, {"1.jpg", "2.jpg", "3.nef"}}) {
    int calls = 0;
    for (bool through = false; !through && !HasFailure();) {
      std::list<Trial> runs;
      for (int i = 0; i < kAtOnce; ++i) runs.emplace_back(GetParam(), ++calls, road);
      through = allAreThrough(runs);
    }
    EXPECT_GT(calls, static_cast<int>(road.size()));
  }
}

INSTANTIATE_TEST_SUITE_P(OnTheRoad, FailingCall, testing::ValuesIn(kOnTheRoad),
                         [](const auto& made) { return made.param.name; });

class FailingStart : public testing::TestWithParam<Failure> {};

TEST_P(FailingStart, EndsWithALineThatSaysSoAndAStatus) {
  for (int number = 1;; ++number) {
    Trial run(GetParam(), number, std::vector<std::string>());
    bool started = true;
    try {
      run.shoot();
      run.awaitTheLast();
    } catch (const std::runtime_error&) {
      started = false;
    }
    run.helper.closeInput();
    EXPECT_EQ(run.helper.wait(), started ? 0 : 1) << number << run.helper.standardError();
    if (started && !run.injected()) {
      EXPECT_GT(number, 2);
      break;
    }
    const std::string log = run.helper.standardError();
    EXPECT_NE(log.find(run.failure.kind, log.find("could not start")), std::string::npos) << number;
    ASSERT_FALSE(HasFailure()) << run.helper.standardError();
  }
}

INSTANTIATE_TEST_SUITE_P(Of, FailingStart, testing::ValuesIn(kAtTheStart),
                         [](const auto& made) { return made.param.name; });

}  // namespace
}  // namespace tether
