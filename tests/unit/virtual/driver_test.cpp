// A folder as cameras: what appears in it, what the shutter takes, what camera.json changes.
#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <set>
#include <thread>

#include "Client.h"
#include "FolderFeed.h"

namespace virtualcamera::test {
namespace {

namespace fs = std::filesystem;
using Ids = std::vector<uint32_t>;
using Texts = std::vector<std::string>;

struct DriverTest : testing::Test {
  DriverTest() { fs::create_directories(root); }
  ~DriverTest() override { fs::remove_all(root); }

  void put(const fs::path& name, const std::string& content) const {
    fs::create_directories((root / name).parent_path());
    std::ofstream(root / name, std::ios::binary) << content;
  }
  // Written elsewhere and moved in, long ago as far as the time stamp goes.
  void moveIn(const fs::path& name, const std::string& content) const {
    put(".arriving", content);
    fs::last_write_time(root / ".arriving", fs::file_time_type::clock::now() - std::chrono::hours(1));
    fs::create_directories((root / name).parent_path());
    fs::rename(root / ".arriving", root / name);
  }
  // Looks until it is so; far longer than it should take.
  template <typename Condition>
  bool comesTrue(Condition condition) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    bool holds = false;
    while (!(holds = condition()) && std::chrono::steady_clock::now() < end) {
      feed.look();
      std::this_thread::yield();
    }
    return holds;
  }
  bool has(size_t items) {
    return comesTrue([&] { return model.camera(1) != nullptr && model.camera(1)->items().size() == items; });
  }

