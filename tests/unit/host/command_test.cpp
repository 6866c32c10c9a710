// `tether` as a process, on a scripted helper: what each command does in the plain case, and how all of them end. Their
// bad days: bad_day_test.cpp.
#include <sys/ioctl.h>
#include <sys/stat.h>

#include "Tether.h"

namespace {

using namespace fake;
using testing::ContainsRegex;
using testing::ElementsAre;
using testing::EndsWith;
using testing::HasSubstr;
using testing::IsEmpty;

const std::string kSettings = R"({"heartbeat": 20, "start": [
    {"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam\u001b[2J"}},
    {"send": "deviceAdded", "payload": {"device_id": 513, "name": "Other"}}],
  "on": {"connectDevice": [[{"reply": "ok"}]], "getCameraSettings": [[{"reply": "ok", "payload":
    {"isoSpeed": 400, "batteryLevel": 87.5, "shutter": "1/60", "aperture": null}}]]}})";

TEST(CommandTest, SaysWhatItIsAskedForAndEndsAsItShould) {
  const std::string none = R"({"heartbeat": 20})";
  const std::string mute = R"({"heartbeat": 0})";
  const std::string odd = R"({"heartbeat": 0, "on": {"connectDevice": [[
    {"reply": "error", "payload": {"error_code": -1}}, {"send": "odd", "payload": {"n": 0.5, "t": {"u": null}}}]]}})";
  struct Row {
    std::string line;
    std::string script;
    int status;
    std::string said;   // on standard error
    std::string shown;  // on standard output
  };
  const Row table[] = {
      {"list", kSettings, 0, "", "^257  Cam.\\[2J\n513  Other\n$"},
      {"settings --camera 00513", kSettings, 0, "",
       "^isoSpeed        400\nbatteryLevel    87.5\navailableShots  -\n.*shutter         1/60\n"},
      {"messages --count 2 --send connectDevice --device 0257", odd, 0, "",
       "^error #1 .\"error_code\":-1.\nodd ..n.:0.5,.t.:..u.:null..\n$"},
      {"messages --send shutdown", "{}", 0, "", ""},
      {"--help", none, 0, "", "Environment:\n  TMPDIR .*130  interrupted"},
      {"list --help", none, 0, "", "Examples:.*130  interrupted"},
      {"settings --help", none, 0, "", "Examples:.*130  interrupted"},
      {"messages --help", none, 0, "", "Examples:.*130  interrupted"},
      {"capture --help", none, 0, "", "Ends when.*that others shoot.*TMPDIR.*6    a picture could not be saved"},
      {"watch --help", none, 0, "", "until Ctrl-C.*TMPDIR.*6    a picture could not be saved"},
      {"", none, 2, "Usage: tether", "^$"},
      {"shoot --count 3", none, 2, "tether: there is no command 'shoot'", "^$"},
      {"list --nonsense", none, 2, "--nonsense", "^$"},
      {"capture --count 0", none, 2, "'0' is no whole number from 1", "^$"},
      {"capture --count 0x3", none, 2, "'0x3' is no whole number", "^$"},
      {"capture --timeout nan", none, 2, "'nan' is no number of seconds", "^$"},
      {"capture --every 0x1", none, 2, "'0x1' is no number of seconds", "^$"},
      {"watch --timeout 0", none, 2, "'0' is no number of seconds from 0.001", "^$"},
      {"messages --device 5", none, 2, "--send", "^$"},
      {"list --helper-log /no/such/folder/x", none, 2, "cannot write /no/such/folder/x", "^$"},
      {"list", none, 3, "there is no camera (with --virtual there is one to try things out)\n", "^$"},
      {"settings --camera 258", kSettings, 3, "there is no camera 258; there is 257 (Cam?[2J), 513 (Other)\n", "^$"},
      {"list --timeout 0.3", mute, 4, "the list of cameras took longer than 0.3 s\n", "^$"},
      {"messages --count 1 --timeout 0.2", mute, 4, "fewer messages came than asked for\n", "^$"},
      {"list --helper /no/such/helper", none, 5, "cannot start /no/such/helper", "^$"},
      {"list", "start: exit 9", 5, "the helper ended (exit status 9)\n", "^$"},
      {"messages", "start: exit 9", 5, "the helper ended (exit status 9)\n", ""},
  };
  checkAll(table, [](const Row& row) {
    SCOPED_TRACE(row.line);
    Tether tether;
    EXPECT_EQ(tether.run(row.script, row.line), row.status);
    if (row.said.empty()) {
      EXPECT_EQ(tether.errors(), "");
    } else {
      EXPECT_THAT(tether.errors(), HasSubstr(row.said));
    }
    EXPECT_THAT(tether.output(), ContainsRegex(row.shown));
    EXPECT_THAT(tether.temporary.names(), IsEmpty());
  });
}

TEST(CommandTest, NumbersAreDecimal) {
  Tether tether;
  EXPECT_EQ(tether.run("doCapture: picture a.jpg", "capture --every 0 --count 010"), 0) << tether.errors();
  EXPECT_EQ(tether.shutters(), 10U);
}

