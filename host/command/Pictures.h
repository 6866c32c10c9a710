// The pictures under way, from their announcement to their place in the output folder.
#pragma once

#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "Console.h"
#include "FileMover.h"
#include "Link.h"

namespace tether::command {

class Pictures {
 public:
  // Makes the folder where it is missing; throws Failure when that fails. The console outlives the pictures.
  Pictures(const std::string& folder, Console& console);

  // Deals with an announcement or a completion; leaves every other event alone. `camera`: where pictures come from,
  // where that is known.
  void take(const Event& event, const std::optional<Camera>& camera);
  // The shutter was released: the next picture counts its time from here.
  void shutterReleased();
  // Pictures under way will not come any more, for the reason given.
  void giveUp(const std::string& reason);

  // Announced and not complete.
  std::size_t underWay() const { return _underWay.size(); }
  // Pictures brought to an end, saved or not; a pair is one.
  int done() const { return _done; }
  int notSaved() const { return _notSaved; }
  // When a picture was last announced or completed.
  Clock::time_point lastProgress() const { return _lastProgress; }
  // "Capture0001.jpg 12.3 MB receiving 1.2 s", or "".
  std::string status() const;

  // Waits up to 5 seconds for what is under way, pictures whose shutter was released among it, after the user asked to
  // end; a second Ctrl-C ends that too.
  void waitBriefly(Link& link);

 private:
  // The two files of one shot.
  struct Pair {
    std::string announced;  // base name
    std::string extension;  // of the first
    std::optional<std::string> base;
    int files = 1;
    int finished = 0;
    bool closed = false;
    Clock::time_point since;
  };
  struct Picture {
    ObjectWasAdded object;
    std::optional<Camera> camera;
    std::shared_ptr<Pair> pair;
    Clock::time_point since;
    Clock::time_point announced;
  };

  void announced(const ObjectWasAdded& object, const std::optional<Camera>& camera);
  void completed(const FileDownloadComplete& complete, const std::optional<Camera>& camera);
  void pairUp(Picture& picture);
  void finish(const Picture& picture);
  void closePair();
  Clock::time_point takeShutterTime();
  std::size_t expected() const;
  void takeUntil(Clock::time_point until, Link& link);
  void report(const Picture& picture, const MovedFile& moved);

  Console& _console;
  FileMover _mover;
  std::map<std::int32_t, Picture> _underWay;
  std::shared_ptr<Pair> _openPair;
  std::deque<Clock::time_point> _shutters;
  Clock::time_point _lastProgress = Clock::now();
  int _done = 0;
  int _notSaved = 0;
};

}  // namespace tether::command
