// The helper as its host sees it: a process with pipes, a bundle of its own in a fresh folder, and files.
//
// Everything that waits does so for at most a minute, and throws with the helper's standard error when nothing came.
// One thread at a time; while nobody waits, nothing is read.
#pragma once

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "KtLuaTableMarshalling.h"

namespace tether {

using Clock = std::chrono::steady_clock;

// A frame from the helper, decoded and as it came.
struct Message {
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
  bool isNil(const char* key) const;
  std::size_t entries() const;  // of the payload; 0 where it is no table
};

std::string littleEndian(std::uint32_t number);
std::string encoded(const KtLuaTE& element);
std::string frame(std::int32_t id, const std::string& nameElement, const std::string& dataElement);
std::string request(const char* name, std::int32_t id);
std::string request(const char* name, std::int32_t id, double deviceId);

class Helper {
 public:
  Helper();
  ~Helper();  // kills what still runs, removes the folder
  Helper(const Helper&) = delete;
  Helper& operator=(const Helper&) = delete;

  // Before the start. A copy of the library becomes a module bundle's executable.
  void install(const std::string& bundle, const std::string& library, const std::string& executable = {});
  void setEnvironment(const std::string& name, const std::string& value) { environment_[name] = value; }
  void limitFileSize(rlim_t bytes) { fileLimit_ = bytes; }
  void start();

  std::filesystem::path helpers() const { return folder_ / "TetherHelper.app/Contents/Helpers"; }
  std::filesystem::path temporary() const { return folder_ / "tmp"; }  // the helper's TMPDIR
  std::filesystem::path cameras() const { return folder_ / "cameras"; }
  std::filesystem::path folder() const { return folder_; }
  pid_t pid() const { return child_; }
  bool isRunning() const { return child_ > 0; }

  void send(const std::string& bytes);
  void closeInput();
  void closeOutput();
  void narrowOutput() const;  // to one page, where the system can
  // Bytes that wait in the pipes.
  std::size_t unread() const;
  std::size_t unreadByHelper() const;

  // The oldest message of that name, or answer to that request, that was not handed out yet. Valid as long as the
  // helper object.
  const Message& await(const std::string& name);
  const Message& awaitAnswer(std::int32_t id);
  // When it returns, the helper has carried out everything that was sent before, and its answers are among the
  // messages. Needs the module Type0001Module; waits for a transfer that is under way.
  void settle();
  const std::deque<Message>& messages() const { return messages_; }
  std::size_t count(const std::string& name) const;
  // The oldest message, which is kept no longer; nothing when none came until then, or the output has ended.
  std::optional<Message> next(Clock::time_point limit);

  // The exit status, or the signal that ended it as a negative number.
  enum class Reading { yes, no };
  int wait(Reading reading = Reading::yes);
  std::string standardError() const;

 private:
  using Match = std::function<bool(const Message&)>;

  std::filesystem::path executable() const;
  [[noreturn]] void runChild(int input, int output);
  const Message* find(const Match& match, Clock::time_point limit);
  const Message& awaitMatch(const std::string& what, const Match& match);
  bool readUntil(Clock::time_point limit);  // false: the limit, or the end of the output
  void cutFrames();
  [[noreturn]] void fail(const std::string& what) const;

  std::filesystem::path folder_;
  std::map<std::string, std::string> environment_;
  std::optional<rlim_t> fileLimit_;
  pid_t child_ = 0;
  int input_ = -1;
  int output_ = -1;
  std::string received_;
  std::deque<Message> messages_;
  std::int32_t lastSettleId_ = 1'000'000;
};

// Waits for what no message tells, a file for instance.
void awaitCondition(const std::string& what, const std::function<bool()>& condition);

// Another one for every seed but 0.
std::string pattern(std::size_t size, unsigned seed);
std::string readFile(const std::filesystem::path& path);
// The file appears whole: written under a hidden name, dated back, renamed.
void drop(const std::filesystem::path& path, const std::string& bytes);

// One helper a test, which has to end well after it.
class HelperTest : public testing::Test {
 protected:
  void TearDown() override;
  // Starts with the virtual camera as Type0001Module and one camera folder; the device is 257.
  void startWithCamera(const std::string& cameraFile = {});
  void connect(double deviceId);
  void plugIn(const std::string& camera) const;
  void unplug(const std::string& camera) const;
  std::filesystem::path studio() const { return helper.cameras() / "1-Studio"; }

  Helper helper{};
};

inline constexpr double kStudio = 257;

}  // namespace tether
