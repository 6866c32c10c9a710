// What is killed, or has nobody to write to, costs no picture.
#include <gmock/gmock.h>
#include <sys/wait.h>

#include "Fake.h"
#include "FileMover.h"

namespace {

using fake::Folder;
using fake::Helper;
using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;

// The process ends before or behind the nth call. Renaming fails with an error, but within the folder for EXDEV.
class Killed : public tether::FileCalls {
  template <typename Call>
  auto call(const Call& make) {
    --_left;
    if (_left == 0 && !_behind) _exit(1);
    const auto result = make();
    if (_left == 0) _exit(1);
    return result;
  }

 public:
  Killed(int error, int nth, bool behind) : _error(error), _left(nth), _behind(behind) {}
  int renameExclusively(const std::string& from, const std::string& to) override {
    const bool fails = _error != 0 && (_error != EXDEV || from.find("/.") == std::string::npos);
    return call([&] { return fails ? _error : FileCalls::renameExclusively(from, to); });
  }
  int link(const std::string& from, const std::string& to) override {
    return call([&] { return FileCalls::link(from, to); });
  }
  ssize_t write(int descriptor, const void* bytes, std::size_t count) override {
    return call([&] { return FileCalls::write(descriptor, bytes, std::min<std::size_t>(count, 7000)); });
  }
  int flush(int /*descriptor*/) override {
    return call([] { return 0; });
  }
  int remove(const std::string& path) override {
    return call([&] { return FileCalls::remove(path); });
  }

 private:
  const int _error;
  int _left;
  const bool _behind;
};

TEST(InterruptionTest, KilledAtAnyCallTheMoverHasThePictureWholeHereOrThereAndNeverCut) {
  const std::string content = std::string(20'000, 'x') + "end";
  for (const auto& [error, calls] : {std::pair(0, 1), std::pair(EXDEV, 8), std::pair(EINVAL, 3)}) {
    for (int kill = 2; kill <= 2 * calls + 2; ++kill) {
      const Folder from;
      const Folder to;
      to.write("a.jpg", "old");
      from.write("a.jpg", content);
      const pid_t child = fork();
      if (child == 0) {
        Killed calling(error, kill / 2, kill % 2 == 1);
        _exit(tether::FileMover(to.path(), &calling).move(from / "a.jpg", "a.jpg").path == to / "a-2.jpg" ? 0 : 2);
      }
      int status = 0;
      waitpid(child, &status, 0);
      SCOPED_TRACE("error " + std::to_string(error) + ", kill " + std::to_string(kill));
      EXPECT_NE(WEXITSTATUS(status), 2);
      const std::string here = from.read("a.jpg");
      const std::string there = to.read("a-2.jpg");
      EXPECT_TRUE(here == content || (here.empty() && there == content));
      EXPECT_TRUE(there == content || !std::filesystem::exists(to / "a-2.jpg"));
      EXPECT_EQ(to.read("a.jpg"), "old");
    }
  }
}

class TetherInterruptionTest : public testing::Test {
 protected:
  // `tether` in a shell, which sends its output where the end of the line says.
  int run(const Helper& helper, const std::string& words, const std::string& redirection) {
    std::string line = "TMPDIR='" + folder.path() + "' ";
    for (const std::string& entry : helper.environment()) line += entry + " ";
    line += TETHER_COMMAND " " + words + " 2>'" + (folder / "errors") + "' " + redirection;
    return WEXITSTATUS(std::system(line.c_str()));
  }
  std::string errors() const { return folder.read("errors"); }

  const std::string options = " --helper " FAKE_HELPER " ";
  Folder folder;
  Folder out;
};

TEST_F(TetherInterruptionTest, AStandardOutputThatTakesNothingIsSaidAndIs1AndWhatWasShotIsSaved) {
  const Helper helper(fake::camera(R"([[{"picture": "a.jpg"}]])"));
  for (const std::string redirection : {">/dev/full", ">&-"}) {
    EXPECT_EQ(run(helper, "list" + options, redirection), 1);
    EXPECT_THAT(errors(), HasSubstr("tether: cannot write to standard output: "));
    EXPECT_EQ(run(helper, "capture --count 2 --output " + out.path() + options, redirection), 1);
    EXPECT_THAT(errors(), AllOf(HasSubstr("cannot write to"), HasSubstr("\ntether: 1 of 2 pictures are missing\n")));
    EXPECT_EQ(run(helper, "--help", redirection), 1);
    EXPECT_THAT(errors(), HasSubstr("cannot write to"));
  }
  EXPECT_THAT(out.names(), ElementsAre("a-2.jpg", "a.jpg"));
  EXPECT_EQ(run(helper, "list --helper-log -" + options, "2>&- >/dev/null"), 0);
}

TEST_F(TetherInterruptionTest, APictureThatWasThereBeforeIsSavedAndDoesNotCountAndListNamesIt) {
  const Helper helper(R"({"start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}},
    {"picture": "early.jpg"}], "on": {"connectDevice": [[{"reply": "ok"}]], "getCameraSettings": [[{"reply": "error"}]],
    "doCapture": [[{"picture": "a.jpg", "id": 2}]]}})");
  EXPECT_EQ(run(helper, "capture --output " + out.path() + options, ">/dev/null"), 0) << errors();
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "early.jpg"));
  EXPECT_EQ(run(helper, "list" + options, ">/dev/null"), 0);
  EXPECT_EQ(errors(), "tether: left where it is: " + helper.directory(1) + "/early.jpg\n");
}

TEST_F(TetherInterruptionTest, CaptureStartsAHelperAgainThatDiesWhileItConnects) {
  const Helper helper(R"([{"start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}}],
    "on": {"getCameraSettings": [[{"reply": "error"}]], "connectDevice": [[{"exit": 9}]]}}, )" +
                      fake::camera(R"([[{"picture": "a.jpg"}]])") + "]");
  EXPECT_EQ(run(helper, "capture --output " + out.path() + options, ">/dev/null"), 0) << errors();
  EXPECT_THAT(errors(), HasSubstr("exit status 9); starting it again"));
  EXPECT_THAT(out.names(), ElementsAre("a.jpg"));
  EXPECT_EQ(run(helper, "capture --output " + std::string(300, 'x') + options, ">/dev/null"), 6);
}

}  // namespace
