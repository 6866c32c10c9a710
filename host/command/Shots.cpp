#include "Shots.h"

#include <algorithm>
#include <utility>

#include "FileManager.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

// How long an unanswered probe is waited for, and a transfer before it is asked about.
constexpr auto kProbeAgain = 1s;
// Overdue shutters, and one that is not.
constexpr std::size_t kMostWaiting = 4;
// The first heartbeat after a shutter may have been on its way.
constexpr int kBeatsToBelieve = 2;

}  // namespace

// What is sent.

void Shots::connected(Time probeFrom) {
  disturb(probeFrom);
  _probeFrom = probeFrom;
}

int Shots::shutterSent(const std::optional<std::int32_t>& probe, Time now) {
  Shutter shutter;
  // Only where an answer is to be expected.
  if (probe && _calm >= kCalm) shutter.fence = *probe;
  shutter.number = ++_counts.shutters;
  shutter.sent = shutter.since = now;
  shutter.unsure = _otherSinceCalm && !isCalm(now);
  _shutters.push_back(shutter);
  _beats = 0;
  _ownSinceCalm = true;
  disturb(now);
  return shutter.number;
}

void Shots::probeSent(std::int32_t id, Time now) { _probes.push_back({id, _counts.shutters, _disturbances, now}); }

Shots::Time Shots::nextProbe() const {
  if (!_probes.empty()) return _probes.back().sent + kProbeAgain;
  if (_receiving != 0) {
    const Entry& entry = _pictures.at(_receiving);
    if (entry.brokenOff) return Time::max();
    return entry.reason.empty() ? entry.file.announced + kProbeAgain : _disturbed;
  }
  return _calm < kCalm ? _probeFrom : Time::max();
}

bool Shots::mayRelease(bool series, Time now) const {
  if (_exposed < _counts.shutters || _shutters.size() >= kMostWaiting) return false;
  if (series) return std::all_of(_shutters.begin(), _shutters.end(), [](const auto& one) { return one.overdue; });
  return expected() == 0 && isCalm(now);
}

// What comes.

void Shots::disturb(Time now) {
  ++_disturbances;
  _calm = 0;
  _disturbed = now;
}

void Shots::exposedUpTo(int shutter, Time now) {
  _exposed = std::max(_exposed, shutter);
  for (Shutter& waiting : _shutters) {
    if (waiting.number > _exposed || std::exchange(waiting.exposed, true)) continue;
    waiting.since = now;
  }
}

void Shots::answered(std::int32_t id, Time now) {
  const auto found = std::find_if(_probes.begin(), _probes.end(), [&](const Probe& probe) { return probe.id == id; });
  if (found == _probes.end()) return;
  const Probe probe = *found;
  _probes.erase(_probes.begin(), found + 1);  // those before it were dropped
  for (Shutter& shutter : _shutters) {
    if (id >= shutter.fence) shutter.fence = 0;
  }
  exposedUpTo(probe.shutters, now);
  if (probe.disturbances != _disturbances) return;
  if (_receiving != 0) {
    auto& brokenOff = _pictures.at(_receiving).brokenOff;
    if (!brokenOff) brokenOff = now;
    return;
  }
  if (++_calm != kCalm) return;
  _ownSinceCalm = !_shutters.empty();
  _otherSinceCalm = false;
  for (std::size_t i = _shutters.size(); i-- > 0;) {
    if (!_shutters[i].reason.empty()) loseShutter(i, _shutters[i].reason);
  }
}

void Shots::heartbeat(Time now) {
  if (++_beats >= kBeatsToBelieve) exposedUpTo(_counts.shutters, now);
}

const Picture& Shots::announced(const ObjectWasAdded& object, const std::optional<Camera>& camera, Time now) {
  loseReceiving("its transfer broke off, and the next picture's began", now);
  disturb(now);
  Entry entry;
  entry.file.number = ++_lastNumber;
  entry.file.captureId = object.capture_id;
  entry.file.name = object.file_name;
  entry.file.size = object.file_size;
  entry.file.camera = camera;
  entry.file.since = entry.file.announced = now;
  entry.shot = shotOf(object, entry, now);
  _receiving = _lastNumber;
  _numbers[object.capture_id] = _lastNumber;
  return (_pictures[_lastNumber] = std::move(entry)).file;
}

// Finds the other file's shot, or begins one.
std::shared_ptr<Shots::Shot> Shots::shotOf(const ObjectWasAdded& object, Entry& entry, Time now) {
  Picture& file = entry.file;
  const std::string_view name = platform::lastPathComponent(object.file_name);
  const std::string base(platform::deletingPathExtension(name));
  const std::string extension(platform::pathExtension(name));
  const auto isHalf = [&](const auto& half) { return half->base == base && half->extension != extension; };
  auto half = _halves.end();
  if (object.has_sidecar) {
    half = std::find_if(_halves.begin(), _halves.end(), [&](const auto& one) { return one->waits && isHalf(one); });
    if (half == _halves.end()) half = std::find_if(_halves.begin(), _halves.end(), isHalf);  // given up
  }
  if (half != _halves.end()) {
    auto shot = *half;
    _halves.erase(half);
    file.late = !std::exchange(shot->waits, false);
    if (file.late) --shot->lost;
    file.pair = shot->first;
    file.shutter = shot->shutter;
    file.own = shot->own;
    ++shot->files;
    settle(*shot);
    return shot;
  }
  // Of one camera nothing comes between the two files of a pair.
  for (const auto& one : _halves) {
    if (file.camera && one->waits) losePartner(one);
  }
  auto shot = std::make_shared<Shot>();
  match(entry, now);
  shot->first = file.number;
  shot->shutter = file.shutter;
  shot->own = file.own;
  shot->files = 1;
  if (object.has_sidecar) {
    file.pair = file.number;
    shot->waits = true;
    shot->base = base;
    shot->extension = extension;
    shot->since = now;
    _halves.push_back(shot);
  }
  return shot;
}

