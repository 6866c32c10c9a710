// The helper as a process of its own, and what the system tells of it.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>
#include <vector>

// A folder of its own under the temporary directory, removed with everything in it.
class TemporaryFolder {
 public:
  TemporaryFolder();
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;
  ~TemporaryFolder();
  const std::string& path() const { return _path; }

 private:
  std::string _path;
};

// Starts a program with descriptors for its input and output; a negative one is the null device, which its standard
// error is always. The variables come before those of this process. Throws std::runtime_error when it cannot be.
pid_t start(const std::string& program, const std::vector<std::string>& variables, int input = -1, int output = -1);
void waitFor(pid_t process);

// Processor time of all its threads, in seconds.
double processorTimeOf(pid_t process);
// How often its threads have gone to sleep.
double sleepsOf(pid_t process);

class HelperProcess {
 public:
  HelperProcess(const std::string& program, const std::vector<std::string>& variables);
  HelperProcess(const HelperProcess&) = delete;
  HelperProcess& operator=(const HelperProcess&) = delete;
  // Ends its input and waits for it.
  ~HelperProcess();

  // Reads frames up to the next one of that name. Throws std::runtime_error when the helper ends before.
  void await(const std::string& name);
  // Writes bytes to its input. Throws std::runtime_error when it has ended.
  void send(const std::string& bytes);

  pid_t process() const { return _process; }
  // Resident memory, now and the most that it has had at a time, in bytes.
  double memory() const;
  double peakMemory() const;

 private:
  std::string nextName();
  double memoryFigure(const std::string& name) const;

  pid_t _process = -1;
  int _input = -1;
  int _output = -1;
};