TEST(CommandTest, NeverOverAnotherFileAndAPairKeepsOneBase) {
  Tether tether;
  tether.out.write("a.jpg", "mine");
  EXPECT_EQ(tether.run("doCapture: picture a.nef+ 1234567; picture a.jpg+", "capture"), 0) << tether.errors();
  EXPECT_THAT(tether.out.names(), ElementsAre("a-2.jpg", "a-2.nef", "a.jpg"));
  EXPECT_EQ(tether.out.read("a.jpg"), "mine");
  EXPECT_THAT(tether.output(), HasSubstr("a-2.nef  1.2 MB"));
  EXPECT_EQ(tether.run("doCapture: picture b.jpg", "capture --output " + tether.out / "new/folder"), 0);
  EXPECT_TRUE(std::filesystem::exists(tether.out / "new/folder/b.jpg"));
  EXPECT_THAT(tether.temporary.names(), IsEmpty());
}

TEST(CommandTest, AFolderThatGoesAwayCostsNoPicture) {
  Tether tether;
  tether.start("doCapture: await " + tether.files / "go" + "; picture a.jpg", "capture --output " + tether.out / "sub");
  ASSERT_TRUE(tether.helper->awaitNote("request doCapture"));
  std::filesystem::remove(tether.out / "sub");
  tether.files.write("go", "");
  EXPECT_EQ(tether.wait(), 6);
  const std::string path = tether.helper->directory() + "/a.jpg";
  EXPECT_THAT(tether.errors(), HasSubstr("; it stays at " + path + "\n"));
  EXPECT_TRUE(std::filesystem::exists(path));
}

TEST(CommandTest, ListNamesWhatItDoesNotTake) {
  Tether tether;
  EXPECT_EQ(tether.run("start: add 257 Cam; picture early.jpg", "list"), 0);
  EXPECT_EQ(tether.errors(), "tether: left where it is: " + tether.helper->directory() + "/early.jpg\n");
}

TEST(CommandTest, OneThatIsKilledTakesTheHelperAlong) {
  Tether tether;
  tether.start("", "watch");
  tether.helper->process();
  kill(tether.process, SIGKILL);
  EXPECT_EQ(tether.wait(), -SIGKILL);
  EXPECT_TRUE(tether.helper->awaitNote("end"));
}

TEST(CommandTest, OutputThatNobodyReadsKeepsNobodyFromEndingIt) {
  for (const int signal : {SIGINT, SIGTERM}) {
    Tether tether;
    tether.piped = true;
    tether.start(R"({"start": [{"repeat": 5000, "do": [{"send": "fills the pipe"}]}]})", "messages");
    EXPECT_TRUE(eventually(
        [&, bytes = 0]() mutable { return ioctl(tether.unread.read.get(), FIONREAD, &bytes) == 0 && bytes > 60'000; }));
    kill(tether.process, signal);
    EXPECT_EQ(tether.wait(), 130);
  }
}

TEST(CommandTest, OutputThatTakesNothingIs1AndWhatWasShotIsSaved) {
  Tether closed;
  closed.piped = true;
  closed.unread.read.reset();
  EXPECT_EQ(closed.run("", "messages"), 1);
  EXPECT_EQ(closed.run("doCapture: picture a.jpg", "capture"), 1);
  EXPECT_EQ(closed.errors(), "");
  EXPECT_THAT(closed.out.names(), ElementsAre("a.jpg"));
  for (const char* const before : {"exec >/dev/full", "exec >&-"}) {
    Tether tether;
    EXPECT_EQ(tether.run("", "list", before), 1);
    EXPECT_THAT(tether.errors(), HasSubstr("tether: cannot write to standard output: "));
    EXPECT_EQ(tether.run("doCapture: picture a.jpg", "capture --count 2", before), 1);
    EXPECT_THAT(tether.errors(), EndsWith("\ntether: 1 of 2 pictures are missing\n"));
    EXPECT_THAT(tether.out.names(), ElementsAre("a.jpg"));
    EXPECT_EQ(tether.run("", "--help", before), 1);
    EXPECT_THAT(tether.errors(), HasSubstr("cannot write to"));
  }
}

TEST(CommandTest, ALogThatNobodyReadsHoldsNothingUpAndNoDescriptorsLeftIs5) {
  Tether tether;
  mkfifo((tether.files / "fifo").c_str(), 0600);
  EXPECT_EQ(tether.run("", "list --helper-log " + tether.files / "fifo"), 0);
  EXPECT_EQ(tether.run("", "list --helper-log -", "exec 2>&-"), 0);
#if !defined(__SANITIZE_ADDRESS__)  // it needs some itself
  for (const char* const most : {"4", "5", "6", "9", "13", "15"}) {
    // Whoever runs the tests may leave descriptors to them.
    EXPECT_EQ(tether.run("", "capture", "exec 3>&- 4>&- 5>&- 6>&-; ulimit -n " + std::string(most)), 5) << most;
    EXPECT_THAT(tether.errors(), EndsWith("Too many open files\n"));
  }
#endif
}

}  // namespace
