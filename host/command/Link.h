// The command's connection to a helper: starts it, starts it again when it is lost, and knows which cameras it has.
#pragma once

#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Camera.h"
#include "Console.h"
#include "Options.h"
#include "Session.h"

namespace tether::command {

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
  // After a HelperLost event and end(): says so and starts another. Throws Failure when it was lost too often.
  void restart(const HelperLost& lost);
  // Ends the helper and hands over what it still sent. Without a helper it does nothing.
  void end(std::chrono::milliseconds grace, const Take& take);
  // Says which files stay in the directories of helpers that have ended, but for those that the user knows of, and lets
  // go of the directories.
  void tidy(const std::set<std::string>& known = {});

  // The next event; cameras() is up to date with it. Nothing when none came in time. Throws Failure when the user
  // interrupted, or closed standard output.
  std::optional<Event> next(Clock::time_point until);
  // From now on a closed standard output ends nothing, and interruptions so far are known.
  void finishing();

  // Throws the Failure of a user who wants an end.
  void throwIfStopped() const;

  Session& session() { return *_session; }
  const std::map<std::int32_t, std::string>& cameras() const { return _cameras; }
  Clock::time_point startedAt() const { return _startedAt; }
  // By then the helper has asked its cameras what they have.
  Clock::time_point firstPassBy() const { return _firstPassBy; }
  std::chrono::milliseconds timeout() const;
  // Whether it is the one that was connected last.
  bool isChosen(const Camera& camera) const { return _chosen && _chosen->id == camera.id; }
  // The last that went.
  const Camera& lastRemoved() const { return _lastRemoved; }
  // Where the helper puts its pictures; "" when there is none.
  std::string directory() const { return _session ? _session->directory()->path() : std::string(); }
  // The camera that whatever comes now is from: known only where this helper has never had another.
  std::optional<Camera> onlyCamera() const { return _onlyCamera; }

  // Whether the user asked for this camera.
  bool isWanted(const Camera& camera) const;
  // Waits for the listing, and up to 3 seconds from the helper's start for a wanted camera; after a restart it is the
  // camera that was connected before. Hands over whatever comes meanwhile. Throws Failure.
  Camera choose(const Take& take);
  // Connects; throws Failure.
  void connect(const Camera& camera);
  // Sends a request that the helper answers in a moment, but drops while it transfers a picture: settings of a camera
  // that cannot be there. Its id; nothing where such a request would say nothing.
  std::optional<std::int32_t> probe();
  bool canProbe() const { return _probed && _session && !_session->lost(); }

  // As a Failure, with the words that fit; `what` as in "connecting the camera".
  [[noreturn]] void fail(const Reply& reply, const std::string& what) const;

 private:
  void note(const Event& event);
  std::optional<Camera> wanted() const;
  [[noreturn]] void failWithoutCamera() const;

  const Options& _options;
  Console& _console;
  std::shared_ptr<Wakeup> _wakeup;
  Descriptor _log;
  std::unique_ptr<Session> _session;
  std::vector<std::shared_ptr<const PrivateDirectory>> _ended;  // of helpers before this one
  std::map<std::int32_t, std::string> _cameras;
  std::optional<Camera> _onlyCamera;
  bool _hadAny = false;
  Camera _lastRemoved;
  std::optional<Camera> _chosen;  // connected last, in this helper or one before
  bool _hadNamesake = false;      // another of its name was there, too
  std::optional<std::int32_t> _probed;
  std::deque<Clock::time_point> _losses;
  Clock::time_point _startedAt;
  Clock::time_point _firstPassBy;
  bool _finishing = false;
};

}  // namespace tether::command