// The shutter whose picture would come next.
std::deque<Shots::Shutter>::iterator Shots::turn() {
  const auto found = std::find_if(_shutters.begin(), _shutters.end(), [](const auto& one) { return !one.overdue; });
  return found == _shutters.end() ? _shutters.begin() : found;
}

// Whose it is.
void Shots::match(Entry& entry, Time now) {
  Picture& file = entry.file;
  auto shutter = turn();
  // What was on its way when the shutter was fired is that picture alone.
  const bool before = shutter != _shutters.end() && std::exchange(shutter->fence, 0) != 0;
  if (before) shutter = _shutters.front().overdue ? _shutters.begin() : _shutters.end();
  if (shutter != _shutters.end()) {
    if (_shutters.size() == 1) _lag = std::max(_lag.value_or(0s), shutter->exposed ? now - shutter->since : 0s);
    file.shutter = shutter->number;
    file.since = shutter->sent;
    file.own = shutter->unsure ? Own::kUnknown : Own::kYes;
    entry.remark = shutter->remark;
    exposedUpTo(shutter->number, now);
    _shutters.erase(shutter);
  } else {
    file.own = _ownSinceCalm && !before ? Own::kUnknown : Own::kNo;
    _otherSinceCalm = true;
  }
}

Picture Shots::completed(const FileDownloadComplete& complete, const std::optional<Camera>& camera, Time now) {
  auto known = _numbers.find(complete.capture_id);
  if (known == _numbers.end()) {
    ObjectWasAdded object;
    object.capture_id = complete.capture_id;
    object.file_name = platform::lastPathComponent(complete.file_path);
    object.file_size = -1;
    announced(object, camera, now);
    known = _numbers.find(complete.capture_id);
  }
  Entry& entry = _pictures.at(known->second);
  _numbers.erase(known);
  if (std::exchange(entry.lost, false)) {
    entry.file.late = true;
    --entry.shot->lost;
    settle(*entry.shot);
  }
  if (_receiving == entry.file.number) receivingEnded(now);
  disturb(now);
  return entry.file;
}

void Shots::ended(int number, bool saved) {
  const auto found = _pictures.find(number);
  if (found == _pictures.end()) return;
  const auto shot = found->second.shot;
  _pictures.erase(found);
  ++(saved ? shot->saved : shot->notSaved);
  settle(*shot);
}

void Shots::unplugged(const std::string& reason, Time now) {
  if (_receiving != 0) {
    Entry& entry = _pictures.at(_receiving);
    if (entry.file.shutter != 0 || entry.file.camera) entry.reason = reason;
  }
  for (Shutter& shutter : _shutters) shutter.reason = reason;
  _probes.clear();  // one that is sent now tells more
  disturb(now);
}

bool Shots::remark(const std::string& text) {
  if (_receiving != 0) {
    Entry& entry = _pictures.at(_receiving);
    const auto isItsOwn = [&](const std::string& line) { return line.find(entry.file.name) != std::string::npos; };
    // Else it is the next one's, whose announcement is still to be taken.
    if (!isItsOwn(entry.remark) || isItsOwn(text)) {
      entry.remark = text;
      return true;
    }
  }
  if (_shutters.empty()) return false;
  // Of several that are overdue it is the last one's: the others had their time.
  const auto shutter = turn();
  (shutter->overdue ? _shutters.back() : *shutter).remark = text;
  return true;
}

void Shots::giveUp(const std::string& reason, Time now) {
  loseReceiving(reason, now);
  while (!_shutters.empty()) loseShutter(0, reason);
  for (const auto& half : _halves) {
    if (half->waits) losePartner(half);
  }
  _exposed = _counts.shutters;
  _numbers.clear();
  _halves.clear();
  _probes.clear();
  _calm = kCalm;
  for (auto entry = _pictures.begin(); entry != _pictures.end();) {
    entry = entry->second.lost ? _pictures.erase(entry) : std::next(entry);
  }
}

std::size_t Shots::expected() const {
  const auto coming =
      std::count_if(_pictures.begin(), _pictures.end(), [](const auto& one) { return !one.second.lost; });
  const auto halves = std::count_if(_halves.begin(), _halves.end(), [](const auto& half) { return half->waits; });
  return _shutters.size() + static_cast<std::size_t>(coming + halves);
}

std::optional<Shots::Time> Shots::waitingSince() const {
  if (_shutters.empty()) return {};
  return _shutters.front().sent;
}

}  // namespace tether::command
