// A folder as cameras: what appears in it, what the shutter takes, what camera.json changes.
#include <gtest/gtest.h>
#include <jpeglib.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>

#include "Client.h"
#include "FolderFeed.h"
#include "OwnPicture.h"

namespace virtualcamera::test {
namespace {

namespace fs = std::filesystem;

struct DriverTest : testing::Test {
  DriverTest() {
    fs::remove_all(root);
    fs::create_directories(root);
    feed = std::make_unique<FolderFeed>(model, root.string());
  }
  ~DriverTest() override {
    feed.reset();
    fs::remove_all(root);
  }

  void put(const fs::path& name, const std::string& content) {
    fs::create_directories((root / name).parent_path());
    std::ofstream(root / name, std::ios::binary) << content;
  }
  // Written elsewhere and moved in, long ago as far as the time stamp goes.
  void moveIn(const fs::path& name, const std::string& content) {
    put(".arriving", content);
    fs::last_write_time(root / ".arriving", fs::file_time_type::clock::now() - std::chrono::hours(1));
    fs::create_directories((root / name).parent_path());
    fs::rename(root / ".arriving", root / name);
  }
  // Looks until it is so; far longer than it should take.
  template <typename Condition>
  bool comesTrue(Condition condition) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (!condition() && std::chrono::steady_clock::now() < end) {
      feed->look();
      std::this_thread::yield();
    }
    return condition();
  }
  bool has(uint32_t id, size_t items) {
    return comesTrue([&] { return model.camera(id) != nullptr && model.camera(id)->items().size() == items; });
  }
  static std::vector<uint8_t> transfer(Client& device, uint32_t item) {
    Opened open(device, item);
    open.data.start(kNkMAIDCapability_Acquire);
    EXPECT_EQ(open.data.finish(), kNkMAIDResult_NoError);
    return open.data.received();
  }
  static std::string text(const std::vector<uint8_t>& bytes) { return {bytes.begin(), bytes.end()}; }

