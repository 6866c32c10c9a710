#include "FileSaver.h"

#include <csignal>

namespace tether {

FileSaver::FileSaver(std::string folder, std::shared_ptr<Wakeup> wakeup, FileCalls* calls)
    : _mover(folder, calls),
      _leftovers(std::move(folder), calls),
      _wakeup(std::move(wakeup)),
      _thread([this] { run(); }) {}

FileSaver::~FileSaver() {
  {
    const platform::Guard guard(_lock);
    _ends = true;
  }
  _changed.notifyAll();
  _thread.join();
}

void FileSaver::submit(Job job) {
  {
    const platform::Guard guard(_lock);
    _jobs.push_back(std::move(job));
  }
  _changed.notifyAll();
}

std::optional<FileSaver::Saved> FileSaver::next() {
  const platform::Guard guard(_lock);
  if (_done.empty()) return {};
  Saved saved = std::move(_done.front());
  _done.pop_front();
  return saved;
}

std::size_t FileSaver::pending() const {
  const platform::Guard guard(_lock);
  return _jobs.size() + _done.size();
}

void FileSaver::collectLeftovers() {
  {
    const platform::Guard guard(_lock);
    _collects = true;
  }
  _changed.notifyAll();
}

std::optional<Leftover> FileSaver::nextLeftover() {
  const platform::Guard guard(_lock);
  if (_told.empty()) return {};
  Leftover leftover = std::move(_told.front());
  _told.pop_front();
  return leftover;
}

bool FileSaver::waitUntil(Clock::time_point until) {
  const platform::Guard guard(_lock);
  while ((!_jobs.empty() || _collects) && _changed.waitUntil(_lock, until)) continue;
  return _jobs.empty() && !_collects;
}

void FileSaver::run() {
  // Signals are the other threads' business.
  sigset_t all;
  sigfillset(&all);
  pthread_sigmask(SIG_BLOCK, &all, nullptr);
  const platform::Guard guard(_lock);
  for (;;) {
    while (!_ends && !_collects && _jobs.empty()) _changed.wait(_lock);
    if (!_jobs.empty()) {
      const Job& job = _jobs.front();  // stays where it is while others are added behind it
      Saved saved{job.ticket, {}};
      {
        const platform::Release meanwhile(_lock);
        saved.file = save(job);
      }
      _done.push_back(std::move(saved));
      _jobs.pop_front();
    } else if (_ends) {
      return;
    } else {
      std::optional<Leftover> leftover;
      {
        const platform::Release meanwhile(_lock);
        leftover = _leftovers.next();
      }
      _collects = leftover.has_value();
      if (leftover) _told.push_back(*std::move(leftover));
    }
    _changed.notifyAll();
    if (_wakeup) _wakeup->nudge();
  }
}

MovedFile FileSaver::save(const Job& job) {
  if (!job.directory->holds(job.source)) {
    MovedFile refused;
    refused.path = job.source;
    refused.description = "the helper named a file outside its directory";
    return refused;
  }
  job.directory->noteMove(job.source);
  const auto known = _bases.find(job.pair);
  const bool first = job.pair != 0 && known == _bases.end();
  const bool second = job.pair != 0 && !first;
  MovedFile moved =
      _mover.move(job.source, job.name, job.size, first, second ? std::optional(known->second) : std::nullopt);
  if (moved.moved && first) _bases[job.pair] = moved.base;
  return moved;
}

}  // namespace tether
