// Real cameras: the helper, the module for libgphoto2, that library as it is, and a camera on the loopback that does as
// it is told.

#include <csignal>
#include <cstdlib>
#include <iterator>
#include <set>
#include <sstream>

#include "Helper.h"
#include "ptpip/Picture.h"

namespace tether {
namespace {

namespace fs = std::filesystem;
using Names = std::vector<std::string>;

constexpr double kFirst = 0x0201;

class TestCamera {
 public:
  explicit TestCamera(const Names& orders = {}) {
    const Pipe input = Pipe::make(), output = Pipe::make();
    _process = std::make_unique<HelperProcess>(
        HelperProcess::Start{PTPIP_CAMERA, {}, input.read.get(), output.write.get(), -1, -1, {}});
    _orders.open("/dev/fd/" + std::to_string(input.write.get()));
    _answers.open("/dev/fd/" + std::to_string(output.read.get()));
    _answers >> _port >> _port;
    for (const std::string& order : orders) obey(order);
  }
  // What it answered, beyond "ok".
  Names obey(const std::string& order) {
    _orders << order << std::endl;
    std::string line = "note";
    while (line.empty() || line.starts_with("note"))
      if (!std::getline(_answers, line)) throw std::runtime_error("the test camera has ended");
    std::istringstream words(line);
    const Names answer{std::istream_iterator<std::string>(words), {}};
    EXPECT_EQ(answer.at(0), "ok") << order;
    return {answer.begin() + 1, answer.end()};
  }
  std::string address() const { return "ptpip:127.0.0.1:" + _port + ":" + _port; }

 private:
  std::unique_ptr<HelperProcess> _process{};
  std::ofstream _orders{};
  std::ifstream _answers{};
  std::string _port{};
};

class RealCamera : public HelperTest {
 protected:
  void begin(Helper& of, const std::string& addresses) const {
    of.install("Type0002Module", GPHOTO2_MODULE);
    of.setEnvironment("HOME", of.folder());
    of.setEnvironment("TETHER_STATE", state.path());
    of.setEnvironment("TETHER_CAMERAS", addresses);
    of.setEnvironment("ASAN_OPTIONS", "detect_leaks=0");  // the library's own
    of.start();
    connectNext(of);
  }
  static double connectNext(Helper& of) {
    const double device = of.await("deviceAdded").number("device_id");
    of.send(request("connectDevice", 1, device));
    EXPECT_EQ(of.awaitAnswer(1).name, "ok");
    return device;
  }
  // These and no others, each byte; the two of a pair one after the other, under one name.
  static void expectPictures(Helper& of, const Names& names) {
    const auto base = [](const std::string& name) { return fs::path(name).stem(); };
    const bool pairs = names.size() > 1 && base(names[0]) == base(names[1]);
    std::multiset<std::string> missing(names.begin(), names.end());
    std::string last;
    for (std::size_t i = 0; i < names.size(); ++i) {
      const fs::path path = of.await("fileDownloadComplete").text("file_path");
      const std::string bytes = readFile(path);
      const auto found = std::find_if(missing.begin(), missing.end(), [&](const std::string& name) {
        return ptpip::Picture{.name = name, .size = bytes.size()}.bytes(0, bytes.size()) == bytes;
      });
      ASSERT_NE(found, missing.end()) << path << " is none of the camera's";
      missing.erase(found);
      fs::remove(path);
      const Received& added = of.await("objectWasAdded");
      EXPECT_EQ(added.number("has_sidecar") != 0, pairs);
      EXPECT_TRUE(!pairs || i % 2 == 0 || path.stem() == last) << path;
      last = path.stem();
    }
  }
  // No more than it was asked for, either.
  static void expectUntouched(TestCamera& camera, Helper& of) {
    of.send(request("getCameraSettings", 99, kFirst));
    EXPECT_EQ(of.awaitAnswer(99).name, "ok");
    EXPECT_EQ(of.count("objectWasAdded"), of.count("fileDownloadComplete"));
    const Names counts = camera.obey("counts");
    EXPECT_EQ(counts.at(0), "deletes=0");
    EXPECT_EQ(counts.at(1), "writes=0");
  }

