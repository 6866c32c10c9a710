// `tether` as a process, on a scripted helper: what it does, how it fails, and what it leaves.
#include <fcntl.h>
#include <sys/wait.h>

#include <nlohmann/json.hpp>
#include <optional>

#include "Fake.h"

namespace {

using fake::camera;
using fake::Folder;
using fake::Helper;
using fake::kAdded;
using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using Json = nlohmann::json;
using Texts = std::vector<std::string>;

const std::string kAnnounced = R"({"send": "objectWasAdded", "payload":
  {"capture_id": 1, "has_sidecar": 0, "file_name": "Capture0001.jpg", "file_size": 2000}})";

// What it does when it is connected.
std::string connected(const std::string& connect) {
  return R"({"heartbeat": 20, "start": [)" + kAdded + R"(], "on": {"connectDevice": )" + connect + "}}";
}

class TetherTest : public testing::Test {
 protected:
  ~TetherTest() override {
    if (process > 0) kill(process, SIGKILL);
    if (process > 0) waitpid(process, nullptr, 0);
  }

  // With `closedOutput`, standard output is a pipe that nobody reads. Pictures go to `out` where nothing else is said.
  void start(const std::string& script, Texts arguments, bool closedOutput = false) {
    helper = std::make_unique<Helper>(script);
    arguments.insert(arguments.begin(), TETHER_COMMAND);
    const auto names = [&](const char* option) {
      return std::find(arguments.begin(), arguments.end(), option) != arguments.end();
    };
    if (arguments.size() > 1 && !names("--helper")) arguments.insert(arguments.begin() + 2, {"--helper", FAKE_HELPER});
    const bool saves = names("capture") || names("watch");
    if (saves && !names("--output") && !names("--help")) arguments.insert(arguments.end(), {"--output", out.path()});
    std::filesystem::remove(files / "out");
    std::filesystem::remove(files / "err");
    process = fork();
    if (process == 0) runChild(arguments, closedOutput);
  }
  // The exit status, or minus the signal. Whatever happened, no helper is left, and no directory of one that is empty.
  int wait() {
    int status = 0;
    EXPECT_EQ(waitpid(process, &status, 0), process);
    process = 0;
    for (std::size_t nth = 0; nth < helper->notes("start ").size(); ++nth) {
      const pid_t started = helper->process(nth);
      EXPECT_TRUE(fake::eventually([&] { return fake::isGone(started); }));
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
  }
  int run(const std::string& script, const Texts& arguments, bool closedOutput = false) {
    start(script, arguments, closedOutput);
    return wait();
  }

  std::string output() const { return files.read("out"); }
  std::string errors() const { return files.read("err"); }
  std::vector<Json> objects() const {
    std::vector<Json> all;
    std::istringstream lines(output());
    for (std::string line; std::getline(lines, line);) all.push_back(Json::parse(line));
    return all;
  }
  bool awaitText(const char* file, const std::string& text) const {
    return fake::eventually([&] { return files.read(file).find(text) != std::string::npos; });
  }

  Folder out;
  Folder files;      // what it said
  Folder temporary;  // holds the helpers' private directories
  std::unique_ptr<Helper> helper;
  pid_t process = 0;

 private:
  [[noreturn]] void runChild(Texts& arguments, bool closedOutput) const {
    int ends[2] = {-1, -1};
    const int flags = O_WRONLY | O_CREAT | O_APPEND;
    if (closedOutput && pipe(ends) == 0) close(ends[0]);
    dup2(open("/dev/null", O_RDONLY), 0);
    dup2(closedOutput ? ends[1] : open((files / "out").c_str(), flags, 0600), 1);
    dup2(open((files / "err").c_str(), flags, 0600), 2);
    for (std::string variable : helper->environment()) putenv(strdup(variable.c_str()));
    setenv("TMPDIR", temporary.path().c_str(), 1);
    std::vector<char*> pointers;
    for (std::string& argument : arguments) pointers.push_back(argument.data());
    pointers.push_back(nullptr);
    execv(TETHER_COMMAND, pointers.data());
    _exit(127);
  }
};

TEST_F(TetherTest, ListShowsEveryCamera) {
  const std::string script = R"({"heartbeat": 20, "start": [
    {"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam\u001b[2J One"}},
    {"send": "deviceAdded", "payload": {"device_id": 513, "name": "Other"}}]})";
  EXPECT_EQ(run(script, {"list"}), 0) << errors();
  EXPECT_EQ(output(), "257  Cam?[2J One\n513  Other\n");
  EXPECT_EQ(run(script, {"list", "--json"}), 0);
  EXPECT_THAT(objects(), ElementsAre(Json({{"device_id", 257}, {"name", "Cam\u001b[2J One"}}),
                                     Json({{"device_id", 513}, {"name", "Other"}})));
  EXPECT_THAT(temporary.names(), IsEmpty());
}

