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
    const std::lock_guard guard(_lock);
    _ends = true;
  }
  _changed.notify_all();
  _thread.join();
}

void FileSaver::submit(Job job) {
  {
    const std::lock_guard guard(_lock);
    _jobs.push_back(std::move(job));
  }
  _changed.notify_all();
}

std::optional<FileSaver::Saved> FileSaver::next() {
  const std::lock_guard guard(_lock);
  if (_done.empty()) return {};
  Saved saved = std::move(_done.front());
  _done.pop_front();
  return saved;
}

std::size_t FileSaver::pending() const {
  const std::lock_guard guard(_lock);
  return _jobs.size() + _done.size();
}

void FileSaver::collectLeftovers() {
  {
    const std::lock_guard guard(_lock);
    _collects = true;
  }
  _changed.notify_all();
}

std::optional<Leftover> FileSaver::nextLeftover() {
  const std::lock_guard guard(_lock);
  if (_told.empty()) return {};
  Leftover leftover = std::move(_told.front());
  _told.pop_front();
  return leftover;
}

bool FileSaver::waitUntil(Clock::time_point until) {
  std::unique_lock guard(_lock);
  return _changed.wait_until(guard, until, [this] { return _jobs.empty() && !_collects; });
}

void FileSaver::run() {
  // Signals are the other threads' business.
  sigset_t all;
  sigfillset(&all);
  pthread_sigmask(SIG_BLOCK, &all, nullptr);
  std::unique_lock guard(_lock);
  for (;;) {
    _changed.wait(guard, [this] { return _ends || _collects || !_jobs.empty(); });
    if (!_jobs.empty()) {
      const Job& job = _jobs.front();  // stays where it is while others are added behind it
      guard.unlock();
      Saved saved{job.ticket, save(job)};
      guard.lock();
      _done.push_back(std::move(saved));
      _jobs.pop_front();
    } else if (_ends) {
      return;
    } else {
      guard.unlock();
      auto leftover = _leftovers.next();
      guard.lock();
      _collects = leftover.has_value();
      if (leftover) _told.push_back(*std::move(leftover));
    }
    _changed.notify_all();
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
