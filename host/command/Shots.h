// The ledger of a run: the shutters that were sent, the pictures that were announced, and what has become of each. Pure
// bookkeeping on one thread: the time comes in with every call, and nothing is sent, moved or said here.
//
// What the protocol lets one know, and all of this rests on:
//
// - Transfers come one at a time and in order. While one goes on nothing else is announced, so the time of what waits
//   stands still; and an announcement proves that the transfer before it is over, complete or not.
// - A probe is a settings request that the helper answers in a moment, but drops while it transfers. Its answer proves
//   that no transfer goes on, and that every request before it has been carried out: the exposure is over.
// - Announcements name neither shutter nor camera. A picture is taken for a shutter's when it is announced while that
//   shutter waits for one. Only one shutter waits at a time: another is sent when the picture of the one before has
//   begun to come, or is overdue, that is some time longer in coming than pictures of this run were. An overdue one
//   still gets what is left over.
// - A probe that is sent right before a shutter, on a link at rest, is answered right before the shutter is fired: what
//   is announced before that answer is another's. Who shoots between it and the shutter's own picture cannot be told
//   apart; where more pictures come than shutters were sent, the first counts and the others are marked as possibly
//   own.
#pragma once

#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Camera.h"
#include "Messages.h"
#include "RunLoop.h"

namespace tether::command {

using platform::Clock;

enum class Own { kNo, kYes, kUnknown };

// One file that was announced.
struct Picture {
  int number = 0;              // from 1; never again within a run, whatever becomes of the helper
  int pair = 0;                // the number of the first of the two files of a RAW and JPEG shot; 0: a single file
  int shutter = 0;             // whose it is; 0: of none that was sent here
  Own own = Own::kNo;          // kUnknown: it may be that of a shutter, or another's
  bool late = false;           // it had been given up
  std::int32_t captureId = 0;  // of its helper
  std::string name;            // as announced: text of others
  std::int64_t size = 0;       // as announced; -1 of one that was not
  std::optional<Camera> camera;
  Clock::time_point since;  // of its shutter, else of its announcement
  Clock::time_point announced;
};

// Something that has become known.
struct Notice {
  enum class Kind {
    kShutterFailed,  // a shutter has no picture
    kNotReceived,    // a picture's transfer failed
    kNoPartner,      // a pair's other file did not come; `picture` is the one that did
    kStillComing,    // a picture takes long, and is not given up
  };
  Kind kind{};
  int shutter = 0;
  Picture picture;
  std::string reason;
  std::string remark;      // the helper's, meanwhile; or ""
  bool explained = false;  // the reason is the cause
  Clock::time_point since;
};

class Shots {
 public:
  using Time = Clock::time_point;
  using Span = Clock::duration;

  // What became of pictures, a pair being one. One that comes after all is not missing any more.
  struct Tally {
    int saved = 0;
    int notSaved = 0;
    int missing = 0;  // not received, or of a shutter that failed
  };
  struct Counts {
    int shutters = 0;
    Tally own;  // of these shutters
    Tally others;
    int failedInARow = 0;  // of the shutters, to the last one
  };

  // How long a shutter may take to its picture's announcement, and a transfer before it is spoken of.
  explicit Shots(std::chrono::milliseconds timeout) : _timeout(timeout) {}

  // A camera was connected: nothing is known of what it holds. No probe before `probeFrom`.
  void connected(Time probeFrom);
  // With the probe that was sent right before it, if any. Returns its number.
  int shutterSent(const std::optional<std::int32_t>& probe, Time now);
  // Right before a shutter, and whenever nextProbe() says so.
  void probeSent(std::int32_t id, Time now);
  // When to probe next; the distant future when there is nothing to learn.
  Time nextProbe() const;

  // An answer to any request.
  void answered(std::int32_t id, Time now);
  void heartbeat(Time now);
  const Picture& announced(const ObjectWasAdded& object, const std::optional<Camera>& camera, Time now);
  // The picture is to be saved now; it is known until ended() is told.
  Picture completed(const FileDownloadComplete& complete, const std::optional<Camera>& camera, Time now);
  void ended(int number, bool saved);
  // The camera that was fired, or the only one, has gone: what was received from it may still come whole, what it was
  // to send will not.
  void unplugged(const std::string& reason, Time now);
  // Notes what the helper logged for what it does now: the transfer, unless its failure has been told, else the shutter
  // that waits. False when there is neither.
  bool remark(const std::string& text);
  // Nothing that is under way will come any more.
  void giveUp(const std::string& reason, Time now);
  // A picture is lost that was never announced.
  void neverCame() { ++_counts.others.missing; }

