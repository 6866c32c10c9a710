// How `tether` fails: with which status, in which words, and what it leaves.
#include <gmock/gmock.h>

#include "Command.h"

namespace {

using fake::Command;
using fake::Folder;
using fake::Helper;
using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

const char* const kBusy = R"({"send": "objectWasAdded", "payload":
  {"capture_id": 1, "has_sidecar": 0, "file_name": "Capture0001.jpg", "file_size": 2000}})";

class TetherFailureTest : public testing::Test {
 protected:
  // Runs to its end, which leaves no helper behind whatever happened.
  int run(const Helper& helper, std::vector<std::string> arguments, bool closedOutput = false) {
    command = std::make_unique<Command>(helper, std::move(arguments), closedOutput);
    const int status = command->wait();
    EXPECT_TRUE(command->leavesNoHelper());
    return status;
  }

  // A file that a script awaits until the test writes it.
  std::string go() const { return signals / "go"; }

  Folder out;
  Folder signals;
  std::unique_ptr<Command> command;
};

TEST_F(TetherFailureTest, WrongUsageIs2AndHelpIs0) {
  const Helper helper("{}");
  for (const std::vector<std::string>& wrong :
       std::vector<std::vector<std::string>>{{},
                                             {"shoot"},
                                             {"list", "--nonsense"},
                                             {"capture", "--count", "0"},
                                             {"capture", "--timeout", "nan"},
                                             {"watch", "--timeout", "0"},
                                             {"messages", "--device", "5"},
                                             {"list", "--helper-log", "/no/such/folder/x"}}) {
    EXPECT_EQ(run(helper, wrong), 2);
    EXPECT_FALSE(command->errors().empty());
    EXPECT_EQ(command->output(), "");
  }
  for (const char* const name : {"list", "settings", "capture", "watch", "messages"}) {
    EXPECT_EQ(run(helper, {name, "--help"}), 0);
    EXPECT_THAT(command->output(), AllOf(HasSubstr("Examples:"), HasSubstr("130  interrupted")));
  }
  EXPECT_THAT(helper.notes(), IsEmpty());
}

TEST_F(TetherFailureTest, NoCameraOrNotTheOneAskedForIs3) {
  const Helper none(R"({"heartbeat": 20})");
  EXPECT_EQ(run(none, {"list"}), 3);
  EXPECT_EQ(command->errors(), "tether: there is no camera\n");
  const Helper other(fake::camera("[[]]"));
  EXPECT_EQ(run(other, {"capture", "--camera", "258", "--output", out.path()}), 3);
  EXPECT_THAT(command->errors(), HasSubstr("no camera 258; there is 257 (Cam)"));
  const Helper refusing(R"({"start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}}],
    "heartbeat": 20, "on": {"connectDevice": [[{"reply": "error", "payload": {"error_code": -1}}]]}})");
  EXPECT_EQ(run(refusing, {"settings"}), 3);
  EXPECT_THAT(command->errors(), HasSubstr("connecting Cam failed"));
  const Helper leaving(fake::camera(R"([[{"send": "deviceRemoved", "payload": {"device_id": 257}}]])"));
  EXPECT_EQ(run(leaving, {"capture", "--output", out.path()}), 3);
  EXPECT_EQ(command->errors(), "tether: Cam has gone; 1 of 1 picture is missing\n");
}

TEST_F(TetherFailureTest, WhatDoesNotComeInTimeIs4AndIsNamed) {
  const Helper mute(R"({"heartbeat": 0})");
  EXPECT_EQ(run(mute, {"list", "--timeout", "0.2"}), 4);
  const Helper camera(fake::camera(R"([[{"picture": "a.jpg"}], []])"));
  EXPECT_EQ(run(camera, {"capture", "--count", "2", "--timeout", "1", "--output", out.path()}), 4);
  EXPECT_EQ(command->errors(), "tether: nothing came from Cam for 1.0 s; 1 of 2 pictures are missing\n");
  EXPECT_THAT(out.names(), ElementsAre("a.jpg"));
  const Helper half(fake::camera("[[" + std::string(kBusy) + R"(, {"file": "Capture0001.jpg", "size": 5}]])"));
  EXPECT_EQ(run(half, {"capture", "--timeout", "1", "--output", out.path()}), 4);
  EXPECT_THAT(command->errors(), AllOf(HasSubstr("Capture0001.jpg was not received"),
                                       HasSubstr("left where it is: " + half.directory() + "/Capture0001.jpg")));
  EXPECT_EQ(run(mute, {"messages", "--count", "1", "--timeout", "0.2"}), 4);
}

