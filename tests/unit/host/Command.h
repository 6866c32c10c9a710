// `tether` as a process, on a scripted helper.
#pragma once

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>

#include <algorithm>
#include <nlohmann/json.hpp>
#include <optional>

#include "Fake.h"

extern char** environ;

namespace fake {

using Json = nlohmann::json;

// A camera that is there and lets itself be connected; what it does when the shutter is released comes behind it.
inline std::string camera(const std::string& capture, const std::string& more = "") {
  return R"({"start": [{"send": "deviceAdded", "payload": {"device_id": 257, "name": "Cam"}}], "on": {)"
         R"("connectDevice": [[{"reply": "ok"}]], "getCameraSettings": [[{"reply": "error"}]], "doCapture": )" +
         capture + (more.empty() ? "" : ", " + more) + "}}";
}

class Command {
 public:
  // With `closedOutput`, standard output is a pipe that nobody reads.
  Command(const Helper& helper, std::vector<std::string> arguments, bool closedOutput = false) : _helper(helper) {
    arguments.insert(arguments.begin(), TETHER_COMMAND);
    const bool named = std::find(arguments.begin(), arguments.end(), "--helper") != arguments.end();
    if (arguments.size() > 1 && !named) {
      arguments.insert(arguments.begin() + 2, {"--helper", Helper::path()});
    }
    std::vector<std::string> environment = helper.environment();
    environment.push_back("TMPDIR=" + _temporary.path());
    for (char** entry = environ; *entry != nullptr; ++entry) {
      if (std::string(*entry).rfind("TMPDIR=", 0) != 0) environment.emplace_back(*entry);
    }
    spawn(arguments, environment, closedOutput);
  }
  Command(const Command&) = delete;
  Command& operator=(const Command&) = delete;
  ~Command() {
    if (!_status) kill(_pid, SIGKILL);
    wait();
  }

  pid_t pid() const { return _pid; }
  // Waits for the end; the exit status, or minus the signal.
  int wait() {
    if (!_status) {
      int status = 0;
      while (waitpid(_pid, &status, 0) < 0 && errno == EINTR) {
      }
      _status = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
    }
    return *_status;
  }
  void signal(int number) const { kill(_pid, number); }

  std::string output() const { return _files.read("out"); }
  std::string errors() const { return _files.read("err"); }
  std::vector<Json> objects() const {
    std::vector<Json> all;
    std::istringstream lines(output());
    for (std::string line; std::getline(lines, line);) all.push_back(Json::parse(line));
    return all;
  }
  bool awaitOutput(const std::string& text) const {
    return eventually([&] { return output().find(text) != std::string::npos; });
  }
  // What is left of the private directories of helpers.
  const Folder& temporary() const { return _temporary; }
  bool leavesNoHelper() const {
    bool none = true;
    for (std::size_t i = 0; i < _helper.notes("start ").size(); ++i) none = none && isGone(_helper.process(i));
    return none;
  }

 private:
  static std::vector<char*> pointers(std::vector<std::string>& texts) {
    std::vector<char*> all;
    all.reserve(texts.size() + 1);
    for (auto& text : texts) all.push_back(text.data());
    all.push_back(nullptr);
    return all;
  }

  void spawn(std::vector<std::string>& arguments, std::vector<std::string>& environment, bool closedOutput) {
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    const int flags = O_WRONLY | O_CREAT | O_APPEND;
    int ends[2] = {-1, -1};
    if (closedOutput) {
      ASSERT_EQ(pipe(ends), 0);
      close(ends[0]);
      posix_spawn_file_actions_adddup2(&actions, ends[1], 1);
    } else {
      posix_spawn_file_actions_addopen(&actions, 1, (_files / "out").c_str(), flags, 0600);
    }
    posix_spawn_file_actions_addopen(&actions, 2, (_files / "err").c_str(), flags, 0600);
    const int error =
        posix_spawn(&_pid, TETHER_COMMAND, &actions, nullptr, pointers(arguments).data(), pointers(environment).data());
    posix_spawn_file_actions_destroy(&actions);
    if (closedOutput) close(ends[1]);
    ASSERT_EQ(error, 0);
  }

  Folder _files;
  Folder _temporary;
  const Helper& _helper;
  pid_t _pid = -1;
  std::optional<int> _status;
};

}  // namespace fake