  fs::path root = fs::path(testing::TempDir()) / ("virtual-cameras-" + std::to_string(getpid()));
  Model model;
  std::unique_ptr<FolderFeed> feed;
};

TEST_F(DriverTest, FoldersThatAppearAndGoAreCamerasPluggedInAndOut) {
  fs::create_directory(root / "1-Studio");
  fs::create_directory(root / "none");
  fs::create_directory(root / "2nd");
  put("3-file", "no folder");
  EXPECT_TRUE(comesTrue([&] { return model.cameras() == std::vector<uint32_t>{1}; }));
  EXPECT_EQ(model.camera(1)->name(), "Studio");
  fs::create_directory(root / "12-Left - right");
  EXPECT_TRUE(comesTrue([&] { return model.cameras() == (std::vector<uint32_t>{1, 12}); }));
  EXPECT_EQ(model.camera(12)->name(), "Left - right");
  fs::rename(root / "1-Studio", root / "1-Renamed");
  EXPECT_TRUE(comesTrue([&] { return model.camera(1)->name() == "Renamed"; }));
  fs::remove_all(root);
  EXPECT_TRUE(comesTrue([&] { return model.cameras().empty(); }));
}

TEST_F(DriverTest, AFileIsShotOnceWhenItIsWholeAndOfAKnownType) {
  moveIn("1-One/before.JPG", "jpeg");
  moveIn("1-One/notes.txt", "text");
  moveIn("1-One/.hidden.jpg", "hidden");
  put("1-One/empty.jpg", "");
  EXPECT_TRUE(has(1, 1));
  moveIn("1-One/b.tiff", "tiff");
  moveIn("1-One/c.ndf", "ndf");
  put("1-One/empty.jpg", "not any more");
  EXPECT_TRUE(has(1, 4));

  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  std::multiset<std::pair<uint32_t, std::string>> seen;
  for (const uint32_t id : device.children()) {
    Opened open(device, id);
    open.data.start(kNkMAIDCapability_Acquire);
    open.data.finish();
    seen.emplace(open.data.deliveries[0].info.fileDataType, text(open.data.received()));
  }
  EXPECT_EQ(seen, (std::multiset<std::pair<uint32_t, std::string>>{
                      {1, "jpeg"}, {1, "not any more"}, {2, "tiff"}, {257, "ndf"}}));
  moveIn("1-One/before.JPG", "another file of the same name");
  EXPECT_TRUE(has(1, 1));
  EXPECT_TRUE(fs::exists(root / "1-One/b.tiff"));
}

TEST_F(DriverTest, ARawAndAJpegOfOneNameAreAPairAndWaitForEachOther) {
  put("1-One/camera.json", R"({"pairs": true})");
  fs::create_directory(root / "1-One/.new");
  EXPECT_TRUE(has(1, 0));
  moveIn("1-One/shot.jpg", "J");
  feed->look();
  EXPECT_TRUE(has(1, 0));
  moveIn("1-One/shot.nef", "RR");
  EXPECT_TRUE(has(1, 2));
  moveIn("1-One/alone.jpg", "JJJ");  // comes once the grace is over
  EXPECT_TRUE(has(1, 3));

  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  std::vector<std::pair<uint32_t, uint32_t>> status;
  for (const uint32_t id : {1u, 2u, 3u}) {
    Opened open(device, id);
    status.emplace_back(open.data.getUnsigned(kNkMAIDCapability_StoredBytes),
                        open.data.getUnsigned(kNkMAIDCapability_RawJpegImageStatus));
  }
  EXPECT_EQ(status, (std::vector<std::pair<uint32_t, uint32_t>>{{2, 1}, {1, 1}, {3, 0}}));
}

std::pair<int, int> decodedSize(const std::vector<uint8_t>& jpeg) {
  jpeg_decompress_struct decoder{};
  jpeg_error_mgr errors{};
  decoder.err = jpeg_std_error(&errors);
  jpeg_create_decompress(&decoder);
  jpeg_mem_src(&decoder, jpeg.data(), jpeg.size());
  EXPECT_EQ(jpeg_read_header(&decoder, TRUE), JPEG_HEADER_OK);
  jpeg_start_decompress(&decoder);
  std::vector<JSAMPLE> line(size_t{decoder.output_width} * static_cast<size_t>(decoder.output_components));
  JSAMPROW row = line.data();
  while (decoder.output_scanline < decoder.output_height) jpeg_read_scanlines(&decoder, &row, 1);
  jpeg_finish_decompress(&decoder);
  EXPECT_EQ(errors.num_warnings, 0);
  const std::pair<int, int> size(decoder.output_width, decoder.output_height);
  jpeg_destroy_decompress(&decoder);
  return size;
}

TEST_F(DriverTest, TheShutterTakesTheRollThenPicturesOfItsOwn) {
  moveIn("1-One/roll/b.jpg", "second, JPEG");
  moveIn("1-One/roll/a.jpg", "first");
  moveIn("1-One/roll/b.nef", "second, RAW");
  EXPECT_TRUE(has(1, 0));
  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  const auto capture = [&] {
    device.start(kNkMAIDCapability_Capture);
    EXPECT_EQ(device.finish(), kNkMAIDResult_NoError);
  };
  capture();
  capture();
  EXPECT_EQ(text(transfer(device, 1)), "first");
  EXPECT_EQ(text(transfer(device, 2)), "second, RAW");
  EXPECT_EQ(text(transfer(device, 3)), "second, JPEG");
  capture();
  EXPECT_EQ(decodedSize(transfer(device, 4)), (std::pair<int, int>{960, 640}));

  put("1-One/camera.json", R"({"pairs": true, "capture": {"completeEvent": false}})");
  ASSERT_TRUE(comesTrue([&] {
    const size_t before = model.camera(1)->items().size();
    capture();
    return model.camera(1)->items().size() == before + 2;
  }));
  const std::vector<uint8_t> raw = transfer(device, model.camera(1)->items()[model.camera(1)->items().size() - 2]);
  EXPECT_EQ(std::string(raw.begin(), raw.begin() + 4), std::string("II*\0", 4));
}

TEST_F(DriverTest, OwnPicturesShowTheirNumber) {
  EXPECT_NE(ownJpeg(1, "Camera", 0), ownJpeg(2, "Camera", 0));
  EXPECT_NE(ownJpeg(1, "Camera", 0), ownJpeg(1, "Other", 0));
  EXPECT_EQ(decodedSize(ownJpeg(4'000'000'000, std::string(300, 'x') + "\xc3\xa9", 0)).first, 960);
  EXPECT_EQ(ownRaw(1).size(), ownRaw(2).size());
}

TEST_F(DriverTest, TheCameraFileIsReadAgainWhenItChangesAndKeptWhenItIsWrong) {
  put("1-One/camera.json", R"({"name": "By file", "settings": {"BatteryLevel": 10, "Capture": null},
                               "faults": [{"object": "camera", "command": "CapGet", "capability": "Name",
                                           "times": 1, "answer": "HardwareError"}]})");
  EXPECT_TRUE(has(1, 0));
  Client module(Model::entryPoint(), nullptr, 0);
  Client device(module, 1);
  EXPECT_EQ(device.getString(kNkMAIDCapability_Name), "!");
  EXPECT_EQ(device.getString(kNkMAIDCapability_Name), "By file");
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_NotSupported);
  const auto battery = [&] {
    int32_t value = -1;
    device.get(kNkMAIDCapability_BatteryLevel, kNkMAIDDataType_IntegerPtr, &value);
    return value;
  };
  EXPECT_EQ(battery(), 10);
  testing::internal::CaptureStderr();
  put("1-One/camera.json", R"({"settings": {"BatteryLevel": )");
  moveIn("1-One/a.jpg", "looked at after the file");
  EXPECT_TRUE(has(1, 1));
  EXPECT_NE(testing::internal::GetCapturedStderr().find("camera.json: "), std::string::npos);
  EXPECT_EQ(battery(), 10);
  put("1-One/camera.json", R"({"settings": {"BatteryLevel": 11}})");
  EXPECT_TRUE(comesTrue([&] { return battery() == 11; }));
  EXPECT_EQ(device.start(kNkMAIDCapability_Capture), kNkMAIDResult_Pending);
  fs::remove(root / "1-One/camera.json");
  EXPECT_TRUE(comesTrue([&] { return battery() == 85; }));
}

TEST(CameraFileTest, ReadsEverySettingTypeAndShorthand) {
  const CameraFile file = parseCameraFile(R"({
    "alive": false,
    "transfer": {"deliveryBytes": 4096, "bytesPerSecond": 1000000, "inModulePolls": true},
    "capture": {"polls": 3, "answer": "NoError"},
    "fileTypes": {".XYZ": 99},
    "settings": {
      "Aperture": "f/8", "Sensitivity": 800, "ExposureMode": 1, "FreeBytes": null, "SaveMedia": 1,
      "WBMode": {"type": "strings", "values": ["Auto", "Shade"], "current": 5},
      "0x9001": {"type": "integer", "value": -3}, "36866": {"type": 4},
      "0x9003": {"type": "boolean", "value": true}, "0x9004": {"type": "integers"}}})",
                                          1);
  const auto setting = [&](uint32_t id) {
    return *std::find_if(file.settings.begin(), file.settings.end(), [id](const auto& s) { return s.id == id; });
  };
  EXPECT_EQ(std::get<Enumeration>(setting(kNkMAIDCapability_Aperture).value).current, 4u);
  EXPECT_EQ(std::get<Enumeration>(setting(kNkMAIDCapability_Sensitivity).value).current, 3u);
  EXPECT_EQ(std::get<Enumeration>(setting(kNkMAIDCapability_ExposureMode).value).current, 1u);
  EXPECT_EQ(std::get<uint32_t>(setting(kNkMAIDCapability_SaveMedia).value), 1u);
  EXPECT_EQ(setting(kNkMAIDCapability_WBMode), Capability::strings(kNkMAIDCapability_WBMode, {"Auto", "Shade"}, 5));
  EXPECT_EQ(setting(0x9001), Capability::integer(0x9001, -3));
  EXPECT_EQ(setting(36866), Capability::ofValueType(36866, 4));
  EXPECT_EQ(setting(0x9003), Capability::boolean(0x9003, true));
  EXPECT_EQ(setting(0x9004), Capability::integers(0x9004, {}));
  EXPECT_EQ(file.withoutCapabilities, (std::vector<uint32_t>{kNkMAIDCapability_FreeBytes}));
  EXPECT_EQ(file.transfer.deliveryBytes, 4096u);
  EXPECT_TRUE(file.transfer.inModulePolls);
  EXPECT_EQ(file.capture.answer, kNkMAIDResult_NoError);
  EXPECT_EQ(file.fileTypes.at(".xyz"), 99u);
}