TEST_F(TetherTest, SettingsShowsAllSevenAndWhatTheCameraDoesNotTell) {
  const std::string script = R"({"start": [)" + kAdded +
                             R"(, {"send": "deviceAdded", "payload": {"device_id": 513, "name": "Other"}}],
    "heartbeat": 20, "on": {"connectDevice": [[{"reply": "ok"}]], "getCameraSettings": [[{"reply": "ok", "payload":
      {"isoSpeed": 400, "batteryLevel": 87.5, "shutter": "1/60", "aperture": null}}]]}})";
  EXPECT_EQ(run(script, {"settings", "--camera", "Other"}), 0) << errors();
  EXPECT_THAT(output(), AllOf(HasSubstr("isoSpeed        400\n"), HasSubstr("batteryLevel    87.5\n"),
                              HasSubstr("aperture        -\n"), HasSubstr("shutter         1/60\n")));
  EXPECT_THAT(helper->notes("request connectDevice"), ElementsAre(" 513"));
  EXPECT_EQ(run(script, {"settings", "--json", "--camera", "257"}), 0);
  EXPECT_EQ(objects().at(0), Json::parse(R"({"device_id": 257, "camera": "Cam", "isoSpeed": 400, "batteryLevel": 87.5,
    "availableShots": null, "aeMode": null, "aperture": null, "shutter": "1/60", "whiteBalance": null})"));
}

TEST_F(TetherTest, CaptureSavesEveryPictureAndNeverOverAnotherAndAPairKeepsOneBase) {
  out.write("Capture0001.jpg", "mine");
  const std::string script = camera(R"([[{"picture": "Capture0001.nef", "id": 1, "pair": 1, "size": 1234567},
                                         {"picture": "Capture0001.jpg", "id": 2, "pair": 1}],
                                        [{"picture": "Capture0002.jpg", "id": 3, "at": "Capture0002-1.jpg"}]])");
  EXPECT_EQ(run(script, {"capture", "--json", "--count", "2"}), 0) << errors();
  EXPECT_THAT(out.names(), ElementsAre("Capture0001-2.jpg", "Capture0001-2.nef", "Capture0001.jpg", "Capture0002.jpg"));
  EXPECT_EQ(out.read("Capture0001.jpg"), "mine");
  ASSERT_EQ(objects().size(), 3U);
  const Json first = objects()[0];
  EXPECT_EQ(first["path"], out / "Capture0001-2.nef");
  EXPECT_EQ(first["size"], 1234567);
  EXPECT_EQ(first["camera"], "Cam");
  EXPECT_EQ(first["event"], "saved");
  EXPECT_EQ(helper->notes("request doCapture").size(), 2U);
  EXPECT_THAT(temporary.names(), IsEmpty());
  EXPECT_EQ(run(script, {"capture", "--output", out / "new/folder"}), 0) << errors();
  EXPECT_THAT(output(), AllOf(HasSubstr("Capture0001.nef  1.2 MB"), HasSubstr("Capture0001.jpg  1.0 kB")));
  EXPECT_TRUE(std::filesystem::exists(out / "new/folder/Capture0001.nef"));
}

TEST_F(TetherTest, EveryReleasesTheShutterWithoutWaitingForTheLastPicture) {
  EXPECT_EQ(run(camera(R"([[], [{"picture": "a.jpg", "id": 1}, {"picture": "b.jpg", "id": 2}]])"),
                {"capture", "--count", "2", "--every", "0.1"}),
            0);
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "b.jpg"));
}

TEST_F(TetherTest, WatchConnectsEveryCameraThatComesAndAgainWhenItComesBack) {
  const std::string script = connected(
      R"([[{"reply": "ok"}, {"picture": "a.jpg", "id": 1}, {"send": "deviceRemoved", "payload": {"device_id": 257}},
           {"send": "deviceAdded", "payload": {"device_id": 258, "name": "Cam"}}],
          [{"reply": "ok"}, {"picture": "b.nef", "id": 2, "pair": 1}, {"picture": "b.jpg", "id": 3, "pair": 1}]])");
  EXPECT_EQ(run(script, {"watch", "--json", "--camera", "257", "--count", "2"}), 0) << errors();
  Texts events;
  for (const Json& object : objects()) events.push_back(object["event"]);
  EXPECT_THAT(events, ElementsAre("camera_added", "connected", "saved", "camera_removed", "camera_added", "connected",
                                  "saved", "saved"));
  EXPECT_THAT(helper->notes("request connectDevice "), ElementsAre("257", "258"));
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "b.jpg", "b.nef"));
}

