#include "HelperProcess.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <stdexcept>

namespace {

// Offset of a frame's name element behind the length field: after the id.
constexpr std::size_t kNameOffset = 4;
constexpr std::size_t kTextOffset = kNameOffset + 8;

void readWhole(int descriptor, char* bytes, std::size_t count) {
  while (count > 0) {
    const ssize_t got = read(descriptor, bytes, count);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) throw std::runtime_error("the helper has ended");
    bytes += got;
    count -= static_cast<std::size_t>(got);
  }
}

std::array<int, 2> makePipe() {
  std::array<int, 2> ends{};
  if (pipe2(ends.data(), O_CLOEXEC) != 0) throw std::runtime_error(std::strerror(errno));
  return ends;
}

std::int32_t numberAt(const std::vector<char>& bytes, std::size_t offset) {
  std::int32_t number = 0;
  if (offset + sizeof number > bytes.size()) throw std::runtime_error("a frame is too short");
  std::memcpy(&number, bytes.data() + offset, sizeof number);
  return number;
}

double statusOf(const std::string& task, const std::string& name) {
  std::ifstream status(task + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind(name, 0) == 0) return std::stod(line.substr(name.size()));
  }
  throw std::runtime_error(name + " cannot be read");
}

}  // namespace

TemporaryFolder::TemporaryFolder() : _path(std::filesystem::temp_directory_path() / "tether-bench-XXXXXX") {
  if (mkdtemp(_path.data()) == nullptr) throw std::runtime_error(std::strerror(errno));
}

TemporaryFolder::~TemporaryFolder() {
  std::error_code ignored;
  std::filesystem::remove_all(_path, ignored);
}

pid_t start(const std::string& program, const std::vector<std::string>& variables, int input, int output) {
  std::vector<char*> environment;
  environment.reserve(variables.size());
  for (const std::string& variable : variables) environment.push_back(const_cast<char*>(variable.c_str()));
  for (char** variable = environ; *variable != nullptr; ++variable) environment.push_back(*variable);
  environment.push_back(nullptr);
  std::array<char*, 2> arguments{const_cast<char*>(program.c_str()), nullptr};

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  for (const int descriptor : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
    posix_spawn_file_actions_addopen(&actions, descriptor, "/dev/null", O_RDWR, 0);
  }
  if (input >= 0) posix_spawn_file_actions_adddup2(&actions, input, STDIN_FILENO);
  if (output >= 0) posix_spawn_file_actions_adddup2(&actions, output, STDOUT_FILENO);
  pid_t process = -1;
  const int error = posix_spawn(&process, program.c_str(), &actions, nullptr, arguments.data(), environment.data());
  posix_spawn_file_actions_destroy(&actions);
  if (error != 0) throw std::runtime_error(program + ": " + std::strerror(error));
  return process;
}

void waitFor(pid_t process) {
  while (waitpid(process, nullptr, 0) < 0 && errno == EINTR) {
  }
}

double processorTimeOf(pid_t process) {
  clockid_t clock{};
  timespec used{};
  if (clock_getcpuclockid(process, &clock) != 0 || clock_gettime(clock, &used) != 0) {
    throw std::runtime_error("a process's processor time cannot be read");
  }
  return static_cast<double>(used.tv_sec) + static_cast<double>(used.tv_nsec) * 1e-9;
}

double sleepsOf(pid_t process) {
  double sleeps = 0;
  for (const auto& task : std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/task")) {
    sleeps += statusOf(task.path(), "voluntary_ctxt_switches:");
  }
  return sleeps;
}

HelperProcess::HelperProcess(const std::string& program, const std::vector<std::string>& variables) {
  const auto toHelper = makePipe();
  const auto fromHelper = makePipe();
  _process = start(program, variables, toHelper[0], fromHelper[1]);
  close(toHelper[0]);
  close(fromHelper[1]);
  _input = toHelper[1];
  _output = fromHelper[0];
}

HelperProcess::~HelperProcess() {
  close(_input);
  waitFor(_process);
  close(_output);
}

std::string HelperProcess::nextName() {
  std::int32_t length = 0;
  readWhole(_output, reinterpret_cast<char*>(&length), sizeof length);
  std::vector<char> frame(static_cast<std::size_t>(length));
  readWhole(_output, frame.data(), frame.size());
  const auto size = static_cast<std::size_t>(numberAt(frame, kNameOffset + 4));
  if (size < 1 || kTextOffset + size > frame.size()) throw std::runtime_error("a frame's name is too long");
  return {frame.data() + kTextOffset, size - 1};
}

void HelperProcess::await(const std::string& name) {
  while (nextName() != name) {
  }
}

void HelperProcess::send(const std::string& bytes) {
  for (std::size_t sent = 0; sent < bytes.size();) {
    const ssize_t count = write(_input, bytes.data() + sent, bytes.size() - sent);
    if (count < 0 && errno != EINTR) throw std::runtime_error("the helper has ended");
    if (count > 0) sent += static_cast<std::size_t>(count);
  }
}

double HelperProcess::memory() const { return statusOf("/proc/" + std::to_string(_process), "VmRSS:") * 1024; }

double HelperProcess::peakMemory() const { return statusOf("/proc/" + std::to_string(_process), "VmHWM:") * 1024; }
