#include "Session.h"

#include <sys/wait.h>

#include "Fake.h"
#include "Log.h"

namespace {

using namespace std::chrono_literals;
using namespace tether;
using fake::isGone;
using fake::soon;
using testing::ElementsAre;
using testing::HasSubstr;

class SessionTest : public testing::Test {
 protected:
  void SetUp() override {
    platform::setLogSink([](const std::string&) {});
  }
  void TearDown() override {
    session.reset();
    platform::setLogSink({});
  }

  Session& start(const std::string& script, std::chrono::milliseconds silence = fake::kPatience) {
    helper = std::make_unique<fake::Helper>(script);
    SessionOptions options;
    options.helper = FAKE_HELPER;
    options.environment = helper->environment();
    options.silence = silence;
    options.wakeup = wakeup;
    options.errorDescriptor = errors.write.get();
    session = std::make_unique<Session>(options);
    return *session;
  }

  // The next event of that kind; others are passed over.
  template <class Kind>
  Kind next() {
    for (const auto until = soon(); Clock::now() < until;) {
      const auto event = session->nextEvent(until);
      if (event && std::holds_alternative<Kind>(*event)) return std::get<Kind>(*event);
      if (event && std::holds_alternative<HelperLost>(*event)) break;
    }
    ADD_FAILURE() << "no such event";
    return {};
  }

  std::shared_ptr<Wakeup> wakeup = std::make_shared<Wakeup>();
  Pipe errors = Pipe::make();  // takes what the helper logs
  std::unique_ptr<fake::Helper> helper;
  std::unique_ptr<Session> session;
};

TEST_F(SessionTest, NotificationsBecomeTypedEvents) {
  start(R"({"start": [
    {"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}},
    {"send": "deviceRemoved", "payload": {"device_id": 258}},
    {"send": "cameraSettingsChanged", "payload": {"isoSpeed": 400, "shutter": "1/60", "aperture": null}},
    {"send": "objectWasAdded",
     "payload": {"capture_id": 3, "has_sidecar": 1, "file_name": "Capture0001.nef", "file_size": -1294967296}},
    {"send": "fileDownloadComplete", "payload": {"capture_id": 3, "file_path": "/x/Capture0001.nef"}},
    {"send": "somethingNew"}, {"send": "deviceAdded", "payload": 5}]})");
  const auto added = next<DeviceAdded>();
  EXPECT_EQ(added.device_id, 257);
  EXPECT_EQ(added.name, "Cam");
  EXPECT_EQ(next<DeviceRemoved>().device_id, 258);
  const auto settings = next<SettingsChanged>().settings;
  EXPECT_EQ(settings[0], SettingValue(400.0));
  EXPECT_EQ(settings[4], SettingValue());
  EXPECT_EQ(settings[5], SettingValue("1/60"));
  const auto object = next<ObjectWasAdded>();
  EXPECT_EQ(object.capture_id, 3);
  EXPECT_TRUE(object.has_sidecar);
  EXPECT_EQ(object.file_name, "Capture0001.nef");
  EXPECT_EQ(object.file_size, 3'000'000'000);
  EXPECT_EQ(next<FileDownloadComplete>().file_path, "/x/Capture0001.nef");
  EXPECT_EQ(next<OtherMessage>().name, "somethingNew");
  EXPECT_EQ(next<DeviceAdded>().device_id, 0);
  next<Heartbeat>();
}

TEST_F(SessionTest, RepliesAreMatchedByIdAndALateOneIsNobodys) {
  Session& running = start(R"({"on": {"first": [[]], "second": [[
    {"send": "deviceAdded", "payload": {"device_id": 1, "name": "x"}}, {"reply": "ok", "payload": {"isoSpeed": 2}},
    {"reply": "error", "to": "first", "payload": {"error_code": 65535, "error_description": "No"}}]]}})");
  EXPECT_EQ(running.request("first", nullptr, Clock::now() + 50ms).kind, Reply::Kind::kTimeout);
  const Reply second = running.request("second", nullptr, soon());
  EXPECT_EQ(second.kind, Reply::Kind::kOk);
  EXPECT_EQ(settingsFrom(*second.payload)[0], SettingValue(2.0));
  EXPECT_EQ(next<DeviceAdded>().device_id, 1);  // kept meanwhile
  EXPECT_EQ(next<OtherMessage>().name, "error");
}

TEST_F(SessionTest, ConnectingAndSettingsAskAgainWhereTheHelperDropsARequest) {
  Session& running = start(R"({"on": {"connectDevice": [[{"reply": "ok"}], []],
                                      "getCameraSettings": [[], [{"reply": "ok", "payload": {"isoSpeed": 1}}], [],
                                                            [{"reply": "ok", "payload": {"isoSpeed": 9}}]]}})");
  EXPECT_EQ(running.connect(257, soon()).kind, Reply::Kind::kOk);
  EXPECT_EQ(running.connect(257, soon()).kind, Reply::Kind::kOk);  // connected already, which has no answer
  EXPECT_THAT(helper->notes("request "),
              ElementsAre("connectDevice 257", "connectDevice 257", "getCameraSettings 257", "getCameraSettings 257"));
  const Reply reply = running.settings(257, soon());
  ASSERT_EQ(reply.kind, Reply::Kind::kOk);
  EXPECT_EQ(settingsFrom(*reply.payload)[0], SettingValue(9.0));
}

