// `tether` as a process, on a scripted helper: what it says, what it leaves, and how it ends.
#pragma once

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>

#include <atomic>
#include <future>
#include <iterator>
#include <memory>
#include <nlohmann/json.hpp>

#include "Descriptors.h"
#include "Fake.h"

namespace fake {

using Texts = std::vector<std::string>;
using Json = nlohmann::json;

// Any number of them may run at a time, one run of each.
class Tether {
 public:
  Tether() = default;
  Tether(const Tether&) = delete;
  Tether& operator=(const Tether&) = delete;
  ~Tether() {
    if (process > 0) kill(process, SIGKILL);
    if (process > 0) waitpid(process, nullptr, 0);
  }

  // `line` is a command and its options. Pictures go to `out` where it does not say else. `before`: for the shell that
  // becomes tether, "exec >/dev/full" for one.
  void start(const std::string& script, const std::string& line, const std::string& before = "") {
    helper = std::make_unique<Helper>(script);
    std::string command = line;
    const auto names = [&](const char* word) { return (" " + line + " ").find(word) != std::string::npos; };
    if (!line.empty() && !names(" --helper ")) command += " --helper " FAKE_HELPER;
    if ((names(" capture ") || names(" watch ")) && !names(" --output ")) command += " --output " + out.path();
    if (names("-help ")) command = line;
    command = before + "\nexec " TETHER_COMMAND " " + command;
    std::filesystem::remove(files / "out");
    std::filesystem::remove(files / "err");

    Texts arguments{"sh", "-c", command};
    Texts environment = helper->environment();
    environment.push_back("TMPDIR=" + temporary.path());
    environment.push_back("PATH=/usr/bin:/bin");
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    constexpr int kFlags = O_WRONLY | O_CREAT | O_APPEND;
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    if (piped) posix_spawn_file_actions_adddup2(&actions, unread.write.get(), 1);
    if (!piped) posix_spawn_file_actions_addopen(&actions, 1, (files / "out").c_str(), kFlags, 0600);
    posix_spawn_file_actions_addopen(&actions, 2, (files / "err").c_str(), kFlags, 0600);
    EXPECT_EQ(
        posix_spawn(&process, "/bin/sh", &actions, nullptr, pointers(arguments).data(), pointers(environment).data()),
        0);
    posix_spawn_file_actions_destroy(&actions);
  }
  // The exit status, or minus the signal. Whatever happened, no helper is left.
  int wait() {
    int status = 0;
    EXPECT_EQ(waitpid(process, &status, 0), process);
    process = 0;
    for (std::size_t nth = 0; nth < helper->notes("start ").size(); ++nth) {
      const pid_t started = helper->process(nth);
      EXPECT_TRUE(eventually([&] { return isGone(started); }));
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
  }
  int run(const std::string& script, const std::string& line, const std::string& before = "") {
    start(script, line, before);
    return wait();
  }

  std::string output() const { return files.read("out"); }
  std::string errors() const { return files.read("err"); }
  // Of that event, or all.
  std::vector<Json> objects(const std::string& event = "") const {
    std::vector<Json> some;
    std::istringstream lines(output());
    for (std::string text; std::getline(lines, text);) {
      Json object = Json::parse(text);
      if (event.empty() || object["event"] == event) some.push_back(std::move(object));
    }
    return some;
  }
  bool awaitText(const char* file, const std::string& text) const {
    return eventually([&] { return files.read(file).find(text) != std::string::npos; });
  }
  std::size_t shutters() const { return helper->notes("request doCapture").size(); }

  Folder out;
  Folder files;      // what it said
  Folder temporary;  // holds the helpers' private directories
  tether::Pipe unread = tether::Pipe::make();
  bool piped = false;  // standard output is that pipe
  std::unique_ptr<Helper> helper;
  pid_t process = 0;

 private:
  static std::vector<char*> pointers(Texts& texts) {
    std::vector<char*> all;
    for (std::string& text : texts) all.push_back(text.data());
    all.push_back(nullptr);
    return all;
  }
};

// Calls `check` with every row of a table, several at a time: most of what they do is wait.
template <typename Rows, typename Check>
void checkAll(const Rows& rows, const Check& check) {
  constexpr int kAtATime = 6;
  std::atomic<std::size_t> next{0};
  std::vector<std::future<void>> running;
  for (int i = 0; i < kAtATime; ++i) {
    running.push_back(std::async(std::launch::async, [&] {
      for (std::size_t nth = next++; nth < std::size(rows); nth = next++) check(rows[nth]);
    }));
  }
}

}  // namespace fake
