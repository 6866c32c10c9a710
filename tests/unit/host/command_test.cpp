// What `tether` does when all goes well.
#include <gmock/gmock.h>

#include "Command.h"

namespace {

using fake::Command;
using fake::Folder;
using fake::Helper;
using fake::Json;
using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

class TetherTest : public testing::Test {
 protected:
  Folder out;
};

TEST_F(TetherTest, ListShowsEveryCamera) {
  const Helper helper(R"({"heartbeat": 20, "start": [
    {"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam\u001b[2J One"}},
    {"send": "deviceAdded", "payload": {"device_id": 513, "name": "Other"}}]})");
  Command people(helper, {"list"});
  EXPECT_EQ(people.wait(), 0) << people.errors();
  EXPECT_EQ(people.output(), "257  Cam?[2J One\n513  Other\n");
  Command programs(helper, {"list", "--json"});
  EXPECT_EQ(programs.wait(), 0);
  EXPECT_THAT(programs.objects(), ElementsAre(Json({{"device_id", 257}, {"name", "Cam\u001b[2J One"}}),
                                              Json({{"device_id", 513}, {"name", "Other"}})));
  EXPECT_TRUE(programs.leavesNoHelper());
  EXPECT_THAT(programs.temporary().names(), IsEmpty());
}

TEST_F(TetherTest, SettingsShowsAllSevenAndWhatTheCameraDoesNotTell) {
  const Helper helper(R"({"start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}},
                                    {"send": "deviceAdded", "payload": {"device_id": 513, "name": "Other"}}],
    "heartbeat": 20, "on": {"connectDevice": [[{"reply": "ok"}]], "getCameraSettings": [[{"reply": "ok", "payload":
      {"isoSpeed": 400, "batteryLevel": 87.5, "shutter": "1/60", "aperture": null}}]]}})");
  Command people(helper, {"settings", "--camera", "Other"});
  EXPECT_EQ(people.wait(), 0) << people.errors();
  EXPECT_THAT(people.output(), AllOf(HasSubstr("isoSpeed        400\n"), HasSubstr("batteryLevel    87.5\n"),
                                     HasSubstr("aperture        -\n"), HasSubstr("shutter         1/60\n")));
  EXPECT_THAT(helper.notes("request connectDevice"), ElementsAre(" 513"));
  Command programs(helper, {"settings", "--json", "--camera", "257"});
  EXPECT_EQ(programs.wait(), 0);
  ASSERT_EQ(programs.objects().size(), 1U);
  const Json object = programs.objects()[0];
  EXPECT_EQ(object["isoSpeed"], 400);
  EXPECT_EQ(object["shutter"], "1/60");
  EXPECT_TRUE(object.at("aperture").is_null() && object.at("whiteBalance").is_null());
  EXPECT_EQ(object["device_id"], 257);
}

TEST_F(TetherTest, CaptureSavesEveryPictureAndNeverOverAnother) {
  out.write("Capture0001.jpg", "mine");
  const Helper helper(fake::camera(R"([[{"picture": "Capture0001.jpg", "id": 1, "size": 1234567}],
                                       [{"picture": "Capture0002.jpg", "id": 2, "at": "Capture0002-1.jpg"}]])"));
  Command command(helper, {"capture", "--json", "--count", "2", "--output", out.path()});
  EXPECT_EQ(command.wait(), 0) << command.errors();
  EXPECT_THAT(out.names(), ElementsAre("Capture0001-2.jpg", "Capture0001.jpg", "Capture0002.jpg"));
  EXPECT_EQ(out.read("Capture0001.jpg"), "mine");
  const auto objects = command.objects();
  ASSERT_EQ(objects.size(), 2U);
  EXPECT_EQ(objects[0]["path"], out / "Capture0001-2.jpg");
  EXPECT_EQ(objects[0]["size"], 1234567);
  EXPECT_EQ(objects[0]["camera"], "Cam");
  EXPECT_EQ(objects[0]["event"], "saved");
  EXPECT_THAT(helper.notes("request doCapture").size(), 2U);
  EXPECT_TRUE(command.leavesNoHelper());
  EXPECT_THAT(command.temporary().names(), IsEmpty());
}

