#include "Pictures.h"

#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <system_error>

#include "FileManager.h"

namespace tether::command {
namespace {

using namespace std::chrono_literals;

constexpr auto kBriefly = 5s;
constexpr auto kEndGrace = 5s;
// Who was stopped, or held up, for longer than this has seen nothing of what came meanwhile.
constexpr auto kPause = 1s;
constexpr auto kDiskStep = 1s;
// So much earlier than an announcement a line of the log may be taken that was written after it.
constexpr auto kLineAhead = 1s;
// With less room than this no picture can be received.
constexpr std::uint64_t kLittleRoom = std::uint64_t{1} << 20;

// Where a relative path leads may change; what is said of it must not.
std::string preparedFolder(const std::string& given) {
  std::error_code error;
  std::filesystem::create_directories(given, error);
  if (!platform::FileManager::isDirectory(given)) {
    throw Failure{kUsage, "cannot make the folder " + given + (error ? ": " + error.message() : "")};
  }
  std::string folder = std::filesystem::absolute(given, error).lexically_normal();
  if (error) folder = given;
  while (folder.size() > 1 && folder.back() == '/') folder.pop_back();
  std::string tried = platform::appendingPathComponent(folder, ".tether.XXXXXX");
  const Descriptor file(mkstemp(tried.data()));
  if (!file)
    throw Failure{statusWithoutFile(errno), "cannot write in the folder " + folder + ": " + std::strerror(errno)};
  unlink(tried.c_str());
  return folder;
}

// Written for every object that is deleted.
bool isNoise(const std::string& line) {
  return line.find(" - ACQLOCK - for deleting CNikonObject") != std::string::npos;
}

}  // namespace

Pictures::Pictures(const Options& options, Console& console, Link& link, const std::shared_ptr<Wakeup>& wakeup,
                   bool sendsShutters)
    : _options(options),
      _console(console),
      _link(link),
      _sendsShutters(sendsShutters),
      _folder(preparedFolder(options.output)),
      _saver(_folder, wakeup),
      _report(console, _folder, sendsShutters),
      _shots(link.timeout()) {
  _saver.collectLeftovers();
}

// The course.

std::optional<Event> Pictures::next(Clock::time_point until) {
  notePause(_handled);
  probe();
  until = std::min(until, _shots.nextCheck(Clock::now()));
  if (_link.canProbe()) until = std::min(until, _shots.nextProbe());
  if (!_strays.empty()) until = std::min(until, _strays.front().since + kLineAhead);
  auto event = _link.next(until);
  if (!event) notePause(until);
  if (event) take(*event);
  takeSaved();
  takeLeftovers();
  // What came is looked at before anything is held to be missing.
  if (!event) {
    _shots.check(Clock::now());
    tellStrays(Clock::now() - kLineAhead);
  }
  tellNotices();
  if (!event && _saving.empty()) _link.tidy(_left);
  _handled = Clock::now();
  return event;
}

void Pictures::notePause(Clock::time_point expected) {
  const auto late = Clock::now() - expected;
  if (late > kPause) _shots.delayed(late);
}

void Pictures::probe() {
  if (!_link.canProbe() || Clock::now() < _shots.nextProbe()) return;
  if (const auto id = _link.probe()) _shots.probeSent(*id, Clock::now());
}

void Pictures::take(const Event& event) {
  const auto now = Clock::now();
  if (const auto* const added = std::get_if<ObjectWasAdded>(&event)) {
    const Picture& picture = _shots.announced(*added, _link.onlyCamera(), now);
    tellNotices();  // of the one before
    _report.receiving(picture);
    giveLog(picture);
  } else if (const auto* const complete = std::get_if<FileDownloadComplete>(&event)) {
    save(_shots.completed(*complete, _link.onlyCamera(), now), complete->file_path);
  } else if (const auto* const other = std::get_if<OtherMessage>(&event)) {
    _shots.answered(other->id, now);
  } else if (std::holds_alternative<Heartbeat>(event)) {
    _shots.heartbeat(now);
  } else if (const auto* const removed = std::get_if<DeviceRemoved>(&event)) {
    unplugged(*removed);
  } else if (const auto* const line = std::get_if<LogLine>(&event)) {
    takeLog(line->text);
  }
  tellNotices();
}

void Pictures::connected() { _shots.connected(std::max(Clock::now(), _link.firstPassBy())); }

bool Pictures::releaseShutter() {
  _link.throwIfStopped();
  const auto before = _link.probe();
  if (before) _shots.probeSent(*before, Clock::now());
  _link.session().send("doCapture");
  if (_link.session().lost()) return false;
  _report.shutter(_shots.shutterSent(before, Clock::now()));
  if (const auto behind = _link.probe()) _shots.probeSent(*behind, Clock::now());
  return true;
}

void Pictures::unplugged(const DeviceRemoved& removed) {
  const Camera& camera = _link.lastRemoved();
  const bool ours = _link.isChosen(camera);
  if (ours || !_sendsShutters) {
    const std::string text = camera.name + " (" + std::to_string(removed.device_id) + ") has gone";
    _report.camera("camera_removed", camera, _sendsShutters ? "" : text);
  }
  const Picture* const picture = _shots.receiving();
  if (picture != nullptr && (ours || !_sendsShutters)) {
    _console.say(camera.name + " was unplugged while " + picture->name + " was being received");
  }
  if (ours || _link.onlyCamera()) _shots.unplugged(camera.name + " was unplugged", Clock::now());
}

void Pictures::restart(const HelperLost& lost) {
  _link.end(0s, [this](const Event& event) { take(event); });
  _report.helperLost(lost.description);
  _shots.giveUp(lost.description, Clock::now());
  tellStrays(Clock::now());
  tellNotices();
  _link.restart(lost);
}

// Files.

void Pictures::save(const Picture& picture, const std::string& source) {
  FileSaver::Job job;
  job.ticket = static_cast<std::uint64_t>(picture.number);
  job.directory = _link.session().directory();
  job.source = source;
  job.name = picture.name;
  if (picture.size >= 0) job.size = picture.size;
  job.pair = static_cast<std::uint64_t>(picture.pair);
  _saving[picture.number] = picture;
  _saver.submit(std::move(job));
}

void Pictures::takeSaved() {
  while (const auto saved = _saver.next()) {
    const auto number = static_cast<int>(saved->ticket);
    const Picture picture = _saving.at(number);
    _saving.erase(number);
    _shots.ended(number, saved->file.moved);
    if (saved->file.moved) {
      _report.saved(picture, saved->file);
    } else {
      _report.notSaved(picture, saved->file);
      _left.insert(saved->file.path);
    }
  }
}

// What a tether left that was killed.
void Pictures::takeLeftovers() {
  while (const auto leftover = _saver.nextLeftover()) {
    const MovedFile& file = leftover->file;
    const bool saved = leftover->fate == Leftover::Fate::kSaved;
    const bool removed = leftover->fate == Leftover::Fate::kRemoved;
    const char* const fate = saved ? "saved" : removed ? "removed" : "left";
    Report::leftover(_console, fate, leftover->found, saved ? file.path : leftover->found, file.description);
    const std::string why = file.description.empty() ? "" : " (" + file.description + ")";
    if (saved) {
      _console.say("found " + leftover->found + ", left by a tether that was killed: saved as " + file.path + why);
    } else {
      _console.say((removed ? "removed " : "left where it is: ") + leftover->found + ", of a tether that was killed" +
                   why);
    }
  }
}

// Causes.

void Pictures::takeLog(const std::string& line) {
  if (isNoise(line)) return;
  _report.helperLog(line, _options.helperLog == "-");
  if (_shots.remark(line)) return;
  // Of a picture that nobody waits for nothing else will tell.
  std::string trouble = troubleInDirectory();
  if (!trouble.empty()) _strays.push_back({line, std::move(trouble), Clock::now()});
}

// A line may overtake the announcement of the picture that it is about.
void Pictures::giveLog(const Picture& picture) {
  const auto stray = std::find_if(_strays.begin(), _strays.end(),
                                  [&](const Stray& one) { return one.line.find(picture.name) != std::string::npos; });
  if (stray == _strays.end()) return;
  _shots.remark(stray->line);
  _strays.erase(stray);
}

void Pictures::tellStrays(Clock::time_point until) {
  for (; !_strays.empty() && _strays.front().since <= until; _strays.pop_front()) {
    _shots.neverCame();
    _report.neverCame(_strays.front().line + "; " + _strays.front().trouble);
  }
}

void Pictures::tellNotices() {
  for (const Notice& notice : _shots.takeNotices()) {
    std::string cause;
    if (!notice.explained) {
      const std::string trouble = troubleInDirectory();
      cause = notice.remark.empty() ? "" : "the helper says: " + notice.remark;
      cause += (cause.empty() || trouble.empty() ? "" : "; ") + trouble;
    }
    _report.notice(notice, cause);
  }
}

std::string Pictures::troubleInDirectory() const {
  const std::string& path = _link.directory();
  if (path.empty()) return {};
  if (!platform::FileManager::isDirectory(path)) return "its temporary folder " + path + " is gone";
  struct statvfs status {};
  if (statvfs(path.c_str(), &status) != 0) return {};
  const std::uint64_t room = std::uint64_t{status.f_bavail} * status.f_frsize;
  if (room >= kLittleRoom) return {};
  return "there is no room in its temporary folder " + path + " (" + sizeText(static_cast<std::int64_t>(room)) + ")";
}

// The end.

bool Pictures::isSettled() const { return _shots.expected() == 0 && _saving.empty() && _shots.isCalm(Clock::now()); }

std::string Pictures::status() const {
  const Picture* const picture = _shots.receiving();
  if (picture == nullptr) return {};
  return picture->name + " " + sizeText(picture->size) + " receiving " + secondsText(Clock::now() - picture->announced);
}

int Pictures::finish(Failure& failure) {
  _link.finishing();
  if (failure.status == kInterrupted || failure.status == kUnwritable) waitBriefly();
  _link.finishing();
  _link.end(kEndGrace, [this](const Event& event) { take(event); });
  _shots.giveUp(failure.status == kInterrupted ? "interrupted" : "the helper has ended", Clock::now());
  tellStrays(Clock::now());
  tellNotices();
  waitForDisk();
  _link.tidy(_left);
  const Shots::Counts& counts = _shots.counts();
  const int notSaved = counts.own.notSaved + counts.others.notSaved;
  const auto add = [&](int count, const std::string& what) {
    if (count == 0) return;
    failure.text += (failure.text.empty() ? "" : "; ") + countText(static_cast<std::size_t>(count), "picture") + what;
  };
  add(notSaved, " could not be saved");
  add(counts.others.missing, _sendsShutters ? " of others did not come" : " did not come");
  if (notSaved > 0) return kNotSaved;
  if (failure.status == kHelperLost || failure.status == kNoCamera) return failure.status;
  return counts.own.missing + counts.others.missing > 0 ? kTimeout : failure.status;
}

// Until nothing is awaited, or nothing more comes in time; a second Ctrl-C ends it.
void Pictures::waitBriefly() {
  const auto isOver = [](const std::optional<Event>& event) {
    return event && std::holds_alternative<HelperLost>(*event);
  };
  try {
    // What has been announced by now counts as under way, what has come does not.
    for (auto event = next(Clock::now()); event; event = next(Clock::now())) {
      if (isOver(event)) return;
    }
    if (_shots.expected() == 0) return;
    _console.say("waiting up to 5 seconds for " + countText(_shots.expected(), "picture") +
                 " under way; Ctrl-C again to leave");
    const auto until = Clock::now() + kBriefly;
    while (_shots.expected() > 0 && Clock::now() < until && !isOver(next(until))) {
    }
  } catch (const Failure&) {
    // Asked again: no more waiting.
  }
}

// However long it takes: what is not saved yet is whole, and in nobody's way where it is. A third Ctrl-C ends the
// process.
void Pictures::waitForDisk() {
  bool said = false;
  for (;;) {
    const bool done = _saver.waitUntil(Clock::now() + kDiskStep);
    takeSaved();
    takeLeftovers();
    if (done) return;
    if (!std::exchange(said, true)) _console.say("waiting for the disk");
  }
}

}  // namespace tether::command
