// What does not come, and when that is known.
#include <algorithm>

#include "Shots.h"
#include "Text.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

// A transfer that goes on is not given up before it would be slower than this.
constexpr std::int64_t kSlowestTransfer = 10'000;  // bytes a second
// A completion may follow the answer that proves the transfer's end.
constexpr auto kAfterEnd = 500ms;
// When a picture is overdue: at first, and measured by what pictures of this run took.
constexpr auto kFirstHold = 3s;
constexpr auto kLeastHold = 250ms;
constexpr int kHoldByLag = 4;

}  // namespace

// The time of what waits stood still.
void Shots::receivingEnded(Time now) {
  const Time began = _pictures.at(std::exchange(_receiving, 0)).file.announced;
  for (Shutter& shutter : _shutters) shutter.since += now - std::max(shutter.since, began);
  for (const auto& half : _halves) half->since += now - std::max(half->since, began);
}

void Shots::loseReceiving(const std::string& reason, Time now) {
  if (_receiving == 0) return;
  Entry& entry = _pictures.at(_receiving);
  receivingEnded(now);
  entry.lost = true;
  ++entry.shot->lost;
  const bool explained = !entry.reason.empty();
  _notices.push_back({Notice::Kind::kNotReceived, entry.file.shutter, entry.file, explained ? entry.reason : reason,
                      entry.remark, explained, entry.file.announced});
  settle(*entry.shot);
  disturb(now);
}

void Shots::loseShutter(std::size_t index, const std::string& reason) {
  const auto at = _shutters.begin() + static_cast<std::ptrdiff_t>(index);
  const bool explained = !at->reason.empty();
  _notices.push_back(
      {Notice::Kind::kShutterFailed, at->number, {}, explained ? at->reason : reason, at->remark, explained, at->sent});
  ++_counts.own.missing;
  ++_counts.failedInARow;
  _shutters.erase(at);
}

void Shots::losePartner(const std::shared_ptr<Shot>& shot) {
  shot->waits = false;
  ++shot->lost;
  Picture file;
  file.pair = shot->first;
  file.shutter = shot->shutter;
  file.own = shot->own;
  _notices.push_back({Notice::Kind::kNoPartner, shot->shutter, file,
                      "the other file of " + shot->base + "." + shot->extension + " did not come", "", false,
                      shot->since});
  settle(*shot);
}

void Shots::settle(Shot& shot) {
  using State = Shot::State;
  const State before = shot.state;
  shot.state = shot.notSaved > 0                         ? State::kUnsaved
               : shot.lost > 0                           ? State::kMissing
               : !shot.waits && shot.saved == shot.files ? State::kSaved
                                                         : State::kOpen;
  if (shot.state == before) return;
  const auto add = [&](State state, int one) {
    Tally& tally = tallyOf(shot.shutter);
    if (state == State::kUnsaved) tally.notSaved += one;
    if (state == State::kMissing) tally.missing += one;
    if (state == State::kSaved) tally.saved += one;
  };
  add(before, -1);
  add(shot.state, 1);
  if (shot.shutter == 0 || shot.state == State::kOpen) return;
  _counts.failedInARow = shot.state == State::kSaved ? 0 : _counts.failedInARow + 1;
}

// The time.

Shots::Span Shots::hold() const {
  const Span span = _lag ? std::max<Span>(kLeastHold, *_lag * kHoldByLag) : Span(kFirstHold);
  return std::min(span, _timeout);
}

Shots::Span Shots::patience(const Picture& file) const {
  const std::int64_t size = std::clamp<std::int64_t>(file.size, 0, UINT32_MAX);
  return _timeout + std::chrono::milliseconds(size * 1000 / kSlowestTransfer);
}

void Shots::check(Time now) {
  if (_receiving != 0) {
    checkReceiving(now);
  } else {
    checkWaiting(now);
  }
}

void Shots::checkReceiving(Time now) {
  Entry& entry = _pictures.at(_receiving);
  const Span taken = now - entry.file.announced;
  if (entry.brokenOff && now >= *entry.brokenOff + kAfterEnd) {
    loseReceiving("its transfer broke off", now);
  } else if (taken >= patience(entry.file)) {
    loseReceiving("its transfer has not ended after " + secondsText(taken), now);
  } else if (taken >= _timeout && !std::exchange(entry.slow, true) && entry.reason.empty()) {
    _notices.push_back(
        {Notice::Kind::kStillComing, entry.file.shutter, entry.file, "", "", true, entry.file.announced});
  }
}

void Shots::checkWaiting(Time now) {
  for (std::size_t i = 0; i < _shutters.size();) {
    Shutter& shutter = _shutters[i];
    if (shutter.exposed && now >= shutter.since + _timeout) {
      loseShutter(i, "no picture came within " + secondsText(_timeout));
      continue;
    }
    shutter.overdue = shutter.overdue || (shutter.exposed && now >= shutter.since + hold());
    ++i;
  }
  for (const auto& half : _halves) {
    if (half->waits && now >= half->since + _timeout) losePartner(half);
  }
}

Shots::Time Shots::nextCheck(Time now) const {
  Time next = Time::max();
  const auto by = [&](Time time) { next = std::min(next, time); };
  if (_receiving != 0) {
    const Entry& entry = _pictures.at(_receiving);
    if (entry.brokenOff) by(*entry.brokenOff + kAfterEnd);
    by(entry.file.announced + (entry.slow ? patience(entry.file) : std::min(_timeout, patience(entry.file))));
    return next;
  }
  for (const Shutter& shutter : _shutters) {
    if (shutter.exposed) by(shutter.since + (shutter.overdue ? _timeout : hold()));
  }
  for (const auto& half : _halves) {
    if (half->waits) by(half->since + _timeout);
  }
  if (!isCalm(now)) by(_disturbed + _timeout);
  return next;
}

void Shots::delayed(Span time) {
  for (Shutter& shutter : _shutters) shutter.since += time;
  for (const auto& half : _halves) half->since += time;
  for (Probe& probe : _probes) probe.sent += time;
  if (_receiving != 0) {
    Entry& entry = _pictures.at(_receiving);
    entry.file.announced += time;
    if (entry.brokenOff) *entry.brokenOff += time;
  }
  _disturbed += time;
}

}  // namespace tether::command