TEST_F(SessionTest, AListingIsCompleteWithTheFirstReplyOrTheFirstHeartbeat) {
  for (const char* const script :
       {R"({"heartbeat": 0, "start": [{"pause": 30}, {"send": "deviceAdded", "payload": {"device_id": 513}}],
            "on": {"getCameraSettings": [[], [{"reply": "error"}]]}})",
        R"({"heartbeat": 20, "start": [{"pause": 30}, {"send": "deviceAdded", "payload": {"device_id": 513}}]})"}) {
    EXPECT_EQ(start(script).awaitListing(soon()), Reply::Kind::kOk);
    const auto event = session->nextEvent(Clock::now());
    ASSERT_TRUE(event && std::holds_alternative<DeviceAdded>(*event));
    EXPECT_EQ(std::get<DeviceAdded>(*event).device_id, 513);
  }
}

TEST_F(SessionTest, AFrameThatIsNoMessageIsDroppedAndOneThatNeverEndsIsSilence) {
  Session& running =
      start(R"({"start": [{"bytes": "160000000000000003000000020000006100" }, {"bytes": "04000000ffffffff"},
    {"send": "deviceRemoved", "payload": {"device_id": 4}}, {"bytes": "ffffff7f0000"}]})",
            300ms);
  EXPECT_EQ(next<DeviceRemoved>().device_id, 4);
  EXPECT_EQ(next<HelperLost>().how, HelperLost::How::kSilent);
  EXPECT_TRUE(isGone(running.processId()));
}