TEST(CameraFileTest, ReadsFaults) {
  const CameraFile file = parseCameraFile(R"({"faults": [
    {"object": "module", "capability": "Children", "children": [0, -1, 256]},
    {"object": "data", "command": "CapStart", "capability": "Acquire", "skip": 1, "times": 2, "delayMs": 5,
     "completion": {"result": "DataTransFailure", "polls": 10, "twice": true}, "stopAfter": 3,
     "delivery": {"first": 2, "drop": true, "record": {"ulStart": 7}}},
    {"answer": -115, "doAnyway": true, "enum": {"elementSize": -2}}]})",
                                          9);
  ASSERT_EQ(file.faults.size(), 3u);
  EXPECT_EQ(file.faults[0].camera, std::nullopt);
  EXPECT_EQ(file.faults[0].children, (std::vector<uint32_t>{0, 0xffffffff, 256}));
  const Fault& acquire = file.faults[1];
  EXPECT_EQ(acquire.camera, 9u);
  EXPECT_EQ(acquire.completionResult, kNkMAIDResult_DataTransFailure);
  EXPECT_TRUE(acquire.delivery.concerns(2) && !acquire.delivery.concerns(3));
  tagNkMAIDFileInfo info{1, 2, 3, 4, 5};
  acquire.delivery.edit(info);
  EXPECT_EQ(info.ulStart, 7u);
  EXPECT_EQ(info.ulLength, 5u);
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