  fs::path root = fs::path(testing::TempDir()) / ("virtual-cameras-" + std::to_string(getpid()));
  Model model;
  FolderFeed feed{model, root.string()};
};

TEST_F(DriverTest, FoldersThatAppearAndGoAreCamerasPluggedInAndOut) {
  for (const char* name : {"1-Studio", "none", "2nd"}) fs::create_directory(root / name);
  put("3-file", "no folder");
  EXPECT_TRUE(comesTrue([&] { return model.cameras() == Ids{1}; }));
  fs::create_directory(root / "12-Left - right");
  EXPECT_TRUE(comesTrue([&] { return model.cameras() == Ids{1, 12}; }));
  EXPECT_EQ(model.camera(12)->name(), "Left - right");
  fs::rename(root / "1-Studio", root / "1-Renamed");
  EXPECT_TRUE(comesTrue([&] { return model.camera(1)->name() == "Renamed"; }));
  fs::remove_all(root);
  EXPECT_TRUE(comesTrue([&] { return model.cameras().empty(); }));
}

TEST_F(DriverTest, AFileIsShotOnceWhenItIsWholeAndOfAKnownTypeAndAPairWaitsForItsOtherHalf) {
  put("1-One/camera.json", R"({"pairs": true})");
  for (const char* name : {"before.JPG", "notes.txt", ".hidden.jpg"}) moveIn(fs::path("1-One") / name, "jpeg");
  put("1-One/empty.jpg", "");
  EXPECT_TRUE(has(1));  // once the grace of its other half is over
  moveIn("1-One/c.ndf", "ndf");
  moveIn("1-One/shot.jpg", "J");
  feed.look();
  EXPECT_TRUE(has(2));
  moveIn("1-One/shot.nef", "RR");
  EXPECT_TRUE(has(4));
  put("1-One/empty.jpg", "not any more");
  EXPECT_TRUE(has(5));

  Client module;
  Client device(module, 1);
  std::multiset<std::tuple<uint32_t, uint32_t, std::string>> seen;
  for (const uint32_t id : model.camera(1)->items()) {
    Opened open(device, id);
    const uint32_t status = open.data.number(kNkMAIDCapability_RawJpegImageStatus);
    EXPECT_EQ(open.transfer(), kNkMAIDResult_NoError);
    seen.emplace(open.data.deliveries[0].fileDataType, status, open.data.received);
  }
  EXPECT_EQ(seen, (decltype(seen){{1, 0, "jpeg"}, {1, 0, "not any more"}, {257, 0, "ndf"}, {4, 1, "RR"}, {1, 1, "J"}}));
  moveIn("1-One/before.JPG", "another file of the same name");
  EXPECT_TRUE(has(1));
  moveIn("1-One/cut.jpg", std::string(100, 'x'));
  EXPECT_TRUE(has(2));
  ASSERT_EQ(truncate((root / "1-One/cut.jpg").c_str(), 35), 0);
  EXPECT_EQ(Opened(device, model.camera(1)->items().back()).transfer(), kNkMAIDResult_DataTransFailure);
  EXPECT_TRUE(has(2));  // not transferred, so still there
}

TEST_F(DriverTest, TheShutterTakesTheRollThenPicturesOfItsOwn) {
  moveIn("1-One/roll/b.jpg", "second, JPEG");
  moveIn("1-One/roll/a.jpg", "first");
  moveIn("1-One/roll/b.nef", "second, RAW");
  EXPECT_TRUE(has(0));
  Client module;
  Client device(module, 1);
  const auto capture = [&] {
    device.start(kNkMAIDCapability_Capture);
    EXPECT_EQ(device.finish(), kNkMAIDResult_NoError);
    return model.camera(1)->items().size();
  };
  for (int shot = 0; shot < 3; ++shot) capture();
  put("1-One/camera.json", R"({"pairs": true, "capture": {"completeEvent": false}})");
  ASSERT_TRUE(comesTrue([&] {
    const size_t before = model.camera(1)->items().size();
    return capture() == before + 2;
  }));
  std::vector<std::string> taken;
  for (const uint32_t id : model.camera(1)->items()) {
    Opened open(device, id);
    open.transfer();
    taken.push_back(open.data.received);
  }
  EXPECT_EQ(Texts(taken.begin(), taken.begin() + 3), (Texts{"first", "second, RAW", "second, JPEG"}));
  EXPECT_EQ(taken.rbegin()[1].substr(0, 4), std::string("II*\0", 4));
  for (const size_t own : {size_t{3}, taken.size() - 1}) {
    EXPECT_EQ(taken[own].substr(0, 3), "\xff\xd8\xff");
    EXPECT_EQ(taken[own].substr(taken[own].size() - 2), "\xff\xd9");
  }
  EXPECT_NE(taken[3], taken.back()) << "the number is in the picture";
}

TEST_F(DriverTest, TheCameraFileIsReadAgainWhenItChangesAndKeptWhenItIsWrong) {
  put("1-One/camera.json", R"({"name": "By file", "settings": {"BatteryLevel": 10, "Capture": null},
                               "faults": [{"object": "camera", "command": "CapGet", "capability": "Name",
                                           "times": 1, "answer": "HardwareError"}]})");
  EXPECT_TRUE(has(0));
  Client module;
  Client device(module, 1);
  EXPECT_EQ(device.name(), "!");
  EXPECT_EQ(device.name(), "By file");
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_NotSupported);
  const auto battery = [&] { return device.number(kNkMAIDCapability_BatteryLevel, kNkMAIDDataType_IntegerPtr); };
  EXPECT_EQ(battery(), 10u);
  testing::internal::CaptureStderr();
  put("1-One/camera.json", R"({"settings": {"BatteryLevel": )");
  moveIn("1-One/a.jpg", "looked at after the file");
  EXPECT_TRUE(has(1));
  EXPECT_NE(testing::internal::GetCapturedStderr().find("camera.json: "), std::string::npos);
  EXPECT_EQ(battery(), 10u);
  put("1-One/camera.json", R"({"settings": {"BatteryLevel": 11}})");
  EXPECT_TRUE(comesTrue([&] { return battery() == 11; }));
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_Pending);
  fs::remove(root / "1-One/camera.json");
  EXPECT_TRUE(comesTrue([&] { return battery() == 85; }));
}

