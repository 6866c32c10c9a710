// The command's connection to a helper: starts it, starts it again when it is lost, and knows which cameras it has.
#pragma once

#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "Console.h"
#include "Options.h"
#include "Session.h"

namespace tether::command {

struct Camera {
  std::int32_t id = 0;
  std::string name;
};

class Link {
 public:
  using Take = std::function<void(const Event&)>;

  // Both outlive the link.
  Link(const Options& options, Console& console, std::shared_ptr<Wakeup> wakeup);
  Link(const Link&) = delete;
  Link& operator=(const Link&) = delete;
  // As end() with a short grace; nobody takes what the helper still sends.
  ~Link();

  // Starts a helper. Throws Failure when that cannot be done.
  void start();
  // After a HelperLost event: says so and starts another. Throws Failure when it was lost too often.
  void restart(const HelperLost& lost);
  // Ends the helper, hands over what it still sent, and says which files stay in its directory. Without a helper it
  // does nothing.
  void end(std::chrono::milliseconds grace, const Take& take);

  // The next event; cameras() is up to date with it. Nothing when none came in time. Throws Failure when the user
  // interrupted, or closed standard output.
  std::optional<Event> next(Clock::time_point until);
  // From now on a closed standard output ends nothing, and interruptions so far are known.
  void finishing();

  Session& session() { return *_session; }
  const std::map<std::int32_t, std::string>& cameras() const { return _cameras; }
  Clock::time_point startedAt() const { return _startedAt; }
  std::chrono::milliseconds timeout() const;

  // Whether this is a camera that the user asked for, or one like the camera that was chosen before.
  bool isWanted(const Camera& camera) const;
  // Waits for the listing, and up to 3 seconds from the helper's start for a wanted camera. Hands over whatever comes
  // meanwhile. Throws Failure.
  Camera choose(const Take& take);
  // Connects; throws Failure. Remembers the camera, so that it is wanted when it comes back under another id.
  void connect(const Camera& camera);

  // As a Failure, with the words that fit; `what` as in "connecting the camera".
  [[noreturn]] void fail(const Reply& reply, const std::string& what) const;

 private:
  void note(const Event& event);
  std::optional<Camera> wanted() const;
  [[noreturn]] void failWithoutCamera() const;
  void throwIfStopped() const;

  const Options& _options;
  Console& _console;
  std::shared_ptr<Wakeup> _wakeup;
  Descriptor _log;
  std::unique_ptr<Session> _session;
  std::map<std::int32_t, std::string> _cameras;
  std::string _chosenName;
  std::deque<Clock::time_point> _losses;
  Clock::time_point _startedAt;
  bool _finishing = false;
};

}  // namespace tether::command
