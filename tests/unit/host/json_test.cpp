// docs/json.md has an example of every object that is printed, and of no other.
#include <map>
#include <set>

#include "Tether.h"

namespace {

using namespace fake;
using testing::HasSubstr;

using Shapes = std::map<std::string, std::set<std::string>>;  // by event: the keys, in order, as far as they are fixed

// Keys of a nested tally belong to it; a payload may be anything.
void addShape(Shapes& shapes, const nlohmann::ordered_json& object) {
  std::string keys;
  for (const auto& [key, value] : object.items()) {
    keys += key + " ";
    if (!value.is_object() || key == "payload") continue;
    for (const auto& inner : value.items()) keys += key + "/" + inner.key() + " ";
  }
  shapes[object["event"]].insert(keys);
}

Shapes shapesIn(const std::string& text, const std::string& prefix) {
  Shapes shapes;
  std::istringstream lines(text);
  for (std::string line; std::getline(lines, line);) {
    if (line.rfind(prefix, 0) == 0) addShape(shapes, nlohmann::ordered_json::parse(line.substr(prefix.size() - 1)));
  }
  return shapes;
}

TEST(JsonTest, ThePageHasEveryObjectThatIsPrintedAndNoOther) {
  struct Run {
    const char* script;
    const char* line;
  };
  const Run runs[] = {
      {"start: add 257 Cam; picture a.jpg", "list"},
      {R"({"start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}}], "heartbeat": 20,
        "on": {"connectDevice": [[{"reply": "ok"}]], "getCameraSettings": [[{"reply": "ok", "payload": {}}]]}})",
       "settings"},
      {"", "messages --count 1"},
      {"doCapture: short a.jpg | - | picture b.jpg", "capture --count 3 --timeout 4 --output \"$(printf 'f\\352te')\""},
      {"connectDevice: error; remove 257; add 258 Cam | ok; announce a.nef+; break; log x; after 800 picture b.jpg; "
       "after 900 announce c.jpg 90000; after 6000 exit 1\n---\nconnectDevice: ok; picture a.jpg",
       "watch --count 2 --timeout 4"},
  };
  Shapes printed;
  std::mutex lock;
  checkAll(runs, [&](const Run& run) {
    Tether tether;
    tether.run(run.script, run.line + std::string(" --json"), "cd " + tether.files.path());
    for (const auto& [event, shapes] : shapesIn(tether.output(), "{")) {
      const std::lock_guard guard(lock);
      printed[event].insert(shapes.begin(), shapes.end());
    }
  });
  std::ifstream file(JSON_PAGE);
  const std::string page{std::istreambuf_iterator<char>(file), {}};
  const Shapes documented = shapesIn(page, "    {");
  EXPECT_EQ(printed, documented);
}

TEST(JsonTest, PathsAreAbsoluteAndExactAndAFileIsTheSameThroughout) {
  Tether tether;
  EXPECT_EQ(tether.run("doCapture: picture a.nef+; picture a.jpg+; exit 1\n---\ndoCapture: picture a.jpg",
                       "capture --count 2 --json --output \"$(printf 'f\\352te')\"", "cd " + tether.files.path()),
            0)
      << tether.errors();
  const auto saved = tether.objects("saved");
  ASSERT_EQ(saved.size(), 3U);
  const std::string folder = tether.files.path() + "/f%eate/";
  const std::vector<std::string> names{"a.nef", "a.jpg", "a-2.jpg"};
  for (std::size_t i = 0; i < saved.size(); ++i) {
    EXPECT_EQ(saved[i]["number"], i + 1);
    EXPECT_EQ(saved[i]["pair"], i < 2 ? Json(1) : Json());
    EXPECT_EQ(saved[i]["shutter"], i < 2 ? 1 : 2);
    EXPECT_EQ(saved[i]["name"], names[i]);
    EXPECT_THAT(saved[i]["path_bytes"].get<std::string>(), testing::EndsWith("/f%eate/" + names[i]));
    EXPECT_EQ(saved[i]["camera"], "Cam");
  }
  EXPECT_EQ(saved[2]["capture_id"], 1);
  const Json result = tether.objects().back();
  EXPECT_EQ(result["status"], 0);
  EXPECT_EQ(result["error"], Json());
}

}  // namespace
