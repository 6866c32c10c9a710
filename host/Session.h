// A running helper and the conversation with it: requests out, replies matched by id, everything else as messages or
// typed events in the order in which it came.
//
// One thread uses a session and waits in it; a thread of the session's own reads the pipe. Every wait is bounded by a
// time of the caller's and ends early when the helper is lost or the session's Wakeup is interrupted.
//
// A helper is lost when its process ends or closes its output, when nothing has come from it for too long, or when it
// does not take what is sent. Its process is ended then. Messages that came before can still be had, and after them
// HelperLost; there is no way back, a new session starts a new helper.
//
// Messages that nobody takes are kept up to a bound (10,000 or 64 MiB); beyond it the helper is made to wait.
#pragma once

#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "HelperProcess.h"
#include "Messages.h"
#include "PrivateDirectory.h"
#include "Wakeup.h"

namespace tether {

struct SessionOptions {
  std::string helper;                    // path of its executable; "" for the one beside this executable
  std::vector<std::string> environment;  // NAME=value, for the helper alone
  int errorDescriptor = -1;              // the helper's standard error; -1: this process's own
  // Silence that counts as lost. A helper is busy, and silent, while a camera exposes or a camera is taken down.
  std::chrono::milliseconds silence{60'000};
  std::shared_ptr<Wakeup> wakeup;  // null: one of its own
};

// What became of a request.
struct Reply {
  enum class Kind { kOk, kError, kTimeout, kInterrupted, kLost };
  Kind kind = Kind::kTimeout;
  std::shared_ptr<KtLuaTE> payload;  // of "ok" and "error", else null
  std::int32_t errorCode = 0;        // of "error"
  std::string errorText;             // of "error", may be empty
};

class Session {
 public:
  using Options = SessionOptions;

  // Starts the helper with a private temporary directory. Throws HelperNotStarted.
  explicit Session(const Options& options);
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;
  // As end() with a short grace. No process is left, and no directory unless files are in it.
  ~Session();

  // Where the helper leaves its pictures until someone takes them away. Lives as long as the session.
  const PrivateDirectory& directory() const { return _directory; }
  pid_t processId() const { return _process->pid(); }

  // The next message, replies that nobody waited for among them; nothing when none came in time or the wait was
  // interrupted, and nothing at once when the helper is lost and every message taken.
  std::optional<Message> nextMessage(Clock::time_point until);
  // The same as a typed event. A lost helper gives HelperLost, again at every call.
  std::optional<Event> nextEvent(Clock::time_point until);
  // How the helper was lost, once that is known.
  const std::optional<HelperLost>& lost() const { return _lost; }

  // Sends a request and returns its id; does not wait for the helper to act. At most 5 seconds when the helper does not
  // read; it counts as lost after that. Sending to a lost helper does nothing.
  std::int32_t send(std::string_view name, const KtLuaTE* payload = nullptr);
  // Sends a request and waits for "ok" or "error" with its id. Messages that come meanwhile are kept in order. Not
  // every request is answered: one that the helper drops ends in kTimeout.
  Reply request(std::string_view name, const KtLuaTE* payload, Clock::time_point until);

  // Asks for the cameras and waits until all that the helper knows are announced; the announcements then are among the
  // messages waiting. The helper does not say when its listing is done, but dispatches nothing before its first listing
  // is written: any reply proves it, and so does the first heartbeat. A harmless request to every module that may be
  // loaded (answered at once by those that are) makes this quick; with no module it takes until the heartbeat, about 2
  // seconds after the start. kOk, or why not.
  Reply::Kind awaitListing(Clock::time_point until);
  // Connects a camera. The request goes unanswered when that camera is connected already, and for a module that is not
  // loaded; a settings request sent after it now and then tells the first case.
  Reply connect(std::int32_t device, Clock::time_point until);
  // The connected camera's settings, as payload of kOk. The helper drops the request while a picture is being
  // transferred; it is sent again every second.
  Reply settings(std::int32_t device, Clock::time_point until);

  // Ends the helper: asks it to shut down and waits up to `grace`; closes its input, then SIGTERM, then SIGKILL, with a
  // second each. Takes at most `grace` and a little more than 2 seconds. Not interruptible. What the helper sent until
  // its end can still be taken. Returns its wait status.
  int end(std::chrono::milliseconds grace);

 private:
  using Done = std::function<bool()>;

  void start(const Options& options);
  void keep(Message message);
  void noteEndOfInput();
  bool waitFor(Clock::time_point until, const Done& done);
  Clock::time_point silentAt();
  bool isSilent(Clock::time_point expected);
  void lose(HelperLost::How how);
  void readToTheEnd();
  void takeAll(bool all);
  std::optional<Message> takeReply(std::int32_t first, std::int32_t last);
  Reply awaitReply(std::int32_t first, std::int32_t last, Clock::time_point until);
  bool writeAll(std::string_view bytes, Clock::time_point until);

  const std::chrono::milliseconds _silence;
  std::shared_ptr<Wakeup> _wakeup;
  PrivateDirectory _directory;
  Descriptor _input;  // the helper's
  std::unique_ptr<HelperProcess> _process;
  std::optional<HelperLost> _lost;
  std::int32_t _nextId = 1;

  // Shared with the reading thread.
  std::mutex _lock;
  std::condition_variable _room;
  std::deque<Message> _messages;
  std::size_t _bytes = 0;       // of the messages' frames
  bool _takesAll = false;       // the bound is off: someone waits for a reply, or for the end
  bool _inputFinished = false;  // the helper's output is at its end
  bool _beatOnce = false;
  Clock::time_point _heard;

  std::unique_ptr<KtRCMessageAccumulator> _reader;
  platform::Observer _available;
  platform::Observer _finished;
};

}  // namespace tether
