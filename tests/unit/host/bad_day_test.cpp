// What `capture` and `watch` say and how they end when something goes wrong: rows of two tables.
#include <cmath>
#include <map>
#include <set>

#include "Tether.h"

namespace {

using namespace fake;
using testing::ContainsRegex;
using testing::ElementsAreArray;
using testing::HasSubstr;

struct Row {
  const char* title;
  std::string script;
  std::string options;
  int status;
  Texts said;        // on standard error
  Texts saved;       // files
  Texts shown = {};  // on standard output
};

void check(const std::string& command, const Row& row) {
  SCOPED_TRACE(row.title);
  Tether tether;
  EXPECT_EQ(tether.run(row.script, command + " " + row.options), row.status);
  for (const std::string& text : row.said) EXPECT_THAT(tether.errors(), HasSubstr(text));
  EXPECT_EQ(tether.errors().empty(), row.said.empty()) << tether.errors();
  for (const std::string& text : row.shown) EXPECT_THAT(tether.output(), ContainsRegex(text));
  EXPECT_THAT(tether.out.names(), ElementsAreArray(row.saved));
}

TEST(BadDayTest, Capture) {
  const Row table[] = {
      {"all is well",
       "doCapture: picture a.nef+; picture a.jpg+ | picture b.jpg",
       "--count 2",
       0,
       {},
       {"a.jpg", "a.nef", "b.jpg"}},
      {"a shutter without a picture",
       "doCapture: picture a.jpg | - | picture c.jpg",
       "--count 3 --timeout 4",
       4,
       {"tether: shutter 2 failed: no picture came within 4.0 s\n", "tether: 1 of 3 pictures are missing\n"},
       {"a.jpg", "c.jpg"}},
      {"in a series it is told from the next one's",
       "doCapture: picture a.jpg | - | picture c.jpg",
       "--count 3 --timeout 4 --every 0.6",
       4,
       {"shutter 2 failed"},
       {"a.jpg", "c.jpg"}},
      {"a transfer that breaks off",
       "doCapture: announce a.jpg; break | picture b.jpg",
       "--count 2",
       4,
       {"a.jpg was not received: its transfer broke off\n", "1 of 2"},
       {"b.jpg"}},
      {"the next announcement proves it",
       "doCapture: announce a.jpg; picture b.jpg",
       "",
       4,
       {"and the next picture's began"},
       {"b.jpg"},
       {"perhaps another's"}},
      {"a pair's other file",
       "doCapture: picture a.nef+ | picture b.jpg",
       "--count 2 --timeout 4",
       4,
       {"the other file of a.nef did not come"},
       {"a.nef", "b.jpg"}},
      {"the helper knows why",
       "doCapture: log No room for the 5 bytes of a.jpg: File too large",
       "--timeout 4",
       4,
       {"no picture came within 4.0 s; the helper says: No room for the 5 bytes of a.jpg: File too large\n"},
       {}},
      {"a temporary folder that is gone",
       "doCapture: rmdir; log Could not create a file",
       "--timeout 4",
       4,
       {"within 4.0 s; the helper says: Could not create a file; its temporary folder /", " is gone\n"},
       {}},
      {"a transfer takes its time",
       "doCapture: announce a.jpg 90000; after 5000 complete",
       "--timeout 4",
       0,
       {"tether: a.jpg is still being received after 4."},
       {"a.jpg"}},
      {"what was there before",
       "start: add 257 Cam; picture old.nef; picture older.nef\ndoCapture: picture a.jpg",
       "--count 2",
       0,
       {},
       {"a-2.jpg", "a.jpg", "old.nef", "older.nef"},
       {"old.nef  1.0 kB  [0-9.]* s  Cam  another's\n", "a.jpg  1.0 kB"}},
      {"what others shoot meanwhile",
       "doCapture: picture a.jpg; after 400 picture b.jpg | picture c.jpg",
       "--count 2 --every 1",
       0,
       {},
       {"a.jpg", "b.jpg", "c.jpg"},
       {"b.jpg  1.0 kB  [0-9.]* s  Cam  another's\n"}},
      {"a file that is not what was announced",
       "doCapture: short a.jpg | picture b.jpg",
       "--count 2",
       6,
       {"could not save a.jpg in /"},
       {"b.jpg"}},
      {"ten in a row",
       "doCapture: picture a.jpg | -",
       "--count 50 --every 0 --timeout 3",
       4,
       {"10 shutters in a row brought no picture; 49 of 50"},
       {"a.jpg"}},
      {"unplugged in mid-transfer",
       "doCapture: announce a.jpg; remove 257; after 100 break",
       "--count 2",
       3,
       {"tether: Cam was unplugged while a.jpg was being received\ntether: a.jpg was not received: Cam was unplugged\n"
        "tether: Cam has gone; 2 of 2 pictures are missing\n"},
       {}},
      {"unplugged while it shoots", "doCapture: remove 257", "", 3, {"shutter 1 failed: Cam was unplugged\n"}, {}},
      {"the helper dies in mid-transfer",
       "doCapture: picture a.jpg | announce b.jpg; kill 9\n---\ndoCapture: picture c.jpg",
       "--count 3",
       4,
       {"killed by signal 9", "b.jpg was not received", "starting it again", "1 of 3"},
       {"a.jpg", "c.jpg"}},
      {"the helper dies while it connects",
       "start: add 257 Cam; picture old.jpg; announce older.jpg\nconnectDevice: exit 9\n---\ndoCapture: picture a.jpg",
       "",
       4,
       {"older.jpg was not received: the helper ended (exit status 9)"},
       {"a.jpg", "old.jpg"}},
      {"two of one name",
       "start: add 257 Cam; add 513 Cam\nconnectDevice: ok\ndoCapture: picture a.jpg",
       "--camera 513",
       0,
       {},
       {"a.jpg"},
       {"kB  [0-9.]* s\n"}},
      {"another of its name instead",
       "start: add 513 Cam",
       "--camera 257",
       3,
       {"there is no camera 257; there is 513 (Cam)\n"},
       {}},
      {"a camera that does not come back",
       "start: add 257 Cam; add 513 Cam\ndoCapture: exit 1\n---\nstart: add 513 Cam\n",
       "--count 2",
       3,
       {"Cam has not come back"},
       {}},
      {"a camera that refuses", "connectDevice: error", "", 3, {"tether: connecting Cam failed: error 0\n"}, {}},
      {"a folder that cannot be", "", "--output /dev/null", 2, {"cannot make the folder /dev/null"}, {}},
      {"a folder that cannot be written", "", "--output /proc", 2, {"cannot write in the folder /proc: "}, {}},
  };
  checkAll(table, [](const Row& row) { check("capture", row); });
}

TEST(BadDayTest, Watch) {
  const Row table[] = {
      {"one that refuses keeps nobody from being connected",
       "start: add 257 A; add 513 B\nconnectDevice: error | ok | error; announce a.jpg; break; after 1900 picture "
       "b.jpg",
       "--count 1",
       4,
       {"tether: connecting A failed: error 0; trying again\n", "a.jpg was not received: its transfer broke off\n"},
       {"b.jpg"},
       {"B .513. connected\nb.jpg  1.0 kB  [0-9.]* s\n"}},
      {"two of one name",
       "start: add 257 Cam; add 513 Cam\nconnectDevice: ok; picture a.jpg",
       "--count 1 --camera 0513",
       0,
       {},
       {"a.jpg"},
       {"Cam .513. connected\n"}},
      {"a camera comes back",
       "connectDevice: ok; remove 257; add 258 Cam | ok; picture a.jpg",
       "--count 1 --camera Cam",
       0,
       {},
       {"a.jpg"},
       {"Cam .257. connected\nCam .257. has gone\nCam .258. is there\nCam .258. connected\n"}},
      {"a pair whose transfer takes its time",
       "connectDevice: ok; announce a.nef+ 90000; after 5000 complete; after 5200 picture a.jpg+",
       "--count 1 --timeout 4",
       0,
       {"a.nef is still being received"},
       {"a.jpg", "a.nef"}},
      {"what was given up and comes after all",
       "connectDevice: ok; announce a.nef+ 1; after 6000 complete; after 6200 picture a.jpg+",
       "--count 1 --timeout 4",
       0,
       {"a.nef was not received: its transfer has not ended after 4.", "a.nef came after all"},
       {"a.jpg", "a.nef"}},
      {"a transfer that breaks off",
       "connectDevice: ok; announce a.jpg 90000; break; after 1900 picture b.jpg",
       "--count 1",
       4,
       {"a.jpg was not received: its transfer broke off\ntether: 1 picture did not come\n"},
       {"b.jpg"}},
      {"a picture that only the log tells of",
       "connectDevice: ok; rmdir; log No file; after 500 log Writing a.jpg failed; after 510 announce a.jpg; "
       "after 1900 exit 1\n---\nconnectDevice: ok; picture b.jpg",
       "--count 1",
       4,
       {"a picture was not received: No file; its temporary folder /", "tether: 2 pictures did not come"},
       {"b.jpg"}},
      {"unplugged in mid-transfer",
       "connectDevice: ok; announce a.jpg; remove 257; after 100 break; after 800 add 258 Cam | ok; picture b.jpg",
       "--count 1",
       4,
       {"Cam was unplugged while a.jpg was being received\ntether: a.jpg was not received: Cam was unplugged\n"},
       {"b.jpg"}},
      {"what was complete when the helper died",
       "connectDevice: ok; picture a.jpg; exit 1\n---\nconnectDevice: ok; picture b.jpg",
       "--count 2",
       0,
       {"exit status 1); starting it again"},
       {"a.jpg", "b.jpg"}},
      {"a helper that always dies", "start: exit 9", "", 5, {"too often within a minute; giving up"}, {}},
      {"no camera",
       "start: picture a.jpg; pause 3500; picture b.jpg",
       "--count 2",
       0,
       {"tether: no camera yet; waiting for one\n"},
       {"a.jpg", "b.jpg"}},
  };
  checkAll(table, [](const Row& row) { check("watch", row); });
}

// Ctrl-C tells what went wrong before it, and what does not come within 5 seconds or until the next one.
TEST(BadDayTest, Interruption) {
  struct Case {
    const char* script;
    const char* line;
    const char* await;  // on standard error, "" for the first picture
    bool twice;
    int status;
  };
  const Case table[] = {
      {"doCapture: picture a.jpg", "capture --count 9 --every 60", "", false, 130},
      {"doCapture: picture b.jpg; announce a.jpg; break", "capture --count 9 --every 60", "broke off", false, 4},
      {"doCapture: short b.jpg", "capture --count 9 --every 60", "could not save", false, 6},
      {"doCapture: announce a.jpg 90000000", "capture --count 9 --timeout 4", "is still being", true, 4},
      {"connectDevice: ok; picture b.jpg; announce a.jpg 90000000; after 6500 complete", "watch --timeout 4",
       "is still being", false, 130},
      {"connectDevice: ok; picture b.jpg; log x", "watch", "the helper says: x", false, 130},
  };
  checkAll(table, [](const Case& row) {
    SCOPED_TRACE(row.script);
    Tether tether;
    tether.start(row.script, row.line);
    EXPECT_TRUE(row.await[0] == '\0' ? tether.awaitText("out", "a.jpg") : tether.awaitText("err", row.await));
    const int signal = row.twice ? SIGTERM : SIGINT;
    kill(tether.process, signal);
    if (row.twice) {
      EXPECT_TRUE(tether.awaitText("err", "waiting up to 5 seconds for 1 picture under way"));
      kill(tether.process, signal);
    }
    EXPECT_EQ(tether.wait(), row.status) << tether.errors();
    EXPECT_THAT(tether.errors(), HasSubstr("tether: interrupted"));
    EXPECT_EQ(tether.shutters(), std::string(row.line).find("capture") == 0 ? 1U : 0U);
  });
}

// The seconds of a minute in the time of an event.
double secondsOf(const Json& object) { return std::stod(object["time"].get<std::string>().substr(17, 6)); }

TEST(BadDayTest, ShuttersThatWereMissedAreNotMadeUpFor) {
  Tether tether;
  tether.start("doCapture: picture a.jpg", "capture --count 6 --every 0.4 --json");
  ASSERT_TRUE(tether.awaitText("out", "saved"));
  kill(tether.process, SIGSTOP);
  std::this_thread::sleep_for(2s);  // in which five are due
  kill(tether.process, SIGCONT);
  EXPECT_EQ(tether.wait(), 0) << tether.errors();
  const auto shutters = tether.objects("shutter");
  ASSERT_EQ(shutters.size(), 6U);
  for (std::size_t i = 1; i < shutters.size(); ++i) {
    EXPECT_GT(std::fmod(60 + secondsOf(shutters[i]) - secondsOf(shutters[i - 1]), 60), 0.28) << i;
  }
}

// One in fifty fails in each way there is, and the helper dies as often as it is started again.
TEST(BadDayTest, ANightInSmall) {
  constexpr int kShutters = 2000;
  std::string script = "doCapture: ";
  std::map<std::string, std::vector<int>> fates;
  for (int shutter = 1; shutter <= kShutters; ++shutter) {
    const std::string name = std::to_string(shutter) + ".jpg";
    const auto add = [&](const char* fate, const std::string& turn) {
      fates[fate].push_back(shutter);
      script += turn;
    };
    if (shutter % 900 == 7) {
      add("shutter_failed", "kill 9\n---\ndoCapture: ");
      continue;
    }
    if (shutter % 200 == 10) {  // few: each is waited for
      add("shutter_failed", (shutter % 400 == 10 ? "-" : "log No room for " + name) + " | ");
      continue;
    }
    switch (shutter % 50) {
      case 30:
        add("not_received", "announce " + name + " 90000000");
        break;
      case 40:
        add("not_saved", "short " + name);
        break;
      default:
        add("saved", "picture " + name);
    }
    script += " | ";
  }
  Tether tether;
  EXPECT_EQ(tether.run(script, "capture --json --every 0 --timeout 3 --count " + std::to_string(kShutters)), 6);
  const Json result = tether.objects("result").at(0);
  const std::size_t missing = fates["shutter_failed"].size() + fates["not_received"].size();
  const std::string error = std::to_string(fates["not_saved"].size()) + " pictures could not be saved; " +
                            std::to_string(missing) + " of 2000 pictures are missing";
  EXPECT_EQ(result["error"], error);
  EXPECT_EQ(result["shutters"], kShutters);
  EXPECT_EQ(result["others"], Json({{"saved", 0}, {"not_saved", 0}, {"missing", 0}}));
  EXPECT_EQ(result["own"],
            Json({{"saved", fates["saved"].size()}, {"not_saved", fates["not_saved"].size()}, {"missing", missing}}));
  std::set<int> numbers;
  for (const auto& [fate, shutters] : fates) {
    std::vector<int> told;
    for (const Json& object : tether.objects(fate)) {
      const int shutter = object["shutter"];
      told.push_back(shutter);
      if (fate == "shutter_failed") continue;
      EXPECT_EQ(object["name"], std::to_string(shutter) + ".jpg");
      EXPECT_TRUE(numbers.insert(object["number"].get<int>()).second);
    }
    std::sort(told.begin(), told.end());
    EXPECT_EQ(told, shutters) << fate;
  }
  EXPECT_EQ(tether.out.names().size(), fates["saved"].size());
  std::map<std::string, std::size_t> words;
  std::istringstream lines(tether.errors());
  for (std::string line; std::getline(lines, line);) {
    for (const char* const word : {" failed: ", " was not received: ", "could not save "}) {
      words[word] += line.find(word) != std::string::npos ? 1 : 0;
    }
  }
  EXPECT_EQ(words[" failed: "], fates["shutter_failed"].size());
  EXPECT_EQ(words[" was not received: "], fates["not_received"].size());
  EXPECT_EQ(words["could not save "], fates["not_saved"].size());
  EXPECT_THAT(tether.errors(), HasSubstr("tether: " + error + "\n"));
}

}  // namespace