TEST_F(TetherTest, MessagesShowsWhatTheHelperSendsAndSendsWhatItIsAskedTo) {
  const std::string script = R"({"heartbeat": 0, "on": {"connectDevice": [[
    {"reply": "error", "payload": {"error_code": -1}}, {"send": "odd", "payload": {"n": 0.5, "t": {"u": null}}}]]}})";
  Texts arguments{"messages", "--count", "2", "--send", "connectDevice", "--device", "257"};
  EXPECT_EQ(run(script, arguments), 0) << errors();
  EXPECT_EQ(output(), "error #1 {\"error_code\":-1}\nodd {\"n\":0.5,\"t\":{\"u\":null}}\n");
  EXPECT_THAT(helper->notes("request connectDevice "), ElementsAre("257"));
  arguments.emplace_back("--json");
  EXPECT_EQ(run(script, arguments), 0);
  EXPECT_EQ(objects().at(0), Json({{"name", "error"}, {"id", 1}, {"payload", {{"error_code", -1}}}}));
  EXPECT_EQ(run("{}", {"messages", "--send", "shutdown"}), 0) << errors();  // ends with the helper
}

TEST_F(TetherTest, WrongUsageIs2AndHelpIs0) {
  for (const Texts& wrong : std::vector<Texts>{{},
                                               {"shoot"},
                                               {"list", "--nonsense"},
                                               {"capture", "--count", "0"},
                                               {"capture", "--timeout", "nan"},
                                               {"watch", "--timeout", "0"},
                                               {"messages", "--device", "5"},
                                               {"list", "--helper-log", "/no/such/folder/x"}}) {
    EXPECT_EQ(run("{}", wrong), 2);
    EXPECT_FALSE(errors().empty());
    EXPECT_EQ(output(), "");
  }
  for (const char* const name : {"list", "settings", "capture", "watch", "messages"}) {
    EXPECT_EQ(run("{}", {name, "--help"}), 0);
    EXPECT_THAT(output(), AllOf(HasSubstr("Examples:"), HasSubstr("130  interrupted")));
    EXPECT_THAT(helper->notes("start"), IsEmpty());
  }
}

TEST_F(TetherTest, EveryFailureHasItsStatusAndItsWords) {
  const std::string none = R"({"heartbeat": 20})";
  const std::string mute = R"({"heartbeat": 0})";
  const std::string half = camera("[[" + kAnnounced + R"(, {"file": "Capture0001.jpg", "size": 5}]])");
  const std::string dying = R"({"start": [{"exit": 9}]})";
  const std::string refusing = connected(R"([[{"reply": "error", "payload": {"error_code": -1}}]])");
  const std::string leaving = camera(R"([[{"send": "deviceRemoved", "payload": {"device_id": 257}}]])");
  const std::string misplaced = camera(R"([[{"picture": "a.jpg", "at": "missing/a.jpg"}]])");
  const struct {
    std::string script;
    Texts arguments;
    int status;
    std::string words;
  } table[] = {
      {none, {"list"}, 3, "tether: there is no camera\n"},
      {camera("[[]]"), {"capture", "--camera", "258"}, 3, "no camera 258; there is 257 (Cam)"},
      {refusing, {"settings"}, 3, "connecting Cam failed"},
      {leaving, {"capture"}, 3, "tether: Cam has gone; 1 of 1 picture is missing\n"},
      {mute, {"list", "--timeout", "0.2"}, 4, ""},
      {mute, {"messages", "--count", "1", "--timeout", "0.2"}, 4, ""},
      {camera(R"([[{"picture": "a.jpg"}], []])"),
       {"capture", "--count", "2", "--timeout", "1"},
       4,
       "tether: nothing came from Cam for 1.0 s; 1 of 2 pictures are missing\n"},
      {half, {"capture", "--timeout", "1"}, 4, "Capture0001.jpg was not received"},
      {dying, {"list", "--helper", "/no/such/helper"}, 5, "/no/such/helper"},
      {dying, {"list"}, 5, "exit status 9"},
      {dying, {"messages"}, 5, ""},
      {dying, {"settings"}, 5, ""},
      {misplaced, {"capture", "--count", "2"}, 6, "could not save a.jpg"},
      {misplaced, {"capture", "--output", out.write("file", "")}, 6, "cannot make the folder"},
  };
  for (const auto& row : table) {
    EXPECT_EQ(run(row.script, row.arguments), row.status) << row.words;
    const bool all = row.words.ends_with('\n');  // a line is all that is said
    EXPECT_TRUE(all ? errors() == row.words : errors().find(row.words) != std::string::npos) << errors();
    EXPECT_LE(helper->notes("request doCapture").size(), row.status == 4 ? 2U : 1U) << row.words;
  }
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "file"));
}

TEST_F(TetherTest, WatchStartsALostHelperAgainButNotForEver) {
  EXPECT_EQ(run(R"({"start": [{"exit": 9}]})", {"watch"}), 5);
  EXPECT_EQ(helper->notes("start ").size(), 4U);
  EXPECT_THAT(errors(), HasSubstr("too often within a minute; giving up"));
}

