#include "RunLoop.h"

#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cassert>
#include <cerrno>
#include <exception>
#include <limits>
#include <optional>
#include <system_error>
#include <utility>

#include "Log.h"

namespace platform {

struct RunLoop::Waiter {
  Mutex lock;
  Condition changed;
  bool done GUARDED_BY(lock) = false;
  bool ran GUARDED_BY(lock) = false;
  std::exception_ptr thrown GUARDED_BY(lock);

  bool waitForEnd() {
    const Guard guard(lock);
    while (!done) changed.wait(lock);
    if (thrown) std::rethrow_exception(thrown);
    return ran;
  }

  bool waitUntil(Clock::time_point until) {
    const Guard guard(lock);
    while (!done && changed.waitUntil(lock, until)) {
    }
    return done;
  }

  // Whoever calls this keeps the waiter; so the waiting thread may be woken outside the lock, which it wants at once.
  void finish(bool hasRun, std::exception_ptr exception) {
    {
      const Guard guard(lock);
      done = true;
      ran = hasRun;
      thrown = std::move(exception);
    }
    changed.notifyAll();
  }
};

// Heaps have the greatest in front: the timer that is due first.
struct RunLoop::Later {
  bool operator()(const Scheduled& a, const Scheduled& b) const {
    return std::pair(a.due, a.order) > std::pair(b.due, b.order);
  }
};

// A timer whose callback is running; the frames form a stack, innermost first.
struct RunLoop::Firing {
  std::uint64_t id;
  bool cancelled;
  Firing* outer;
};

struct RunLoop::Watch {
  int descriptor;
  Call readable;
  bool enabled = true;
  bool ready = false;
};

namespace {

thread_local std::shared_ptr<RunLoop> threadLoop;

void setDescriptorFlags(int descriptor) {
  fcntl(descriptor, F_SETFD, FD_CLOEXEC);
  fcntl(descriptor, F_SETFL, fcntl(descriptor, F_GETFL) | O_NONBLOCK);
}

void logUncaught() {
  try {
    throw;
  } catch (const std::exception& exception) {
    log("Uncaught exception in a run loop callback: %s", exception.what());
  } catch (...) {
    log("Uncaught exception in a run loop callback");
  }
}

Clock::duration toClock(Seconds seconds) { return std::chrono::duration_cast<Clock::duration>(seconds); }

}  // namespace

const std::shared_ptr<RunLoop>& RunLoop::current() {
  if (!threadLoop) threadLoop = make();
  return threadLoop;
}

std::shared_ptr<RunLoop> RunLoop::make() { return std::shared_ptr<RunLoop>(new RunLoop); }

void RunLoop::setCurrent(std::shared_ptr<RunLoop> loop) { threadLoop = std::move(loop); }

void RunLoop::endCurrent() {
  if (!threadLoop) return;
  threadLoop->end();
  threadLoop.reset();
}

RunLoop::RunLoop() {
  std::array<int, 2> ends{};
  if (pipe(ends.data()) != 0) throw std::system_error(errno, std::generic_category(), "run loop pipe");
  for (const int descriptor : ends) setDescriptorFlags(descriptor);
  _wakeRead = ends[0];
  _wakeWrite = ends[1];
}

RunLoop::~RunLoop() {
  end();
  close(_wakeRead);
  close(_wakeWrite);
}

bool RunLoop::isCurrent() const { return threadLoop.get() == this; }

bool RunLoop::post(Call call) { return enqueue(std::move(call), nullptr, false); }

bool RunLoop::perform(const Call& call) {
  if (isCurrent()) {
    call();
    return true;
  }
  auto waiter = std::make_shared<Waiter>();
  return enqueue(call, waiter, false) && waiter->waitForEnd();
}

bool RunLoop::performUrgently(const Call& call, Clock::duration wait) {
  if (isCurrent()) {
    call();
    return true;
  }
  auto waiter = std::make_shared<Waiter>();
  if (!enqueue(call, waiter, true)) return false;
  if (!waiter->waitUntil(Clock::now() + wait) && takeBack(*waiter)) return false;
  return waiter->waitForEnd();
}

bool RunLoop::takeBack(const Waiter& waiter) {
  std::optional<Posted> taken;
  const Guard guard(_lock);
  const auto place = std::find_if(_posted.begin(), _posted.end(),
                                  [&](const Posted& posted) { return posted.waiter.get() == &waiter; });
  if (place == _posted.end()) return false;  // it has begun, or the loop has ended
  taken = takePosted(place);
  return true;
}

bool RunLoop::enqueue(Call call, std::shared_ptr<Waiter> waiter, bool urgent) {
  {
    const Guard guard(_lock);
    if (_ended) return false;
    _posted.push_back({Clock::now(), _nextOrder++, std::move(call), std::move(waiter), urgent});
    if (urgent) ++_urgent;
  }
  wakeUp();
  return true;
}

void RunLoop::wakeUp() {
  {
    const Guard guard(_lock);
    if (std::exchange(_wakeUpSent, true)) return;
  }
  // Outside the lock, which the loop wants as soon as it wakes.
  const char byte = 0;
  while (write(_wakeWrite, &byte, 1) < 0 && errno == EINTR) {
  }
}

void RunLoop::end() {
  std::deque<Posted> dropped;
  {
    const Guard guard(_lock);
    _ended = true;
    dropped.swap(_posted);
  }
  for (Posted& posted : dropped) {
    posted.call = nullptr;
    if (posted.waiter) posted.waiter->finish(false, nullptr);
  }
  std::vector<Scheduled>().swap(_timers);
  std::vector<std::shared_ptr<Watch>>().swap(_watches);
}

void RunLoop::run() {
  const bool outer = std::exchange(_stopped, false);
  while (!_stopped) turn(Clock::time_point::max());
  _stopped = outer;
}

void RunLoop::stop() {
  assert(isCurrent());
  _stopped = true;
}

bool RunLoop::runOnce(Clock::time_point until) {
  assert(isCurrent());
  if (!hasInputs()) return false;
  turn(until);
  return true;
}

void RunLoop::turn(Clock::time_point until) {
  waitForWork(until);
  const auto now = Clock::now();
  std::uint64_t limit = 0;
  {
    const Guard guard(_lock);
    limit = _nextOrder;
  }
  while (runNextDue(now, limit)) {
  }
  runReadyWatches();
}

void RunLoop::performAfter(Seconds delay, Call call) {
  schedule(toClock(delay), Clock::duration::zero(), std::move(call));
}

std::uint64_t RunLoop::schedule(Clock::duration delay, Clock::duration interval, Call call) {
  assert(isCurrent());
  std::uint64_t order = 0;
  {
    const Guard guard(_lock);
    order = _nextOrder++;
  }
  const std::uint64_t id = _nextId++;
  insert({Clock::now() + delay, order, id, interval, std::move(call)});
  return id;
}

void RunLoop::insert(Scheduled timer) {
  _timers.push_back(std::move(timer));
  std::push_heap(_timers.begin(), _timers.end(), Later());
}

void RunLoop::cancel(std::uint64_t id) {
  for (Firing* firing = _firing; firing != nullptr; firing = firing->outer) {
    if (firing->id == id) firing->cancelled = true;
  }
  const auto found =
      std::find_if(_timers.begin(), _timers.end(), [&](const Scheduled& timer) { return timer.id == id; });
  if (found == _timers.end()) return;
  const Call dropped = std::move(found->call);  // what it owns may come back here when it goes
  _timers.erase(found);
  std::make_heap(_timers.begin(), _timers.end(), Later());
}

bool RunLoop::hasInputs() {
  if (!_timers.empty() || _firing != nullptr || !_watches.empty()) return true;
  const Guard guard(_lock);
  return !_posted.empty();
}

void RunLoop::waitForWork(Clock::time_point until) {
  if (!_timers.empty()) until = std::min(until, _timers.front().due);
  {
    const Guard guard(_lock);
    if (!_posted.empty()) until = Clock::time_point::min();
  }

  int timeout = -1;
  if (until != Clock::time_point::max()) {
    const auto left = until - std::min(until, Clock::now());
    // Rounded up: waking early would mean waking twice.
    const auto milliseconds = std::chrono::ceil<std::chrono::milliseconds>(left).count();
    timeout = static_cast<int>(std::min<std::int64_t>(milliseconds, std::numeric_limits<int>::max()));
  }

  std::array<pollfd, 8> few{};
  std::vector<pollfd> many;
  if (_watches.size() + 1 > few.size()) many.resize(_watches.size() + 1);
  pollfd* const polled = many.empty() ? few.data() : many.data();
  polled[0] = {_wakeRead, POLLIN, 0};
  for (std::size_t index = 0; index < _watches.size(); ++index) {
    const Watch& watch = *_watches[index];
    polled[index + 1] = {watch.enabled ? watch.descriptor : -1, POLLIN, 0};
  }
  if (poll(polled, static_cast<nfds_t>(_watches.size() + 1), timeout) <= 0) return;

  for (std::size_t index = 0; index < _watches.size(); ++index) {
    _watches[index]->ready = polled[index + 1].revents != 0;
  }
  if (polled[0].revents != 0) {
    const Guard guard(_lock);
    char byte = 0;  // there is never more than one
    while (read(_wakeRead, &byte, 1) < 0 && errno == EINTR) {
    }
    _wakeUpSent = false;
  }
}

bool RunLoop::runNextDue(Clock::time_point now, std::uint64_t limit) {
  const bool timerIsDue = !_timers.empty() && _timers.front().due <= now && _timers.front().order < limit;
  std::optional<Posted> posted;
  {
    const Guard guard(_lock);
    const bool postedIsDue = !_posted.empty() && _posted.front().order < limit;
    if (!timerIsDue && !postedIsDue) return false;
    const bool postedIsFirst =
        postedIsDue && (!timerIsDue || std::pair(_posted.front().due, _posted.front().order) <
                                           std::pair(_timers.front().due, _timers.front().order));
    if (postedIsFirst) posted = takePosted(_posted.begin());
  }
  if (posted) {
    runPosted(std::move(*posted));
    return true;
  }
  std::pop_heap(_timers.begin(), _timers.end(), Later());
  Scheduled due = std::move(_timers.back());
  _timers.pop_back();
  fire(std::move(due));
  return true;
}

RunLoop::Posted RunLoop::takePosted(const std::deque<Posted>::iterator& place) {
  Posted posted = std::move(*place);
  _posted.erase(place);
  if (posted.urgent) --_urgent;
  return posted;
}

void RunLoop::runPosted(Posted posted) {
  std::exception_ptr thrown;
  try {
    posted.call();
  } catch (...) {
    if (posted.waiter) {
      thrown = std::current_exception();
    } else {
      logUncaught();
    }
  }
  posted.call = nullptr;
  if (posted.waiter) posted.waiter->finish(true, std::move(thrown));
}

void RunLoop::runUrgentCalls() {
  while (threadLoop && threadLoop->_urgent > 0 && threadLoop->runNextUrgent()) {
  }
}

bool RunLoop::runNextUrgent() {
  std::optional<Posted> posted;
  {
    const Guard guard(_lock);
    const auto next = std::find_if(_posted.begin(), _posted.end(), [](const Posted& each) { return each.urgent; });
    if (next == _posted.end()) return false;
    posted = takePosted(next);
  }
  runPosted(std::move(*posted));
  return true;
}

void RunLoop::fire(Scheduled timer) {
  Firing frame{timer.id, false, _firing};
  _firing = &frame;
  try {
    timer.call();
  } catch (...) {
    logUncaught();
  }
  _firing = frame.outer;
  if (timer.interval == Clock::duration::zero() || frame.cancelled) return;

  timer.due += timer.interval;
  const auto now = Clock::now();
  if (timer.due <= now) timer.due += ((now - timer.due) / timer.interval + 1) * timer.interval;
  {
    const Guard guard(_lock);
    timer.order = _nextOrder++;
  }
  insert(std::move(timer));
}

void RunLoop::runReadyWatches() {
  for (std::size_t index = 0; index < _watches.size();) {
    const std::shared_ptr<Watch> watch = _watches[index];
    if (!watch->ready || !watch->enabled) {
      ++index;
      continue;
    }
    watch->ready = false;
    try {
      watch->readable();
    } catch (...) {
      logUncaught();
    }
    index = 0;  // the callback may have changed the list; what is still ready is found again
  }
}

Timer Timer::once(Seconds delay, RunLoop::Call call) {
  const auto& loop = RunLoop::current();
  return {loop, loop->schedule(toClock(delay), Clock::duration::zero(), std::move(call))};
}

Timer Timer::repeating(Seconds interval, RunLoop::Call call) {
  const auto& loop = RunLoop::current();
  return {loop, loop->schedule(toClock(interval), toClock(interval), std::move(call))};
}

Timer::Timer(Timer&& other) noexcept : _loop(std::move(other._loop)), _id(std::exchange(other._id, 0)) {}

Timer& Timer::operator=(Timer&& other) noexcept {
  if (this != &other) {
    invalidate();
    _loop = std::move(other._loop);
    _id = std::exchange(other._id, 0);
  }
  return *this;
}

void Timer::invalidate() {
  const auto loop = std::move(_loop);
  if (loop) loop->cancel(std::exchange(_id, 0));
}

DescriptorWatch::DescriptorWatch(int descriptor, RunLoop::Call readable)
    : _loop(RunLoop::current()),
      _watch(std::make_shared<RunLoop::Watch>(RunLoop::Watch{descriptor, std::move(readable)})) {
  _loop->_watches.push_back(_watch);
}

DescriptorWatch& DescriptorWatch::operator=(DescriptorWatch&& other) noexcept {
  if (this != &other) {
    end();
    _loop = std::move(other._loop);
    _watch = std::move(other._watch);
  }
  return *this;
}

void DescriptorWatch::setEnabled(bool enabled) {
  _watch->enabled = enabled;
  if (!enabled) _watch->ready = false;
}

void DescriptorWatch::end() {
  if (!_watch) return;
  auto& watches = _loop->_watches;
  watches.erase(std::remove(watches.begin(), watches.end(), _watch), watches.end());
  _watch->enabled = false;
  _watch.reset();
  _loop.reset();
}

}  // namespace platform
