// A folder as cameras: what appears in it, what the shutter takes, what camera.json changes.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "Client.h"
#include "FolderFeed.h"

namespace virtualcamera::test {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using camerakit::test::Client;
using camerakit::test::Opened;
using Ids = std::vector<uint32_t>;
using Texts = std::vector<std::string>;

// With what the system tells, and without. Nothing is at rest unless it is dated back.
struct DriverTest : testing::TestWithParam<bool> {
  static fs::path made(const fs::path& folder) {
    fs::create_directories(folder);
    return folder;
  }
  ~DriverTest() override { fs::remove_all(top); }

  void dateBack(const fs::path& name) {
    fs::last_write_time(root / name, fs::file_time_type::clock::now() - 2h - ++written * 1s);
  }
  void put(const fs::path& name, const std::string& content) {
    fs::create_directories((root / name).parent_path());
    std::ofstream(root / name, std::ios::binary) << content;
    dateBack(name);
  }
  void moveIn(const fs::path& name, const std::string& content) {
    put("new", content);
    fs::rename(root / "new", root / name);
  }
  void remove(const fs::path& name) const { fs::remove(root / name); }
  void unplug() {
    fs::rename(root / "1-One", top / "1-One");
    EXPECT_TRUE(comesTrue([&] { return model.cameras().empty(); }));
  }
  void plugIn() {
    fs::rename(top / "1-One", root / "1-One");
    EXPECT_TRUE(has(0));
  }
  // Looks until it is so; far longer than it should take.
  template <typename Condition>
  bool comesTrue(Condition condition) {
    const auto end = std::chrono::steady_clock::now() + 20s;
    bool holds = false;
    while (!(holds = condition()) && std::chrono::steady_clock::now() < end) {
      feed.look();
      std::this_thread::yield();
    }
    return holds;
  }
  bool has(size_t items) {
    return comesTrue([&] { return model.camera(1) != nullptr && model.camera(1)->items().size() >= items; });
  }
  // Transfers what is there once there are so many; the two of a pair with a sign.
  Texts taken(size_t pictures) {
    EXPECT_TRUE(has(pictures));
    Client module;
    Client device(module, 1);
    Texts texts;
    for (const uint32_t id : model.camera(1)->items()) {
      Opened open(device, id);
      const bool pair = open.data.number(kNkMAIDCapability_RawJpegImageStatus) != 0;
      EXPECT_EQ(open.transfer(), kNkMAIDResult_NoError);
      texts.push_back((pair ? "+" : "") + open.data.received);
    }
    return texts;
  }