TEST_F(TetherFailureTest, AHelperThatCannotStartOrDiesAtOnceIs5) {
  const Helper helper(R"({"start": [{"exit": 9}]})");
  EXPECT_EQ(run(helper, {"list", "--helper", "/no/such/helper"}), 5);
  EXPECT_THAT(command->errors(), HasSubstr("/no/such/helper"));
  EXPECT_EQ(run(helper, {"list"}), 5);
  EXPECT_THAT(command->errors(), HasSubstr("exit status 9"));
  EXPECT_EQ(run(helper, {"messages"}), 5);
  EXPECT_EQ(run(helper, {"settings"}), 5);
}

TEST_F(TetherFailureTest, WatchStartsALostHelperAgainButNotForEver) {
  const Helper helper(R"({"start": [{"exit": 9}]})");
  EXPECT_EQ(run(helper, {"watch", "--output", out.path()}), 5);
  EXPECT_EQ(helper.notes("start ").size(), 4U);
  EXPECT_THAT(command->errors(), HasSubstr("too often within a minute; giving up"));
}

TEST_F(TetherFailureTest, CaptureGoesOnAfterAHelperThatDiedDuringATransfer) {
  const Helper helper("[" +
                      fake::camera(R"([[{"picture": "a.jpg", "id": 7}], [)" + std::string(kBusy) +
                                   R"(, {"file": "Capture0001.jpg", "size": 5}, {"kill": 9}]])") +
                      ", " + fake::camera(R"([[{"picture": "b.jpg", "id": 1}]])") + "]");
  EXPECT_EQ(run(helper, {"capture", "--count", "3", "--output", out.path()}), 5);
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "b.jpg"));
  EXPECT_EQ(helper.notes("request doCapture").size(), 3U);  // what was lost is not taken again
  EXPECT_THAT(command->errors(), AllOf(HasSubstr("killed by signal 9"), HasSubstr("Capture0001.jpg was not received"),
                                       HasSubstr("left where it is: " + helper.directory() + "/Capture0001.jpg"),
                                       HasSubstr("1 of 3 pictures are missing")));
}

TEST_F(TetherFailureTest, WatchSavesWhatWasCompleteBeforeTheHelperDiedAndReconnects) {
  const Helper helper(
      R"([{"heartbeat": 20, "start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}}],
      "on": {"connectDevice": [[{"reply": "ok"}, {"picture": "a.jpg"}, {"exit": 1}]]}},
    {"heartbeat": 20, "start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}}],
      "on": {"connectDevice": [[{"reply": "ok"}, {"picture": "b.jpg"}]]}}])");
  EXPECT_EQ(run(helper, {"watch", "--count", "2", "--output", out.path()}), 0) << command->errors();
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "b.jpg"));
  EXPECT_THAT(command->errors(), HasSubstr("exit status 1); starting it again"));
  EXPECT_THAT(command->temporary().names(), IsEmpty());
}

TEST_F(TetherFailureTest, APictureThatCannotBeSavedIs6AndStaysWhereItIsSaidToBe) {
  const Helper helper(fake::camera(R"([[{"picture": "a.jpg", "at": "missing/a.jpg"}]])"));
  EXPECT_EQ(run(helper, {"capture", "--count", "2", "--output", out.path()}), 6);
  EXPECT_THAT(command->errors(), HasSubstr("could not save a.jpg"));
  EXPECT_EQ(helper.notes("request doCapture").size(), 1U);  // what cannot be saved is not taken
  EXPECT_EQ(run(helper, {"capture", "--output", out.write("file", "")}), 6);
  EXPECT_THAT(command->errors(), HasSubstr("cannot make the folder"));
}