TEST_F(SessionTest, AFloodIsKeptUpToABoundBeyondWhichTheHelperWaitsAndNothingIsLost) {
  const std::string large(1 << 20, 'x');
  const std::vector<std::tuple<std::string, int, Reply::Kind>> table{
      {R"("device_id": 1)", 30'000, Reply::Kind::kOk}, {R"("text": ")" + large + '"', 200, Reply::Kind::kTimeout}};
  for (const auto& [payload, count, replied] : table) {
    Session& running = start(R"({"heartbeat": 0, "start": [{"repeat": )" + std::to_string(count) +
                             R"(, "do": [{"send": "flood", "payload": {)" + payload + R"(}}]}],
                                "on": {"ask": [[{"reply": "ok"}]]}})");
    // The reply comes behind the flood.
    const auto until = replied == Reply::Kind::kOk ? soon() : Clock::now() + 2s;
    EXPECT_EQ(running.request("ask", nullptr, until).kind, replied);
    int taken = 0;
    while (taken < count + (replied == Reply::Kind::kOk ? 0 : 1) && running.nextMessage(soon())) ++taken;
    EXPECT_EQ(running.request("ask", nullptr, soon()).kind, Reply::Kind::kOk);
  }
}

TEST_F(SessionTest, LinesOfTheLogAreEventsAndKeptAndPassedOnWithoutAWaitForWhoTakesThem) {
  setNonBlocking(errors.write.get());
  const std::string filling(4096, 'x');
  while (write(errors.write.get(), filling.data(), filling.size()) > 0) {
  }
  start(R"({"start": [{"repeat": 120, "do": [{"log": "a line"}]}, {"log": "Writing x failed: why"}, {"exit": 3}]})");
  EXPECT_EQ(next<LogLine>().text, "a line");
  next<HelperLost>();
  ASSERT_EQ(session->lastLogLines().size(), 100U);
  EXPECT_EQ(session->lastLogLines().back().text, "Writing x failed: why");
  std::string passed;
  char some[4096];
  while (passed.find("Writing x failed: why\n") == std::string::npos) {
    const ssize_t got = read(errors.read.get(), some, sizeof some);
    ASSERT_GT(got, 0);
    passed.append(some, static_cast<std::size_t>(got));
  }
  EXPECT_THAT(passed, HasSubstr("] a line\n2"));  // stamped, and each a line
}

TEST_F(SessionTest, WhatCameBeforeTheHelperDiedIsDeliveredBeforeItsLoss) {
  Session& running = start(R"({"start": [{"send": "deviceAdded", "payload": {"device_id": 7}}, {"exit": 3}]})");
  EXPECT_EQ(next<DeviceAdded>().device_id, 7);
  const auto event = running.nextEvent(soon());
  ASSERT_TRUE(event && std::holds_alternative<HelperLost>(*event));
  const auto& lost = std::get<HelperLost>(*event);
  EXPECT_EQ(lost.how, HelperLost::How::kEnded);
  EXPECT_EQ(WEXITSTATUS(lost.status), 3);
  EXPECT_THAT(lost.description, HasSubstr("exit status 3"));
  EXPECT_EQ(running.request("any", nullptr, soon()).kind, Reply::Kind::kLost);
  EXPECT_TRUE(std::holds_alternative<HelperLost>(*running.nextEvent(soon())));  // and again
}

TEST_F(SessionTest, AHelperKilledDuringARequestIsLostAtOnceAndOneThatClosesItsOutputToo) {
  EXPECT_EQ(start(R"({"on": {"ask": [[{"orphan": true}, {"kill": 9}]]}})").request("ask", nullptr, soon()).kind,
            Reply::Kind::kLost);
  EXPECT_THAT(session->lost()->description, HasSubstr("signal 9"));
  EXPECT_TRUE(isGone(session->processId()));
  start(R"({"heartbeat": 0, "ignoresEndOfInput": true, "start": [{"closeOutput": true}]})");
  next<HelperLost>();
  EXPECT_TRUE(isGone(session->processId()));
}

TEST_F(SessionTest, ASilentHelperIsLostAndEndedThoughItIgnoresSigterm) {
  Session& running =
      start(R"({"heartbeat": 0, "ignoresEndOfInput": true, "start": [{"ignore": 15}, {"send": "heartbeat"}]})", 300ms);
  next<Heartbeat>();
  EXPECT_EQ(next<HelperLost>().how, HelperLost::How::kSilent);
  EXPECT_TRUE(isGone(running.processId()));
}

TEST_F(SessionTest, AHelperThatDoesNotReadIsLost) {
  Session& running = start(R"({"heartbeat": 0, "start": [{"ignore": 15}, {"stopReading": true}]})");
  helper->process();
  auto large = std::make_unique<KtLuaTETable>();
  large->Set("text", new KtLuaTEString(std::string(1 << 20, 'x')));
  running.send("large", large.get());
  ASSERT_TRUE(running.lost());
  EXPECT_EQ(running.lost()->how, HelperLost::How::kNotReading);
  EXPECT_TRUE(isGone(running.processId()));
}

TEST_F(SessionTest, ShutdownEndsTheHelperAndRemovesItsDirectory) {
  Session& running = start("{}");
  const pid_t process = helper->process();
  const std::string directory = helper->directory();
  struct stat status {};
  ASSERT_EQ(stat(directory.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0700U);
  EXPECT_EQ(running.end(fake::kPatience), 0);
  EXPECT_TRUE(isGone(process));
  session.reset();
  EXPECT_FALSE(std::filesystem::exists(directory));
  EXPECT_THAT(helper->notes("request"), ElementsAre(" shutdown 0"));
}

TEST_F(SessionTest, AHelperThatOverhearsEverythingIsKilledInTheEnd) {
  start(R"({"ignoresEndOfInput": true, "start": [{"ignore": 15}], "on": {"shutdown": [[]]}})");
  const pid_t process = helper->process();
  next<Heartbeat>();
  EXPECT_EQ(WTERMSIG(session->end(50ms)), SIGKILL);
  EXPECT_TRUE(isGone(process));
  EXPECT_THAT(helper->notes("end"), ElementsAre(""));  // its input was closed first
}

TEST_F(SessionTest, WhatTheHelperSendsWhileItEndsCanStillBeTaken) {
  start(R"({"on": {"shutdown": [[{"picture": "a.jpg"}, {"exit": 0}]]}})").end(fake::kPatience);
  EXPECT_EQ(next<FileDownloadComplete>().capture_id, 1);
  EXPECT_EQ(session->directory()->tidy(), std::vector<std::string>{session->directory()->path() + "/a.jpg"});
  std::filesystem::remove_all(session->directory()->path());
}

TEST_F(SessionTest, AnInterruptionEndsAWaitAndLeavesTheSessionUsable) {
  Session& running = start(R"({"heartbeat": 0, "on": {"ask": [[], [{"reply": "ok"}]]}})");
  std::thread interrupter([&] {
    helper->awaitNote("request ask");
    wakeup->interrupt();
  });
  EXPECT_EQ(running.request("ask", nullptr, soon()).kind, Reply::Kind::kInterrupted);
  interrupter.join();
  wakeup->acknowledge();
  EXPECT_EQ(running.request("ask", nullptr, soon()).kind, Reply::Kind::kOk);
}

TEST_F(SessionTest, TheHelperInheritsNoPipeOfOurs) {
  start(R"({"on": {"shutdown": [[]]}})");
  SessionOptions options;
  options.helper = FAKE_HELPER;
  options.environment = helper->environment();
  const Session second(options);  // made while the first one's pipes are open
  helper->process(1);
  EXPECT_EQ(session->end(50ms), 0) << "it did not see its input's end";
}

}  // namespace