  const bool told = GetParam();
  fs::path top = fs::path(testing::TempDir()) / ("virtual-cameras-" + std::to_string(getpid()));
  fs::path root = made(top / "in");
  int written = 0;
  Model model;
  FolderFeed feed{model, root.string(), {told ? systemFolderEvents() : std::make_shared<FolderEvents>(), 1h}};
};

INSTANTIATE_TEST_SUITE_P(Events, DriverTest, testing::Bool());

TEST_P(DriverTest, FoldersThatAppearAndGoAreCamerasPluggedInAndOut) {
  for (const char* name : {"1-Studio", "none", "2nd"}) fs::create_directory(root / name);
  put("3-file", "no folder");
  EXPECT_TRUE(comesTrue([&] { return model.cameras() == Ids{1}; }));
  fs::create_directory(root / "12-Left - right");
  EXPECT_TRUE(comesTrue([&] { return model.cameras() == Ids{1, 12}; }));
  EXPECT_EQ(model.camera(12)->name(), "Left - right");
  fs::rename(root / "1-Studio", root / "1-Renamed");
  EXPECT_TRUE(comesTrue([&] { return model.camera(1) && model.camera(1)->name() == "Renamed"; }));
  fs::last_write_time(root, fs::file_time_type::clock::now() + 24h);
  FolderWatch watch(root);
  EXPECT_TRUE(comesTrue([&] { return !watch.changed(); })) << "a time stamp in the future keeps it busy";
  fs::remove_all(root);
  EXPECT_TRUE(comesTrue([&] { return model.cameras().empty(); }));
}

TEST_P(DriverTest, EveryNewFileIsShotOnceWhenItIsWholeAndWhatTheCameraCameWithNever) {
  for (const char* name : {"1-One/card.jpg", "1-One/card.nef"}) put(name, "on the card");
  EXPECT_TRUE(has(0));
  std::ofstream slow;
  const std::vector<std::pair<std::function<void()>, Texts>> days{
      {[&] { put("1-One/a.JPG", "1"); }, {"1"}},
      {[&] { put("1-One/a.JPG", "2"); }, {"2"}},
      {[&] { remove("1-One/a.JPG"), put("1-One/a.JPG", "3"); }, {"3"}},
      {[&] { moveIn("1-One/a.JPG", "4"); }, {"4"}},
      {[&] { put("1-One/card.jpg", "over the card"); }, {"over the card"}},
      {[&] { fs::rename(root / "1-One/card.nef", root / "1-One/b.nef"); }, {}},
      {[&] { told ? dateBack("1-One/a.JPG") : void(); }, {}},
      {[&] { mkfifo((root / "1-One/pipe.jpg").c_str(), 0600); }, {}},
      {[&] { fs::create_symlink("loop.jpg", root / "1-One/loop.jpg"); }, {}},
      {[&] { put("1-One/notes.txt", "no"), put("1-One/.hidden.jpg", "no"), put("1-One/empty.jpg", ""); }, {}},
      {[&] { put("1-One/empty.jpg", "no more"); }, {"no more"}},
      {[&] { slow.open(root / "1-One/slow.jpg"), slow << "begin" << std::flush, put("1-One/c.ndf", "5"); }, {"5"}},
      {[&] { slow << " and end", slow.close(), dateBack("1-One/slow.jpg"); }, {"begin and end"}},
      {[&] { unplug(), plugIn(); }, {}},
      {[&] { unplug(), fs::rename(top / "1-One/c.ndf", top / "1-One/d.ndf"), plugIn(); }, {}},
      {[&] { put("1-One/e.tif", "left"), has(1), unplug(), plugIn(); }, {"left"}},
      {[&] { put("1-One/f.tif", "deleted"), has(1), unplug(), fs::remove(top / "1-One/f.tif"), plugIn(); }, {}},
      {[&] { unplug(), put("../1-One/g.jpg", "J"), put("../1-One/g.nef", "R"), plugIn(); }, {"+R", "+J"}},
      {[&] { put("1-One/last.jpg", "last"); }, {"last"}},
  };
  for (size_t day = 0; day < days.size(); ++day) {
    days[day].first();
    EXPECT_EQ(taken(days[day].second.size()), days[day].second) << "day " << day;
  }
}

TEST_P(DriverTest, AHalfWaitsForItsPartnerAndAPictureThatIsCutIsNotTransferred) {
  put("1-One/camera.json", R"({"pairs": true})");
  EXPECT_TRUE(has(0));
  moveIn("1-One/shot.jpg", "J");
  feed.look();
  moveIn("1-One/shot.nef", "R");
  EXPECT_EQ(taken(2), (Texts{"+R", "+J"}));
  moveIn("1-One/single.jpg", "S");
  EXPECT_EQ(taken(1), (Texts{"S"})) << "once the grace of its other half is over";
  for (const auto& change : {+[](const fs::path& file) { fs::resize_file(file, 35); },
                             +[](const fs::path& file) { fs::remove(file), mkfifo(file.c_str(), 0600); }}) {
    moveIn("1-One/cut.ndf", std::string(100, 'x'));
    EXPECT_TRUE(has(1));
    change(root / "1-One/cut.ndf");
    Client module;
    Client device(module, 1);
    const uint32_t id = model.camera(1)->items().back();
    EXPECT_EQ(Opened(device, id).transfer(), kNkMAIDResult_DataTransFailure);
    EXPECT_EQ(model.camera(1)->items(), Ids{id}) << "still there";
    model.camera(1)->removeItem(id);
  }
}

TEST_P(DriverTest, TheShutterTakesTheRollThenPicturesOfItsOwn) {
  put("1-One/roll/b.jpg", "second, JPEG");
  put("1-One/roll/a.jpg", "first");
  put("1-One/roll/b.nef", "second, RAW");
  mkfifo((root / "1-One/roll/0.jpg").c_str(), 0600);
  EXPECT_TRUE(has(0));
  Texts all;
  const auto capture = [&] {
    Client module;
    Client device(module, 1);
    device.start(kNkMAIDCapability_Capture);
    EXPECT_EQ(device.finish(), kNkMAIDResult_NoError);
    const size_t pictures = model.camera(1)->items().size();
    for (std::string& text : taken(1)) all.push_back(std::move(text));
    return pictures;
  };
  for (int shot = 0; shot < 3; ++shot) capture();
  put("1-One/roll/a.jpg", "over the first");
  capture();
  std::ofstream slow(root / "1-One/roll/c.jpg");
  slow << (told ? "begin" : "") << std::flush;
  put("1-One/camera.json", R"({"pairs": true, "capture": {"completeEvent": false}})");
  ASSERT_TRUE(comesTrue([&] { return capture() == 2; }));
  const std::string last = all.back(), raw = all.rbegin()[1], own = all[3];
  all.resize(5), all.erase(all.begin() + 3);
  EXPECT_EQ(all, (Texts{"first", "+second, RAW", "+second, JPEG", "over the first"}));
  EXPECT_TRUE(own.starts_with("\xff\xd8\xff") && own.ends_with("\xff\xd9"));
  EXPECT_TRUE(raw.starts_with(std::string("+II*\0", 5)) && last.starts_with("+\xff\xd8\xff"));
  EXPECT_TRUE("+" + own != last) << "the number is in the picture";
}

TEST_P(DriverTest, TheCameraFileIsReadAgainWhenItChangesAndKeptWhenItIsWrong) {
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
  const fs::path json = root / "1-One/camera.json";
  const auto write = [&](const std::string& text) { put("1-One/camera.json", text); };
  for (const std::function<void()>& spoil : std::initializer_list<std::function<void()>>{
           [&] { write(R"({"settings": {"BatteryLevel": )"); }, [&] { write(std::string(2 << 20, ' ') + "{}"); },
           [&] { write(R"({"faults": [{"object": )" + std::string(100'000, '[')); },
           [&] { remove(json), mkfifo(json.c_str(), 0600); },
           [&] { remove(json), fs::create_symlink("camera.json", json); }}) {
    testing::internal::CaptureStderr();
    spoil();
    moveIn("1-One/a.jpg", "looked at after the file");
    EXPECT_EQ(taken(1).size(), 1u);
    EXPECT_NE(testing::internal::GetCapturedStderr().find("camera.json: "), std::string::npos);
    EXPECT_EQ(battery(), 10u);
  }
  remove(json);
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
    "faults": [{"object": "module", "capability": "Children", "children": [0, -1, 256]}, {"object": "data"}]})",
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

  ASSERT_EQ(file.faults.size(), 2u);
  EXPECT_EQ(file.faults[0].children, (Ids{0, 0xffffffff, 256}));
  EXPECT_TRUE(!file.faults[0].camera && file.faults[1].camera == 9u) << "the module is not the camera's";
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