TEST(CameraFileTest, ReadsSettingsByTypeAndShorthandAndFaults) {
  const CameraFile file = parseCameraFile(R"({
    "transfer": {"deliveryBytes": 4096, "inModulePolls": true}, "capture": {"polls": 3, "answer": "NoError"},
    "fileTypes": {".XYZ": 99}, "alive": false,
    "settings": {"Aperture": "f/8", "FreeBytes": null, "SaveMedia": 1,
      "WBMode": {"type": "strings", "values": ["Auto", "Shade"], "current": 5},
      "0x9001": {"type": "integer", "value": -3}, "36866": {"type": 4},
      "0x9003": {"type": "boolean", "value": true}, "0x9004": {"type": "integers"}},
    "faults": [
      {"object": "module", "capability": "Children", "children": [0, -1, 256]},
      {"object": "data", "command": "CapStart", "capability": "Acquire", "skip": 1, "times": 2, "delayMs": 5,
       "completion": {"result": "DataTransFailure", "polls": 10, "twice": true}, "stopAfter": 3,
       "delivery": {"first": 2, "drop": true, "record": {"ulStart": 7}}},
      {"answer": -115, "doAnyway": true, "enum": {"elementSize": -2}}]})",
                                          9);
  const auto setting = [&](uint32_t id) {
    return *std::find_if(file.settings.begin(), file.settings.end(), [id](const auto& s) { return s.id == id; });
  };
  EXPECT_EQ(std::get<Enumeration>(setting(kNkMAIDCapability_Aperture).value).current, 4u);
  for (const Capability& expected :
       {Capability::strings(kNkMAIDCapability_WBMode, {"Auto", "Shade"}, 5),
        Capability::unsignedInteger(kNkMAIDCapability_SaveMedia, 1), Capability::integer(0x9001, -3),
        Capability::ofValueType(36866, 4), Capability::boolean(0x9003, true), Capability::integers(0x9004, {})})
    EXPECT_EQ(setting(expected.id), expected);
  EXPECT_EQ(file.withoutCapabilities, (Ids{kNkMAIDCapability_FreeBytes}));
  EXPECT_TRUE(file.transfer.deliveryBytes == 4096 && file.transfer.inModulePolls);
  EXPECT_TRUE(file.capture.answer == kNkMAIDResult_NoError && file.fileTypes.at(".xyz") == 99);

  ASSERT_EQ(file.faults.size(), 3u);
  EXPECT_EQ(file.faults[0].camera, std::nullopt);
  EXPECT_EQ(file.faults[0].children, (Ids{0, 0xffffffff, 256}));
  const Fault& acquire = file.faults[1];
  EXPECT_EQ(acquire.camera, 9u);
  EXPECT_EQ(acquire.completionResult, kNkMAIDResult_DataTransFailure);
  EXPECT_TRUE(acquire.delivery.concerns(2) && !acquire.delivery.concerns(3));
  tagNkMAIDFileInfo info{1, 2, 3, 4, 5};
  acquire.delivery.edit(info);
  EXPECT_EQ(std::pair(info.ulStart, info.ulLength), std::pair(7u, 5u));
  tagNkMAIDEnum header{};
  file.faults[2].editEnum(header);
  EXPECT_EQ(header.elementSize, -2);
}

TEST(CameraFileTest, SaysWhatIsWrong) {
  for (const char* text : {"", "[]", R"({"pair": true})", R"({"pairs": 1})", R"({"settings": {"Apperture": "f/8"}})",
                           R"({"settings": {"Aperture": "f/9"}})", R"({"settings": {"0x9001": 5}})",
                           R"({"settings": {"BatteryLevel": 3000000000}})", R"({"settings": {"FreeBytes": -1}})",
                           R"({"transfer": {"deliveryBytes": 1.5}})", R"({"faults": [{"answer": "Broken"}]})",
                           R"({"faults": {}})", R"({"settings": {"WBMode": {"type": "lists"}}})"})
    EXPECT_THROW(parseCameraFile(text, 1), std::exception) << text;
}

}  // namespace
}  // namespace virtualcamera::test
