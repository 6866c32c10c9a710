// The helper as its host sees it: a process with pipes, a bundle of its own in a fresh folder, and files.
//
// Everything that waits does so for at most a minute, and throws with the messages so far when nothing came. One thread
// at a time; while nobody waits, nothing is read: that is what the host library's session would do.
#pragma once

#include <gtest/gtest.h>

#include <deque>
#include <map>

#include "Descriptors.h"
#include "Files.h"
#include "FrameWriter.h"
#include "HelperProcess.h"

namespace tether {

using platform::Clock;
using testkit::pattern;
using testkit::readFile;

// A frame from the helper, decoded and as it came.
struct Received {
  std::string bytes{};
  std::int32_t id = 0;
  std::string name{};
  std::unique_ptr<KtLuaTE> data{};
  Clock::time_point arrived{};
  std::size_t place = 0;  // in the order of arrival
  bool taken = false;

  KtLuaTE* value(const char* key) const;  // null where the payload has no such key
  double number(const char* key) const;
  std::string text(const char* key) const;
  std::size_t entries() const;  // of the payload; 0 where it is no table
};

std::string littleEndian(std::uint32_t number);
std::string frame(std::int32_t id, const std::string& nameElement, const std::string& dataElement);
std::string request(const char* name, std::int32_t id, std::optional<double> deviceId = std::nullopt);

class Helper {
 public:
  Helper();

  // Before the start. A copy of the library becomes a module bundle's executable.
  void install(const std::string& bundle, const std::string& library, const std::string& executable = {}) const;
  void setEnvironment(const std::string& name, const std::string& value) { _environment[name] = value; }
  void limit(const std::string& option) { _limits += "ulimit " + option + "\n"; }  // of the shell's ulimit
  void start();

  std::filesystem::path helpers() const { return folder() / "TetherHelper.app/Contents/Helpers"; }
  std::filesystem::path temporary() const { return folder() / "tmp"; }  // the helper's TMPDIR
  std::filesystem::path cameras() const { return folder() / "cameras"; }
  const std::filesystem::path& folder() const { return _folder.path(); }
  pid_t pid() const { return _process->pid(); }
  bool isRunning() const { return _process && !_process->waitUntil(Clock::now()); }

  void send(const std::string& bytes);
  void closeInput() { _input.reset(); }
  void closeOutput() { _output.reset(); }
  void narrowOutput() const;  // to one page, where the system can
  // Bytes that wait in the pipes.
  std::size_t unread() const;
  std::size_t unreadByHelper() const;

  // The oldest message of that name, or answer to that request, that was not handed out yet. Valid as long as the
  // helper object.
  const Received& await(const std::string& name);
  const Received& awaitAnswer(std::int32_t id);
  // When it returns, the helper has carried out everything that was sent before, and its answers are among the
  // messages. Needs the module Type0001Module; waits for a transfer that is under way.
  void settle();
  const std::deque<Received>& messages() const { return _messages; }
  std::size_t count(const std::string& name) const;
  // The oldest message, which is kept no longer; nothing when none came until then, or the output has ended.
  std::optional<Received> next(Clock::time_point limit);

  // The exit status, or the signal that ended it as a negative number.
  enum class Reading { yes, no };
  int wait(Reading reading = Reading::yes);
  std::string standardError() const { return readFile(folder() / "stderr"); }

 private:
  using Match = std::function<bool(const Received&)>;

  const Received* find(const Match& match, Clock::time_point limit);
  const Received& awaitMatch(const std::string& what, const Match& match);
  bool readUntil(Clock::time_point limit);  // false: the limit, or the end of the output
  [[noreturn]] void fail(const std::string& what) const;

  testkit::Folder _folder;
  std::map<std::string, std::string> _environment;
  std::string _limits;
  Descriptor _input;
  Descriptor _output;
  std::unique_ptr<HelperProcess> _process;
  std::string _received;
  std::deque<Received> _messages;
  std::int32_t _lastSettleId = 1'000'000;
};

// Waits for what no message tells, a file for instance.
void awaitCondition(const std::string& what, const std::function<bool()>& condition);

// The file appears whole: written under a hidden name, dated back, renamed.
void drop(const std::filesystem::path& path, const std::string& bytes);

inline constexpr double kStudio = 257;

// One helper a test, which has to end well after it.
class HelperTest : public testing::Test {
 protected:
  void TearDown() override;
  // Starts with the virtual camera as Type0001Module and one camera folder; the device is 257.
  void startWithCamera(const std::string& cameraFile = {});
  void connect(double deviceId = kStudio);
  void plugIn(const std::string& camera) const;
  void unplug(const std::string& camera) const;
  std::filesystem::path studio() const { return helper.cameras() / "1-Studio"; }

  Helper helper;
};

}  // namespace tether