TEST_F(TetherFailureTest, AFolderThatGoesAwayCostsNoPicture) {
  const Helper helper(fake::camera(R"([[{"await": ")" + go() + R"("}, {"picture": "a.jpg"}]])"));
  command = std::make_unique<Command>(helper, std::vector<std::string>{"capture", "--output", out / "sub"});
  ASSERT_TRUE(helper.awaitNote("request doCapture"));
  std::filesystem::remove(out / "sub");
  signals.write("go", "");
  EXPECT_EQ(command->wait(), 6);
  const std::string path = helper.directory() + "/a.jpg";
  EXPECT_THAT(command->errors(), AllOf(HasSubstr("could not save a.jpg"), HasSubstr("it stays at " + path)));
  EXPECT_TRUE(std::filesystem::exists(path));
}

TEST_F(TetherFailureTest, AnInterruptionIs130AndLeavesNothing) {
  for (const int signal : {SIGINT, SIGTERM}) {
    const Helper helper(fake::camera("[[]]"));
    command = std::make_unique<Command>(helper, std::vector<std::string>{"capture", "--output", out.path()});
    ASSERT_TRUE(helper.awaitNote("request doCapture"));
    command->signal(signal);
    EXPECT_EQ(command->wait(), 130);
    EXPECT_TRUE(command->leavesNoHelper());
    EXPECT_THAT(command->temporary().names(), IsEmpty());
    EXPECT_THAT(helper.notes("request shutdown").size(), 1U);
  }
}

TEST_F(TetherFailureTest, AnInterruptionWaitsForAPictureUnderWay) {
  const Helper helper(
      R"({"heartbeat": 20, "start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}}],
    "on": {"connectDevice": [[{"reply": "ok"}, )" +
      std::string(kBusy) + R"(, {"picture": "first.jpg", "id": 9}, {"await": ")" + go() +
      R"("}, {"file": "Capture0001.jpg", "size": 2000}, {"send": "fileDownloadComplete",
      "payload": {"capture_id": 1, "file_path": "$TMPDIR/Capture0001.jpg"}}]]}})");
  command = std::make_unique<Command>(helper, std::vector<std::string>{"watch", "--output", out.path()});
  ASSERT_TRUE(command->awaitOutput("first.jpg"));
  command->signal(SIGINT);
  EXPECT_TRUE(fake::eventually([&] { return command->errors().find("waiting up to 5") != std::string::npos; }));
  signals.write("go", "");
  EXPECT_EQ(command->wait(), 130);
  EXPECT_THAT(out.names(), ElementsAre("Capture0001.jpg", "first.jpg"));
  EXPECT_TRUE(command->leavesNoHelper());
}

TEST_F(TetherFailureTest, AKilledCommandTakesTheHelperAlong) {
  const Helper helper(R"({"heartbeat": 20})");
  command = std::make_unique<Command>(helper, std::vector<std::string>{"watch", "--output", out.path()});
  const pid_t process = helper.process();
  command->signal(SIGKILL);
  EXPECT_EQ(command->wait(), -SIGKILL);
  EXPECT_TRUE(helper.awaitNote("end"));
  EXPECT_TRUE(fake::eventually([&] { return fake::isGone(process); }));
}

TEST_F(TetherFailureTest, AClosedStandardOutputEndsItQuietly) {
  const Helper helper(R"({"heartbeat": 20})");
  EXPECT_EQ(run(helper, {"messages"}, true), 1);
  EXPECT_EQ(command->errors(), "");
  const Helper camera(fake::camera(R"([[{"picture": "a.jpg"}]])"));
  EXPECT_EQ(run(camera, {"capture", "--output", out.path()}, true), 1);
  EXPECT_THAT(out.names(), ElementsAre("a.jpg"));
}

}  // namespace
