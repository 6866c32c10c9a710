// `tether` and its helper, ended at any moment: every picture is accounted for.

#include <poll.h>
#include <spawn.h>
#include <sys/inotify.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <fstream>
#include <random>
#include <set>
#include <thread>

#include "Helper.h"

extern char** environ;

namespace tether {
namespace {

namespace fs = std::filesystem;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kRuns = 24;
#else
constexpr int kRuns = 100;
#endif
constexpr int kAtOnce = 8;
constexpr int kPictures = 5;

// Notes its number and becomes the helper.
fs::path helperScript() { return fs::temp_directory_path() / ("interrupt." + std::to_string(getpid()) + ".helper"); }

enum Victim { kCommand, kHelper, kBoth, kCommandPolitely };

// One run: `tether watch` saves a camera's pictures, beside them or into another file system, and at the nth event
// among the files or somewhat later the victim is killed.
class Interruption {
 public:
  Interruption(int number, Victim victim, bool copies, int event, std::chrono::microseconds delay)
      : victim_(victim), copies_(copies), lives_(victim == kHelper || victim == kCommandPolitely) {
    const std::string name = "interrupt." + std::to_string(getpid()) + "." + std::to_string(number);
    folder_ = fs::temp_directory_path() / name;
    out_ = copies ? "/dev/shm" / fs::path(name) : folder_ / "out";
    fs::create_directories(folder_ / "tmp");
    fs::create_directory(out_);
    std::ofstream(out_ / "Capture0002.jpg") << "mine";
    const fs::path camera = folder_ / "cameras/1-Studio";
    drop(camera / "camera.json", R"({"transfer": {"deliveryBytes": 20000, "bytesPerSecond": 5000000}})");
    for (int i = 0; i < kPictures; ++i) {
      sources_.push_back(pattern(150'000, static_cast<unsigned>(number * kPictures + i + 1)));
    }
    start();
    shoot(1);
    awaitEvent(event);
    std::this_thread::sleep_for(delay);
    endIt();
    account();
  }
  ~Interruption() {
    fs::remove_all(out_);
    fs::remove_all(folder_);
  }

 private:
  void start() {
    watch_ = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    inotify_add_watch(watch_, out_.c_str(), kEvents);
    inotify_add_watch(watch_, (folder_ / "tmp").c_str(), IN_CREATE);
    std::string shell = "sh";
    std::string option = "-c";
    std::string script = "cd '" + folder_.string() + "'; TMPDIR=$PWD/tmp TETHER_VIRTUAL_CAMERAS=$PWD/cameras exec '" +
                         TETHER_COMMAND "' watch --json --helper '" + helperScript().string() + "' --output '" +
                         out_.string() + "' >out.json 2>err";
    char* const words[] = {shell.data(), option.data(), script.data(), nullptr};
    ASSERT_EQ(posix_spawn(&command_, "/bin/sh", nullptr, nullptr, words, environ), 0);
  }
  // Once the camera has been seen by the nth helper: what lies there before is on its card.
  void shoot(std::size_t nth) const {
    awaitCondition("connection", [&] {
      const std::string told = readFile(folder_ / "out.json");
      std::size_t times = 0;
      for (std::size_t at = 0; (at = told.find("\"connected\"", at)) != std::string::npos; ++at) ++times;
      return times >= nth;
    });
    for (std::size_t i = 0; i < sources_.size(); ++i) {
      drop(folder_ / "cameras/1-Studio" / (std::to_string(nth) + std::to_string(i) + ".jpg"), sources_[i]);
    }
  }
  // Or the end of all there will be.
  void awaitEvent(int left) {
    alignas(inotify_event) char bytes[4096];
    const auto limit = Clock::now() + std::chrono::minutes(1);
    while (left > 0 && saved() < kPictures && Clock::now() < limit) {
      pollfd ready{watch_, POLLIN, 0};
      poll(&ready, 1, 100);
      const ssize_t got = read(watch_, bytes, sizeof bytes);
      for (ssize_t at = 0; at < got;) {
        const auto* const event = reinterpret_cast<const inotify_event*>(bytes + at);
        const bool isFolder = (event->mask & IN_ISDIR) != 0;
        if (isFolder) inotify_add_watch(watch_, (folder_ / "tmp" / event->name).c_str(), kEvents);
        const bool isRecord = event->len > 0 && std::string_view(event->name).starts_with(".record");
        if (!isFolder && !isRecord) --left;
        at += static_cast<ssize_t>(sizeof *event + event->len);
      }
    }
    close(watch_);
  }
  void endIt() {
    const pid_t helper = helpers().at(0);
    if (victim_ == kCommand || victim_ == kBoth) kill(command_, SIGKILL);
    if (victim_ == kHelper || victim_ == kBoth) kill(helper, SIGKILL);
    if (victim_ == kHelper) shoot(2);
    if (victim_ == kHelper)
      awaitCondition("second helper's pictures", [&] { return saved("_started\"") == kPictures; });
    if (lives_) kill(command_, SIGTERM);
    int status = 0;
    waitpid(command_, &status, 0);
    // What was in transfer when the helper was killed did not come.
    const bool told =
        WIFEXITED(status) && (WEXITSTATUS(status) == 130 || (victim_ == kHelper && WEXITSTATUS(status) == 4));
    EXPECT_TRUE(!lives_ || told) << status;
    if (!lives_) waitpid(helper, nullptr, 0);  // its parent is gone: it is ours
  }
  // The next one, whose helper ends at once.
  void takeUpWhatIsLeft() const {
    const std::string line = "cd '" + folder_.string() + "'; TMPDIR=$PWD/tmp '" + TETHER_COMMAND +
                             "' capture --helper /bin/false --output '" + out_.string() + "' 2>err";
    EXPECT_EQ(WEXITSTATUS(std::system(line.c_str())), 5);
  }
  void account() const {
    const std::size_t told = saved();
    const std::size_t visible = picturesThere();
    EXPECT_TRUE(visible == told || (!lives_ && visible == told + 1)) << visible << " there, told " << told;
    if (!lives_) takeUpWhatIsLeft();
    const std::string errors = readFile(folder_ / "err");
    const bool unsure = victim_ == kBoth && errors.find("may not be whole") != std::string::npos;
    std::vector<int> there(kPictures), left(kPictures);
    for (const auto& entry : fs::directory_iterator(out_)) {
      if (entry.path().filename() == "Capture0002.jpg") continue;
      const auto picture = pictureIn(entry.path());
      EXPECT_TRUE(picture < kPictures || unsure) << entry.path() << " is cut";
      if (picture < kPictures) ++there[picture];
    }
    EXPECT_EQ(readFile(out_ / "Capture0002.jpg"), "mine");
    for (const auto& entry : fs::recursive_directory_iterator(folder_ / "tmp")) {
      const auto picture = entry.is_regular_file() ? pictureIn(entry.path()) : kPictures;
      EXPECT_TRUE(victim_ == kHelper) << entry.path() << " is left";
      EXPECT_TRUE(!entry.is_regular_file() || errors.find(entry.path()) != std::string::npos) << entry.path();
      if (picture < kPictures) ++left[picture];
    }
    for (std::size_t i = 0; i < kPictures; ++i) {
      // They are taken in order: what came after one that is not there shows that this one was lost.
      EXPECT_TRUE(i == 0 || there[i] + left[i] == 0 || there[i - 1] + left[i - 1] > 0) << i - 1 << " is lost";
      EXPECT_LE(there[i], static_cast<int>(helpers().size())) << i << " is doubled";
    }
  }

  std::size_t picturesThere() const {
    return static_cast<std::size_t>(std::count_if(fs::directory_iterator(out_), {}, [](const auto& entry) {
      const std::string name = entry.path().filename();
      return name[0] != '.' && name != "Capture0002.jpg";
    }));
  }
  // Which picture a file is; none: kPictures.
  std::size_t pictureIn(const fs::path& file) const {
    return static_cast<std::size_t>(std::find(sources_.begin(), sources_.end(), readFile(file)) - sources_.begin());
  }
  std::vector<pid_t> helpers() const {
    std::ifstream file(folder_ / "pids");
    return {std::istream_iterator<pid_t>(file), {}};
  }
  // How many files it said it saved, and which are there, behind the line with a word.
  std::size_t saved(const std::string& word = "") const {
    std::set<std::string> paths;
    std::ifstream lines(folder_ / "out.json");
    bool counts = word.empty();
    for (std::string line; std::getline(lines, line);) {
      counts = counts || line.find(word) != std::string::npos;
      const auto at = line.find(out_.string());
      if (counts && at != std::string::npos) paths.insert(line.substr(at, line.find('"', at) - at));
    }
    return static_cast<std::size_t>(
        std::count_if(paths.begin(), paths.end(), [](auto& path) { return fs::exists(path); }));
  }

  static constexpr std::uint32_t kEvents = IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB | IN_MOVE | IN_DELETE;
  const Victim victim_;
  const bool copies_;
  const bool lives_;  // the command
  fs::path folder_;
  fs::path out_;
  std::vector<std::string> sources_;
  pid_t command_ = -1;
  int watch_ = -1;
};

TEST(Interrupted, AHundredTimesNoPictureIsLostCutDoubledOrOverwritten) {
  ASSERT_EQ(prctl(PR_SET_CHILD_SUBREAPER, 1), 0);
  // Before there are threads: a file that is open for writing, in a child just forked too, cannot be executed.
  std::ofstream(helperScript()) << "#!/bin/sh\necho $$ >>pids\nexec '" TETHER_HELPER "'\n";
  fs::permissions(helperScript(), fs::perms::owner_all);
  const bool other = access("/dev/shm", W_OK) == 0;
  std::atomic<int> next{0};
  std::vector<std::thread> threads;
  const auto work = [&] {
    for (int number; (number = next++) < kRuns;) {
      std::mt19937 random(static_cast<unsigned>(number));
      const bool copies = other && number % 8 >= 4;
      const int event = 1 + static_cast<int>(random() % (copies ? 48 : 28));
      const std::chrono::microseconds delay(number % 16 < 8 ? 0 : random() % 20'000);
      SCOPED_TRACE("run " + std::to_string(number) + ", event " + std::to_string(event));
      EXPECT_NO_THROW(Interruption(number, static_cast<Victim>(number % 4), copies, event, delay));
    }
  };
  for (int i = 0; i < kAtOnce; ++i) threads.emplace_back(work);
  for (auto& thread : threads) thread.join();
  fs::remove(helperScript());
}

}  // namespace
}  // namespace tether