  testkit::Folder state{};
};

struct Course {
  const char* title;
  Names before, then;  // orders before somebody connects, and after that
  const char* shots = "shoot";
};
void PrintTo(const Course& course, std::ostream* out) { *out << course.title; }

class WholePictures : public RealCamera, public testing::WithParamInterface<Course> {};

const Course kCourses[] = {
    {"Pair", {"fill 300", "roll NEF+JPG 3000000+700000"}, {}, "shoot 3"},
    {"PairTheOtherWayRound", {"roll JPG+NEF 700000+3000000"}, {}},
    {"Burst", {"roll JPG 20000"}, {}, "shoot 300"},
    {"Large", {"roll JPG 200000000"}, {}},
    {"NoPieces", {"without 101B", "roll NEF+JPG 3000000+700000"}, {"fault 1009 cut 1500000"}},
    {"Cut", {"roll NEF+JPG 3000000+700000"}, {"fault 101B cut 1500000"}, "shoot 2"},
    {"LateAnswer", {"roll JPG 5000000"}, {"fault 101B stall 2500000 ms=3500"}},
    {"NoAnswer", {"roll JPG 5000000"}, {"fault 101B lose skip=2"}},
    {"OtherSizes", {"roll JPG 5000000"}, {"fault 101B clip 0 skip=2", "fault 101B more 9"}},
    {"Refusals", {"roll JPG 5000000"}, {"fault 101B answer 2019 times=3", "fault 101B answer 2002 skip=4"}},
    {"NoWordOfThePicture", {"roll NEF+JPG 30000+20000"}, {"fault 1008 answer 2019"}, "shoot 2"},
    {"NonsenseOfThePicture", {"roll JPG 30000"}, {"fault 1008 garbage"}, "shoot 2"},
    {"NoEvents", {"roll JPG 30000"}, {"cut events"}, "shoot 2"},
};

TEST_P(WholePictures, ComeOnceWhateverTheCameraAnswers) {
  TestCamera camera(GetParam().before);
  begin(helper, camera.address());
  for (const std::string& order : GetParam().then) camera.obey(order);
  expectPictures(helper, camera.obey(GetParam().shots));
  expectUntouched(camera, helper);
}
INSTANTIATE_TEST_SUITE_P(All, WholePictures, testing::ValuesIn(kCourses),
                         [](const auto& one) { return std::string(one.param.title); });

TEST_F(RealCamera, TellsItsSettingsAndTheirChangesAndWhyItTookNoPicture) {
  TestCamera camera({"free 0"});
  begin(helper, camera.address());
  const Received& told = helper.await("cameraSettingsChanged");
  EXPECT_EQ(told.text("isoSpeed") + " " + told.text("aperture") + " " + told.text("batteryLevel"), "200 f/5.6 80%");
  camera.obey("set 500F 800");
  std::int32_t id = 1;
  awaitCondition("change", [&] {
    helper.send(request("getCameraSettings", ++id, kFirst));
    return helper.awaitAnswer(id).text("isoSpeed") == "800";
  });
  helper.send(request("doCapture", 2));
  awaitCondition("refusal", [&] { return helper.standardError().find("PTP Store Full") != std::string::npos; });
  camera.obey("free 64000000000");
  helper.send(request("doCapture", 3));
  expectPictures(helper, {"TEST0001.JPG"});
}

// One falls silent in the middle of a picture, is given up, and comes back.
TEST_F(RealCamera, HoldsUpNeitherTheHelperNorAnotherCamera) {
  TestCamera silent({"serial 1", "roll JPG 3000000"}), other({"serial 2", "roll JPG 3000000"});
  begin(helper, silent.address() + " " + other.address());
  connectNext(helper);
  silent.obey("fault 101B stall 1500000");
  const Names owed = silent.obey("shoot");
  helper.await("objectWasAdded");
  silent.obey("silence all");
  expectPictures(helper, other.obey("shoot 3"));
  const double gone = helper.await("deviceRemoved").number("device_id");
  EXPECT_GT(helper.count("heartbeat"), 2U);
  for (const char* order : {"unplug", "silence none", "resume", "plug"}) silent.obey(order);
  EXPECT_EQ(connectNext(helper), gone);
  expectPictures(helper, owed);
}

TEST_F(RealCamera, LosesAndDoublesNothingWhenTheHelperIsKilled) {
  TestCamera camera({"roll NEF+JPG 3000000+700000"});
  begin(helper, camera.address());
  expectPictures(helper, camera.obey("shoot"));
  camera.obey("link 1000000");
  Names owed = camera.obey("shoot");
  helper.await("objectWasAdded");
  kill(helper.pid(), SIGKILL);
  EXPECT_NE(helper.wait(), 0);
  camera.obey("link 0");
  for (const std::string& name : camera.obey("shoot 2")) owed.push_back(name);
  Helper next;
  begin(next, camera.address());
  expectPictures(next, owed);
  expectUntouched(camera, next);
  next.closeInput();
  EXPECT_EQ(next.wait(), 0);
}

TEST_F(RealCamera, KeepsTheContractOfModules) {
  TestCamera camera({"roll NEF+JPG 3000000+700000"});
  const std::string command = "ASAN_OPTIONS=detect_leaks=0 HOME='" + state.path().string() +
                              "' TETHER_CAMERAS=" + camera.address() + " " CHECK_MODULE " " GPHOTO2_MODULE;
  EXPECT_EQ(std::system(command.c_str()), 0);
}

}  // namespace
}  // namespace tether
