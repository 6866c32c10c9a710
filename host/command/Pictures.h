// The pictures of a run on their way from the helper into the output folder: what `capture` and `watch` have in common.
// Takes every event, keeps the ledger, has files saved, and says what has become of each.
#pragma once

#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "FileSaver.h"
#include "Link.h"
#include "Report.h"
#include "Shots.h"

namespace tether::command {

class Pictures {
 public:
  // Makes the folder where it is missing; throws Failure when that fails, or when nothing can be written there. The
  // console and the link outlive the pictures. `sendsShutters`: pictures of others are named as such.
  Pictures(const Options& options, Console& console, Link& link, const std::shared_ptr<Wakeup>& wakeup,
           bool sendsShutters);

  // The next event, after it was taken; nothing when none came in time. Probes, and says what the time tells. Throws
  // Failure as Link::next().
  std::optional<Event> next(Clock::time_point until);
  void take(const Event& event);
  // After the link connected a camera.
  void connected();
  // Fires the connected camera. False when the helper was lost before it could be told.
  bool releaseShutter();
  // After a HelperLost event: takes what the helper still said, and starts another. Throws Failure.
  void restart(const HelperLost& lost);

  // The end, once and whatever the reason: waits briefly for what is under way where the user asked for the end, ends
  // the helper, waits for the disk, and says what is missing. Returns the worst that happened as an exit status, which
  // is `failure`'s where pictures tell nothing worse. Its text is added how many could not be saved, and how many of
  // others did not come.
  int finish(Failure& failure);

  // Whether nothing is awaited any more, and everything that was shot until now has come.
  bool isSettled() const;
  const Shots& shots() const { return _shots; }
  Report& report() { return _report; }
  // "Capture0001.jpg 12.3 MB receiving 1.2 s", or "".
  std::string status() const;

 private:
  void probe();
  void notePause(Clock::time_point expected);
  void save(const Picture& picture, const std::string& source);
  void takeSaved();
  void takeLeftovers();
  void takeLog(const std::string& line);
  void giveLog(const Picture& picture);
  void tellStrays(Clock::time_point until);
  void tellNotices();
  void unplugged(const DeviceRemoved& removed);
  std::string troubleInDirectory() const;
  void waitBriefly();
  void waitForDisk();

  const Options& _options;
  Console& _console;
  Link& _link;
  const bool _sendsShutters;
  const std::string _folder;
  FileSaver _saver;
  Report _report;
  Shots _shots;
  std::map<int, Picture> _saving;
  std::set<std::string> _left;  // paths of what could not be saved
  struct Stray {
    std::string line;
    std::string trouble;
    Clock::time_point since;
  };
  std::deque<Stray> _strays;  // of the helper's log, on pictures that have not been announced
  Clock::time_point _handled = Clock::now();
};

}  // namespace tether::command
