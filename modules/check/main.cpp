// check_module [--patience SECONDS] FILE: checks a camera module. Exit status 0 when it keeps the contract, 1 when it
// breaks it, 2 when there is nothing to check.
//
// The module is loaded into a child process, whose standard input and output are pipes as the helper's are. This one
// watches: a crash, a hang and an exit are findings like others.
#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Context.h"
#include "Course.h"

namespace modulecheck {
namespace {

using namespace std::chrono_literals;

constexpr auto kWatchInterval = 50ms;
constexpr auto kGrace = 3s;  // for what finds by itself that something does not go on
constexpr int kUsage = 2;

struct Arguments {
  std::string path;
  std::chrono::milliseconds patience{30'000};
};

// A folder that makes a module bundle of a library wherever that stands.
class BundleFolder {
 public:
  explicit BundleFolder(const std::string& library) {
    const char* const temporary = std::getenv("TMPDIR");
    _root = std::string(temporary == nullptr ? "/tmp" : temporary) + "/check-module-XXXXXX";
    if (mkdtemp(_root.data()) == nullptr) return;
    const size_t slash = library.rfind('/');
    _bundle = _root + library.substr(slash) + ".bundle";
    _folder = _bundle + "/Contents/" TETHER_BUNDLE_PLATFORM;
    mkdir(_bundle.c_str(), 0700);
    mkdir((_bundle + "/Contents").c_str(), 0700);
    // The folder, not the file: what the library looks for beside itself is there.
    if (symlink(slash == 0 ? "/" : library.substr(0, slash).c_str(), _folder.c_str()) != 0) _bundle.clear();
  }
  ~BundleFolder() {
    unlink(_folder.c_str());
    rmdir((_bundle + "/Contents").c_str());
    rmdir(_bundle.c_str());
    rmdir(_root.c_str());
  }
  BundleFolder(const BundleFolder&) = delete;
  BundleFolder& operator=(const BundleFolder&) = delete;

  const std::string& path() const { return _bundle; }

 private:
  std::string _root;
  std::string _bundle;
  std::string _folder;
};

struct Child {
  pid_t pid = 0;
  int output = -1;  // what the module writes to standard output
};

bool parse(int argc, char** argv, Arguments& arguments) {
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--patience") == 0 && i + 1 < argc) {
      const int seconds = std::atoi(argv[++i]);
      if (seconds < 1) return false;
      arguments.patience = std::chrono::seconds(seconds);
    } else if (argv[i][0] == '-' || !arguments.path.empty()) {
      return false;
    } else {
      arguments.path = argv[i];
    }
  }
  return !arguments.path.empty();
}

[[noreturn]] void runChild(const Arguments& arguments, Shared& shared, int input, int output, int findings) {
  dup2(input, STDIN_FILENO);
  dup2(output, STDOUT_FILENO);
  for (const int number : {SIGPIPE, SIGXFSZ}) std::signal(number, SIG_IGN);
  Report report(shared, findings);
  // Left behind: a thread of the module's own may still be about to call back.
  auto* const context = new Context(report, arguments.patience);
  auto* const course = new Course(*context);
  course->run(arguments.path);
  std::fflush(nullptr);  // what the module has printed, and would be written some day
  shared.finished = true;
  _exit(0);
}

Child start(const Arguments& arguments, Shared& shared) {
  int input[2];
  int output[2];
  if (pipe(input) != 0 || pipe(output) != 0) return {};
  static_cast<void>(!write(input[1], "request", 7));
  const int findings = fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, 10);
  const Child child{fork(), output[0]};
  if (child.pid == 0) {
    runChild(arguments, shared, input[0], output[1], findings);
  }
  close(output[1]);
  fcntl(output[0], F_SETFL, O_NONBLOCK);
  return child;
}

// What the threads of the child were doing, of those that have been at it for so long.
std::string activities(const Shared& shared, Clock::duration atLeast) {
  std::string all;
  for (const Activity& activity : shared.activities) {
    const int64_t since = activity.since;
    if (!activity.taken || since == 0 || Clock::now() - Clock::time_point(Clock::duration(since)) < atLeast) continue;
    all += (all.empty() ? "" : ", or ") + std::string(activity.text);
  }
  return all;
}

void readInto(std::string& text, int descriptor) {
  char bytes[4096];
  for (ssize_t count = 0; (count = read(descriptor, bytes, sizeof bytes)) > 0;) {
    text.append(bytes, static_cast<size_t>(count));
  }
}

void complainOfOutput(Report& report, const std::string& text) {
  if (text.empty()) return;
  std::string shown = text.substr(0, std::min<size_t>(text.find('\n'), 60));
  for (char& c : shown) c = c >= ' ' && c <= '~' ? c : '.';
  report.fault("module", "module", "it wrote to standard output: " + shown, "nothing there, which is the host's");
}

void watch(const Child& child, const Arguments& arguments, Shared& shared) {
  Report report(shared, STDOUT_FILENO);
  std::string written;
  bool hung = false;
  int status = 0;
  for (auto last = Clock::now(); waitpid(child.pid, &status, WNOHANG) == 0;) {
    pollfd ready{child.output, POLLIN, 0};
    poll(&ready, 1, static_cast<int>(kWatchInterval.count()));
    readInto(written, child.output);
    const auto late = Clock::now() - last - kWatchInterval;
    last = Clock::now();
    if (late > kWatchInterval) shared.late += late.count();
    const std::string hanging = activities(shared, arguments.patience + kGrace);
    if (hanging.empty() || hung) continue;
    hung = true;
    report.fault("", hanging, "it did not return for " + std::to_string(arguments.patience / 1s) + " s",
                 "calls that return; nothing after this was checked");
    kill(child.pid, SIGKILL);
  }
  readInto(written, child.output);
  complainOfOutput(report, written);
  if (hung || shared.finished) return;
  std::string where = activities(shared, 0s);
  if (where.empty()) where = "module";
  const std::string how = WIFSIGNALED(status) ? std::string("crashed: ") + strsignal(WTERMSIG(status))
                                              : "ended the process with status " + std::to_string(WEXITSTATUS(status));
  report.fault("", where, how, "a module that leaves the process alive; nothing after this was checked");
}

std::string counted(int count, const std::string& noun) {
  return std::to_string(count) + " " + noun + (count == 1 ? "" : "s");
}

int run(const Arguments& arguments) {
  char path[PATH_MAX];
  if (realpath(arguments.path.c_str(), path) == nullptr) {
    std::perror(arguments.path.c_str());
    return kUsage;
  }
  const BundleFolder bundle(path);
  Shared& shared = makeShared();
  const Child child = start({bundle.path(), arguments.patience}, shared);
  if (child.pid <= 0) {
    std::perror("check_module");
    return kUsage;
  }
  watch(child, arguments, shared);
  const std::string seen =
      counted(shared.cameras, "camera") + ", " + counted(shared.pictures, "picture") + " transferred: ";
  const std::string verdict =
      shared.faults == 0 ? "keeps the contract" : "breaks the contract, " + counted(shared.faults, "fault");
  std::printf("%s%s\n", seen.c_str(), verdict.c_str());
  return shared.faults == 0 ? EXIT_SUCCESS : EXIT_FAILURE;
}

}  // namespace
}  // namespace modulecheck

int main(int argc, char** argv) {
  modulecheck::Arguments arguments;
  if (modulecheck::parse(argc, argv, arguments)) return modulecheck::run(arguments);
  std::fprintf(stderr, "usage: check-module [--patience SECONDS] FILE\n");
  return modulecheck::kUsage;
}
