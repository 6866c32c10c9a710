// The check for camera modules: good modules pass, and what is wrong with a broken one is named.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

namespace tether {
namespace {

namespace fs = std::filesystem;

// A module, how it is broken (what BROKEN names, or the virtual camera's camera.json), and a line that this brings.
struct Case {
  std::string library;
  std::string how;
  std::string line;

  friend std::ostream& operator<<(std::ostream& out, const Case& test) { return out << test.line; }
};

Case virtualCamera(const std::string& file, const std::string& line) { return {VIRTUAL_CAMERA_MODULE, file, line}; }
Case broken(const std::string& how, const std::string& line) { return {BROKEN_MODULE, how, line}; }
// A fault of an object in calls of that command.
Case fault(const std::string& object, const std::string& command, const std::string& rest, const std::string& line) {
  return virtualCamera(R"({"transfer": {"deliveryBytes": 1000}, "faults": [{"object": ")" + object +
                           R"(", "command": ")" + command + "\", " + rest + "}]}",
                       line);
}

const std::string kGood = "keeps the contract";

const Case kCases[] = {
    broken("", kGood),
    {EXAMPLE_KIT_MODULE, "", "1 camera, 2 pictures transferred: " + kGood},
    virtualCamera(R"({"pairs": true})", "1 camera, 4 pictures transferred: " + kGood),
    virtualCamera(R"({"transfer": {"inModulePolls": true, "deliveryBytes": 1000}})", kGood),
    virtualCamera(R"({"capture": {"answer": "OutOfFocus"}})", "note: camera 1: CapStart Capture answered OutOfFocus"),
    {"/etc/passwd", "", "library: it is no whole library"},
    {MODULE_WITHOUT_ENTRY, "", "it exports no MAIDEntryPoint"},
    // The process.
    broken("crashes", "camera 1: CapGet Aperture: crashed"),
    broken("exits", "camera 1: CapGet Aperture: ended the process with status 3"),
    fault("camera", "CapGet", R"("capability": "Aperture", "delayMs": 60000)", "camera 1: CapGet Aperture: it did not"),
    fault("module", "Async", R"("times": 1, "delayMs": 3000)", "module: Async took "),
    broken("prints", "it wrote to standard output: Aperture"),
    broken("reads", "it has read from standard input"),
    broken("closes", "descriptor 0 or 1 is closed"),
    broken("lock", "no lock held while calling back"),
    // Objects and what they announce.
    broken("fails", "module: Open answered MissingComponent"),
    broken("client", "the client reference left alone"),
    broken("no count", "GetCapInfo with room for one capability less answered NoError and wrote"),
    fault("camera", "GetCapInfo", R"("answer": "NoError")", "GetCapInfo left record 1 of"),
    virtualCamera(R"({"faults": [{"object": "module", "capability": "Children", "children": [0, 1, 256]}]})",
                  "Children lists the id 0"),
    fault("module", "Async", R"("answer": "HardwareError")", "module: Async answered HardwareError"),
    fault("data", "Close", R"("answer": "HardwareError", "doAnyway": true)", "Close answered HardwareError"),
    virtualCamera(R"({"alive": false})", "it is listed, and its IsAlive is false"),
    // Values.
    broken("long name", "CapGet Name wrote outside the 256 bytes"),
    broken("wide number", "CapGet BatteryLevel wrote outside the 4 bytes"),
    fault("camera", "CapGet", R"("capability": "Name", "unterminated": true)", "a string of Name has no end"),
    fault("camera", "CapGetArray", R"("capability": "Aperture", "unterminated": true)",
          "strings of Aperture have no end"),
    fault("camera", "CapGetArray", R"("capability": "Sensitivity", "anyArraySize": true)", kGood),
    fault("camera", "CapGet", R"("capability": "Sensitivity", "enum": {"elementCount": 9})",
          "answered BufferSize to 9"),
    fault("camera", "CapGet", R"("capability": "Sensitivity", "enum": {"currentIndex": 7})", "is 7, of 7 elements"),
    fault("camera", "CapGet", R"("capability": "Sensitivity", "enum": {"elementSize": 2})",
          "the element size of the type"),
    virtualCamera(R"({"settings": {"Aperture": {"type": 4}}})", "it announces Aperture with value type 4"),
    // Callbacks.
    broken("completes at once", "its completion of Capture came inside CapStart of camera 1"),
    broken("wrong reference", "a completion came with a reference that no start had"),
    broken("late event", "came after its Close"),
    fault("data", "CapStart", R"("completion": {"none": true})", "Acquire did not go on for 1 s"),
    fault("data", "CapStart", R"("completion": {"twice": true})", "its completion of Acquire came twice"),
    fault("data", "CapStart", R"("completion": {"afterClose": true})",
          "its completion of Acquire came after its Close"),
    fault("data", "CapStart", R"("ownThread": true)", "came on a thread of the module's own"),
    // Pictures.
    fault("data", "CapStart", R"("answer": "DeviceBusy")", "CapStart Acquire answered DeviceBusy"),
    fault("data", "CapStart", R"("stopAfter": 2)", "Acquire completed with DataTransFailure"),
    fault("data", "CapStart", R"("delivery": {"first": 1, "drop": true})",
          "delivery 2 brings 1000 bytes at 2000 after 1000"),
    fault("data", "CapStart", R"("delivery": {"count": 999, "record": {"totalLength": 99}})",
          "StoredBytes and delivers 99"),
    fault("data", "CapStart", R"("delivery": {"count": 999, "record": {"dataType": 1}})", "the file flag, 0x10"),
    fault("data", "CapStart", R"("delivery": {"count": 999, "record": {"fileDataType": 3}})",
          "note: data object of item 1"),
    fault("data", "CapStart", R"("delivery": {"count": 999, "drop": true})",
          "completed with NoError after 0 of 0 bytes"),
    virtualCamera(R"({"pairs": true, "faults": [{"object": "data", "capability": "RawJpegImageStatus", "skip": 1,
                      "answer": "HardwareError"}]})",
                  "item 2 of camera 1: it comes after item 1 of camera 1, a half of a pair"),
};

class ModuleCheck : public testing::TestWithParam<Case> {
 protected:
  ModuleCheck() { fs::create_directories(folder / "1-Studio"); }
  ~ModuleCheck() override { fs::remove_all(folder); }
  const fs::path folder = fs::path(testing::TempDir()) / ("module-check-" + std::to_string(getpid()));
};

TEST_P(ModuleCheck, PassesWhatIsGoodAndNamesWhatIsBroken) {
  const auto& [library, how, line] = GetParam();
  setenv("TETHER_VIRTUAL_CAMERAS", folder.c_str(), 1);
  setenv("BROKEN", how.c_str(), 1);
  std::ofstream(folder / "1-Studio/camera.json") << how;
  FILE* const output = popen((std::string(CHECK_MODULE) + " --patience 1 " + library).c_str(), "r");
  ASSERT_NE(output, nullptr);
  std::string said;
  for (int c = 0; (c = std::fgetc(output)) != EOF;) said += static_cast<char>(c);
  const bool isGood = WEXITSTATUS(pclose(output)) == 0;
  EXPECT_EQ(isGood, said.find(kGood) != std::string::npos) << said;
  EXPECT_NE(said.find(line), std::string::npos) << how << "\n" << said;
}

INSTANTIATE_TEST_SUITE_P(All, ModuleCheck, testing::ValuesIn(kCases));

}  // namespace
}  // namespace tether