TEST_F(TetherTest, APairIsOneCaptureAndKeepsOneBase) {
  out.write("Capture0001.jpg", "mine");
  const Helper helper(fake::camera(R"([[{"picture": "Capture0001.nef", "id": 1, "pair": 1},
                                        {"picture": "Capture0001.jpg", "id": 2, "pair": 1}],
                                       [{"picture": "Capture0002.jpg", "id": 3}]])"));
  Command command(helper, {"capture", "--count", "2", "--output", out / "new/folder"});
  EXPECT_EQ(command.wait(), 0) << command.errors();
  Command again(helper, {"capture", "--output", out.path()});
  EXPECT_EQ(again.wait(), 0) << again.errors();
  EXPECT_THAT(command.output(), AllOf(HasSubstr("Capture0001.nef  1.0 kB"), HasSubstr("Capture0002.jpg  1.0 kB")));
  EXPECT_TRUE(std::filesystem::exists(out / "new/folder/Capture0001.nef"));
  EXPECT_THAT(out.names(), ElementsAre("Capture0001-2.jpg", "Capture0001-2.nef", "Capture0001.jpg", "new"));
}

TEST_F(TetherTest, EveryReleasesTheShutterWithoutWaitingForTheLastPicture) {
  const Helper helper(fake::camera(R"([[], [{"picture": "a.jpg", "id": 1}, {"picture": "b.jpg", "id": 2}]])"));
  Command command(helper, {"capture", "--count", "2", "--every", "0.1", "--output", out.path()});
  EXPECT_EQ(command.wait(), 0) << command.errors();
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "b.jpg"));
}

TEST_F(TetherTest, WatchConnectsEveryCameraThatComesAndAgainWhenItComesBack) {
  const Helper helper(
      R"({"heartbeat": 20, "start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "A"}}],
    "on": {"connectDevice": [
      [{"reply": "ok"}, {"picture": "a.jpg", "id": 1}, {"send": "deviceRemoved", "payload": {"device_id": 257}},
       {"send": "deviceAdded", "payload": {"device_id": 258, "name": "A"}}],
      [{"reply": "ok"}, {"picture": "b.nef", "id": 2, "pair": 1}, {"picture": "b.jpg", "id": 3, "pair": 1}]]}})");
  Command command(helper, {"watch", "--json", "--camera", "257", "--count", "2", "--output", out.path()});
  EXPECT_EQ(command.wait(), 0) << command.errors();
  std::vector<std::string> events;
  for (const Json& object : command.objects()) events.push_back(object["event"]);
  EXPECT_THAT(events, ElementsAre("camera_added", "connected", "saved", "camera_removed", "camera_added", "connected",
                                  "saved", "saved"));
  EXPECT_THAT(helper.notes("request connectDevice "), ElementsAre("257", "258"));
  EXPECT_THAT(out.names(), ElementsAre("a.jpg", "b.jpg", "b.nef"));
}

TEST_F(TetherTest, MessagesShowsWhatTheHelperSendsAndSendsWhatItIsAskedTo) {
  const Helper helper(R"({"heartbeat": 0, "on": {"connectDevice": [[{"reply": "error", "payload": {"error_code": -1}},
    {"send": "odd", "payload": {"n": 0.5, "t": {"u": null}}}]]}})");
  const std::vector<std::string> arguments = {"messages", "--count", "2", "--send", "connectDevice", "--device", "257"};
  Command people(helper, arguments);
  EXPECT_EQ(people.wait(), 0) << people.errors();
  EXPECT_EQ(people.output(), "error #1 {\"error_code\":-1}\nodd {\"n\":0.5,\"t\":{\"u\":null}}\n");
  auto inJson = arguments;
  inJson.emplace_back("--json");
  Command programs(helper, inJson);
  EXPECT_EQ(programs.wait(), 0);
  EXPECT_EQ(programs.objects().at(0), Json({{"name", "error"}, {"id", 1}, {"payload", {{"error_code", -1}}}}));
  EXPECT_THAT(helper.notes("request connectDevice "), ElementsAre("257", "257"));
}

TEST_F(TetherTest, MessagesEndsWithTheHelperItShutsDown) {
  const Helper helper("{}");
  Command command(helper, {"messages", "--send", "shutdown"});
  EXPECT_EQ(command.wait(), 0) << command.errors();
}

}  // namespace