  // Looks what the time tells. To be called when nextCheck() is reached, after all messages until then were taken.
  void check(Time now);
  Time nextCheck(Time now) const;
  // So much time has gone by in which nobody could look: it is not held against anyone.
  void delayed(Span time);
  std::vector<Notice> takeNotices() { return std::exchange(_notices, {}); }

  // Whether a shutter would have the next picture to itself. In a series it is sent while the one before is
  // transferred.
  bool mayRelease(bool series, Time now) const;
  // Twice in a row a probe was answered and nothing came between: what was shot until then has come, as far as the
  // camera has said so. After the time-out it is taken for granted.
  bool isCalm(Time now) const { return _calm >= kCalm || now >= _disturbed + _timeout; }
  // Shutters and files that something is still awaited of.
  std::size_t expected() const;
  const Picture* receiving() const { return _receiving == 0 ? nullptr : &_pictures.at(_receiving).file; }
  // Of the shutter that waits for its picture the longest.
  std::optional<Time> waitingSince() const;
  const Counts& counts() const { return _counts; }

 private:
  static constexpr int kCalm = 2;
  struct Shutter {
    int number = 0;
    Time sent;
    Time since;              // the time that its picture may take counts from here
    std::int32_t fence = 0;  // the probe before whose answer nothing that comes is its own; 0: none, or answered
    bool exposed = false;
    bool overdue = false;
    bool unsure = false;
    std::string reason;  // why it will not come
    std::string remark;
  };
  // One exposure: a file or two.
  struct Shot {
    enum class State { kOpen, kSaved, kUnsaved, kMissing };
    State state = State::kOpen;
    int first = 0;  // its first file's number
    int shutter = 0;
    int files = 0;
    int saved = 0;
    int notSaved = 0;
    int lost = 0;
    bool waits = false;  // for the other file of a pair
    std::string base;
    std::string extension;
    Own own = Own::kNo;
    Time since;  // the time that the other file may take counts from here
  };
  struct Entry {
    Picture file;
    std::shared_ptr<Shot> shot;
    bool lost = false;
    bool slow = false;              // and that was said
    std::optional<Time> brokenOff;  // a probe's answer says so
    std::string reason;
    std::string remark;
  };
  struct Probe {
    std::int32_t id = 0;
    int shutters = 0;
    int disturbances = 0;
    Time sent;
  };

  void disturb(Time now);
  void exposedUpTo(int shutter, Time now);
  std::shared_ptr<Shot> shotOf(const ObjectWasAdded& object, Entry& entry, Time now);
  void match(Entry& entry, Time now);
  std::deque<Shutter>::iterator turn();
  void receivingEnded(Time now);
  void loseReceiving(const std::string& reason, Time now);
  void loseShutter(std::size_t index, const std::string& reason);
  void losePartner(const std::shared_ptr<Shot>& shot);
  void checkReceiving(Time now);
  void checkWaiting(Time now);
  Tally& tallyOf(int shutter) { return shutter == 0 ? _counts.others : _counts.own; }
  void settle(Shot& shot);
  Span patience(const Picture& file) const;
  Span hold() const;

  const Span _timeout;
  std::map<int, Entry> _pictures;              // receiving, being saved, or given up
  std::map<std::int32_t, int> _numbers;        // by capture id, of the present helper
  std::deque<Shutter> _shutters;               // that wait
  std::vector<std::shared_ptr<Shot>> _halves;  // that wait for their other file
  std::deque<Probe> _probes;                   // not answered
  std::vector<Notice> _notices;
  Counts _counts;
  int _lastNumber = 0;
  int _receiving = 0;
  int _exposed = 0;  // the exposures up to this one are over
  int _beats = 0;    // since the last shutter
  int _disturbances = 0;
  int _calm = 0;
  Time _disturbed;
  Time _probeFrom;
  bool _ownSinceCalm = false;
  bool _otherSinceCalm = false;
  std::optional<Span> _lag;  // the longest from an exposure's end to its picture
};

}  // namespace tether::command
