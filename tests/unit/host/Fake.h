// A scripted helper for one test: its script, what it noted, and a folder that goes with it.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace fake {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

// Long enough for a loaded machine under a sanitizer; no test takes it when all is well.
inline constexpr auto kPatience = 60s;

inline Clock::time_point soon() { return Clock::now() + kPatience; }

// For what no event tells: another process's files and life.
inline bool eventually(const std::function<bool()>& holds) {
  for (const auto until = soon(); !holds(); std::this_thread::sleep_for(2ms)) {
    if (Clock::now() > until) return false;
  }
  return true;
}

inline bool isGone(pid_t process) { return kill(process, 0) != 0 && errno == ESRCH; }

class Folder {
 public:
  explicit Folder(const std::string& parent = ::testing::TempDir()) : _path(parent + "/hosttest.XXXXXX") {
    if (mkdtemp(_path.data()) == nullptr) _path.clear();
  }
  Folder(const Folder&) = delete;
  Folder& operator=(const Folder&) = delete;
  ~Folder() {
    std::error_code ignored;
    if (!_path.empty()) std::filesystem::remove_all(_path, ignored);
  }

  const std::string& path() const { return _path; }
  std::string operator/(const std::string& name) const { return _path + "/" + name; }
  std::string write(const std::string& name, const std::string& content) const {
    std::ofstream(*this / name) << content;
    return *this / name;
  }
  std::string read(const std::string& name) const {
    std::ifstream file(*this / name);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  // Names in it, hidden ones too, sorted.
  std::vector<std::string> names() const {
    std::vector<std::string> all;
    for (const auto& entry : std::filesystem::directory_iterator(_path)) all.push_back(entry.path().filename());
    std::sort(all.begin(), all.end());
    return all;
  }

 private:
  std::string _path;
};

class Helper {
 public:
  explicit Helper(const std::string& script) { _folder.write("script.json", script); }

  std::vector<std::string> environment() const {
    return {"FAKE_HELPER_SCRIPT=" + (_folder / "script.json"), "FAKE_HELPER_LOG=" + (_folder / "log")};
  }
  // What it noted so far: the part of each line behind a word.
  std::vector<std::string> notes(const std::string& word) const {
    std::vector<std::string> found;
    std::istringstream lines(_folder.read("log"));
    for (std::string line; std::getline(lines, line);) {
      if (line.rfind(word, 0) == 0) found.push_back(line.substr(word.size()));
    }
    return found;
  }
  bool awaitNote(const std::string& word) const {
    return eventually([&] { return !notes(word).empty(); });
  }
  // The nth start's process, once it has begun, and its temporary directory.
  pid_t process(std::size_t nth = 0) const {
    eventually([&] { return notes("start ").size() > nth; });
    return static_cast<pid_t>(std::stol(notes("start ").at(nth)));
  }
  std::string directory(std::size_t nth = 0) const {
    const std::string line = notes("start ").at(nth);
    return line.substr(line.find(' ') + 1);
  }

 private:
  Folder _folder;
};

}  // namespace fake
