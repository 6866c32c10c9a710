// A running helper and the conversation with it: requests out, replies matched by id, everything else as messages or
// typed events in the order in which it came.
//
// One thread uses a session and waits in it; threads of the session's own read the pipes. Every wait is bounded by a
// time of the caller's and ends early when the helper is lost or the session's Wakeup is interrupted.
//
// A helper is lost when its process ends or closes its output, when nothing has come from it for too long, or when it
// does not take what is sent. Its process is ended then. Messages that came before can still be had, and after them
// HelperLost; there is no way back, a new session starts a new helper.
//
// Messages that nobody takes are kept up to 64 MiB of memory; beyond it the helper is made to wait, also where a reply
// is waited for behind them.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "HelperLog.h"
#include "HelperProcess.h"
#include "Incoming.h"
#include "Messages.h"
#include "PrivateDirectory.h"
#include "Wakeup.h"

namespace tether {

struct SessionOptions {
  std::string helper;  // path of its executable; "" for the one beside this executable
  // NAME=value, for the helper alone. TETHER_STATE, a folder that outlives it, is this user's where nobody names one.
  std::vector<std::string> environment;
  // What the helper logs is passed on to this one; -1: this process's standard error. The session neither waits for it
  // nor closes it.
  int errorDescriptor = -1;
  // Where its pictures are meant to go, for whoever finds them when this process was killed; "" where that is open.
  std::string folder;
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
  // As end() with a short grace. No process is left, and no directory unless files are in it or others still hold it.
  ~Session();

  // Where the helper leaves its pictures until someone takes them away. May outlive the session.
  const std::shared_ptr<const PrivateDirectory>& directory() const { return _directory; }
  pid_t processId() const { return _process->pid(); }

  // The next message, replies that nobody waited for among them; nothing when none came in time or the wait was
  // interrupted or the wakeup nudged, and nothing at once when the helper is lost and every message taken.
  std::optional<Message> nextMessage(Clock::time_point until);
  // The same as a typed event, and lines of the helper's log among them as they come, before the messages that wait: a
  // line tells why something is about to be missed. Of lines that nobody takes the last 100 are kept. A lost helper
  // gives HelperLost, again at every call.
  std::optional<Event> nextEvent(Clock::time_point until);
  // The last lines of the helper's log, at most 100, the oldest first, whether nextEvent() gave them or not. Any
  // thread.
  std::vector<LogLine> lastLogLines() const { return _log->lastLines(); }
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
  bool waitFor(Clock::time_point until, const Done& done);
  bool isSilent(Clock::time_point expected);
  void lose(HelperLost::How how);
  void readToTheEnd();
  Reply awaitReply(std::int32_t first, std::int32_t last, Clock::time_point until);
  bool writeAll(std::string_view bytes, Clock::time_point until);

  const std::chrono::milliseconds _silence;
  std::shared_ptr<Wakeup> _wakeup;
  std::shared_ptr<const PrivateDirectory> _directory;
  std::unique_ptr<Incoming> _incoming;
  std::unique_ptr<HelperLog> _log;
  Descriptor _input;  // the helper's
  std::unique_ptr<HelperProcess> _process;
  std::optional<HelperLost> _lost;
  Clock::time_point _notSilentBefore;
  std::int32_t _nextId = 1;
};

}  // namespace tether