TEST_F(TetherTest, CaptureGoesOnAfterAHelperThatDiedDuringATransfer) {
  const std::string dies = camera(R"([[{"picture": "a.jpg", "id": 7}], [)" + kAnnounced +
                                  R"(, {"file": "Capture0001.jpg", "size": 5}, {"kill": 9}]])");
  EXPECT_EQ(run("[" + dies + ", " + camera(R"([[{"picture": "b.jpg", "id": 1}]])") + "]", {"capture", "--count", "3"}),
            5);
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "b.jpg"));
  EXPECT_EQ(helper->notes("request doCapture").size(), 3U);  // what was lost is not taken again
  EXPECT_THAT(errors(), AllOf(HasSubstr("killed by signal 9"), HasSubstr("Capture0001.jpg was not received"),
                              HasSubstr("left where it is: " + helper->directory() + "/Capture0001.jpg"),
                              HasSubstr("1 of 3 pictures are missing")));
}

TEST_F(TetherTest, WatchSavesWhatWasCompleteBeforeTheHelperDiedAndReconnects) {
  const std::string script = "[" + connected(R"([[{"reply": "ok"}, {"picture": "a.jpg"}, {"exit": 1}]])") + ", " +
                             connected(R"([[{"reply": "ok"}, {"picture": "b.jpg"}]])") + "]";
  EXPECT_EQ(run(script, {"watch", "--count", "2"}), 0) << errors();
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "b.jpg"));
  EXPECT_THAT(errors(), HasSubstr("exit status 1); starting it again"));
  EXPECT_THAT(temporary.names(), IsEmpty());
}

TEST_F(TetherTest, AFolderThatGoesAwayCostsNoPicture) {
  start(camera(R"([[{"await": ")" + (files / "go") + R"("}, {"picture": "a.jpg"}]])"),
        {"capture", "--output", out / "sub"});
  ASSERT_TRUE(helper->awaitNote("request doCapture"));
  std::filesystem::remove(out / "sub");
  files.write("go", "");
  EXPECT_EQ(wait(), 6);
  const std::string path = helper->directory() + "/a.jpg";
  EXPECT_THAT(errors(), AllOf(HasSubstr("could not save a.jpg"), HasSubstr("it stays at " + path)));
  EXPECT_TRUE(std::filesystem::exists(path));
}

TEST_F(TetherTest, AnInterruptionIs130AndLeavesNothing) {
  for (const int signal : {SIGINT, SIGTERM}) {
    start(camera("[[]]"), {"capture"});
    ASSERT_TRUE(helper->awaitNote("request doCapture"));
    kill(process, signal);
    EXPECT_TRUE(awaitText("err", "for 1 picture under"));  // the released shutter's; a second signal leaves it
    kill(process, signal);
    EXPECT_EQ(wait(), 130);
    EXPECT_THAT(temporary.names(), IsEmpty());
    EXPECT_EQ(helper->notes("request shutdown").size(), 1U);
  }
}

TEST_F(TetherTest, AnInterruptionWaitsForAPictureUnderWay) {
  start(connected(R"([[{"reply": "ok"}, )" + kAnnounced + R"(, {"picture": "first.jpg", "id": 9}, {"await": ")" +
                  (files / "go") + R"("}, {"file": "Capture0001.jpg", "size": 2000}, {"send": "fileDownloadComplete",
                  "payload": {"capture_id": 1, "file_path": "$TMPDIR/Capture0001.jpg"}}]])"),
        {"watch"});
  ASSERT_TRUE(awaitText("out", "first.jpg"));
  kill(process, SIGINT);
  EXPECT_TRUE(awaitText("err", "waiting up to 5"));
  files.write("go", "");
  EXPECT_EQ(wait(), 130);
  EXPECT_THAT(out.names(), ElementsAre("Capture0001.jpg", "first.jpg"));
}

TEST_F(TetherTest, AKilledCommandTakesTheHelperAlong) {
  start(R"({"heartbeat": 20})", {"watch"});
  helper->process();
  kill(process, SIGKILL);
  EXPECT_EQ(wait(), -SIGKILL);
  EXPECT_TRUE(helper->awaitNote("end"));
}

TEST_F(TetherTest, AClosedStandardOutputEndsItQuietly) {
  EXPECT_EQ(run(R"({"heartbeat": 20})", {"messages"}, true), 1);
  EXPECT_EQ(errors(), "");
  EXPECT_EQ(run(camera(R"([[{"picture": "a.jpg"}]])"), {"capture"}, true), 1);
  EXPECT_THAT(out.names(), ElementsAre("a.jpg"));
}

}  // namespace
