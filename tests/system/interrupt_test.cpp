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
      drop(camera / (std::to_string(i) + ".jpg"), sources_.back());
    }
    start();
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
        if (!isFolder) --left;
        at += static_cast<ssize_t>(sizeof *event + event->len);
      }
    }
    close(watch_);
  }
  void endIt() {
    const pid_t helper = helpers().at(0);
    if (victim_ == kCommand || victim_ == kBoth) kill(command_, SIGKILL);
    if (victim_ == kHelper || victim_ == kBoth) kill(helper, SIGKILL);
    if (victim_ == kHelper)
      awaitCondition("second helper's pictures", [&] { return saved("_started\"") == kPictures; });
    if (lives_) kill(command_, SIGTERM);
    int status = 0;
    waitpid(command_, &status, 0);
    EXPECT_TRUE(!lives_ || (WIFEXITED(status) && WEXITSTATUS(status) == 130)) << status;
    if (!lives_) waitpid(helper, nullptr, 0);  // its parent is gone: it is ours
  }
  void account() const {
    std::vector<int> there(kPictures), left(kPictures);
    std::size_t visible = 0, hidden = 0;
    for (const auto& entry : fs::directory_iterator(out_)) {
      if (entry.path().filename() == "Capture0002.jpg") continue;
      const bool isHidden = entry.path().filename().string()[0] == '.';
      ++(isHidden ? hidden : visible);
      const auto picture = pictureIn(entry.path());
      EXPECT_TRUE(isHidden || picture < kPictures) << entry.path() << " is cut";
      if (!isHidden && picture < kPictures) ++there[picture];
    }
    EXPECT_EQ(readFile(out_ / "Capture0002.jpg"), "mine");
    EXPECT_LE(hidden, !lives_ && copies_ ? 1U : 0U);
    EXPECT_TRUE(visible == saved() || (!lives_ && visible == saved() + 1)) << visible << " there, told " << saved();
    const std::string told = readFile(folder_ / "err");
    for (const auto& entry : fs::recursive_directory_iterator(folder_ / "tmp")) {
      if (!entry.is_regular_file()) continue;
      const auto picture = pictureIn(entry.path());
      EXPECT_TRUE(picture < kPictures || victim_ == kHelper || victim_ == kBoth) << entry.path() << " is cut";
      EXPECT_TRUE(!lives_ || told.find(entry.path()) != std::string::npos) << entry.path() << " is not named";
      if (picture < kPictures) ++left[picture];
    }
    int twice = 0;
    for (std::size_t i = 0; i < kPictures; ++i) {
      // They are taken in order: what came after one that is not there shows that this one was lost.
      EXPECT_TRUE(i == 0 || there[i] + left[i] == 0 || there[i - 1] + left[i - 1] > 0) << i - 1 << " is lost";
      EXPECT_LE(there[i], static_cast<int>(helpers().size()));
      if (there[i] > 0 && left[i] > 0) ++twice;
    }
    EXPECT_TRUE(victim_ == kHelper || twice == 0 || (twice == 1 && !lives_ && copies_));
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
