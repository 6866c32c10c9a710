// Brings finished pictures into a folder on a thread of its own, one after another in the order in which they were
// submitted: whoever submits never waits for a disk. How a file gets there, and what it is called there: FileMover.
//
// Only a regular file that lies in the private directory named with it, and that has the size that was announced, is
// touched; any other is reported as not saved and left as it is.
//
// Between the jobs it deals with what processes left behind that were killed, if asked to.
#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "FileMover.h"
#include "Leftovers.h"
#include "Locks.h"
#include "PrivateDirectory.h"
#include "Wakeup.h"

namespace tether {

class FileSaver {
 public:
  struct Job {
    std::uint64_t ticket = 0;  // the caller's, handed back
    // The session's. Kept until the job is done: what is in it outlives the session.
    std::shared_ptr<const PrivateDirectory> directory;
    std::string source;                // the helper's file
    std::string name;                  // as announced; only what follows the last slash counts
    std::optional<std::int64_t> size;  // in bytes, as announced
    std::uint64_t pair = 0;            // files with the same number get one base name; 0: a file by itself
  };
  struct Saved {
    std::uint64_t ticket = 0;
    MovedFile file;
  };

  // Files go to `folder`, which must exist by the first job. All that is done nudges the wakeup, which may be null.
  // `calls` must outlive the saver; null for the system's own. Throws std::system_error when there is no thread
  // to be had.
  FileSaver(std::string folder, std::shared_ptr<Wakeup> wakeup, FileCalls* calls = nullptr);
  FileSaver(const FileSaver&) = delete;
  FileSaver& operator=(const FileSaver&) = delete;
  // Finishes what was submitted, however long the disk takes: waitUntil() is for those who want to tell of it.
  // Leftovers stay where they are. Ending the process instead loses nothing; the next one finds what is left.
  ~FileSaver();

  // Takes a job. Never blocks.
  void submit(Job job);
  // The next job that is done, in the order of submission; nothing when there is none. Never blocks.
  std::optional<Saved> next();
  // How many jobs next() has not handed out yet, done or not.
  std::size_t pending() const;
  // Deals with leftovers whenever there is no job. Once.
  void collectLeftovers();
  // The next leftover that was dealt with; nothing when there is none. Never blocks.
  std::optional<Leftover> nextLeftover();
  // Waits until all jobs are done, and all leftovers dealt with, whether handed out or not, no longer than `until`.
  // False when some are not.
  bool waitUntil(Clock::time_point until);

  const std::string& folder() const { return _mover.folder(); }

 private:
  void run();
  MovedFile save(const Job& job);

  FileMover _mover;
  Leftovers _leftovers;
  std::shared_ptr<Wakeup> _wakeup;
  std::map<std::uint64_t, std::string> _bases;  // of pairs; the thread's own

  mutable platform::Mutex _lock;
  platform::Condition _changed;
  std::deque<Job> _jobs GUARDED_BY(_lock);  // the first is being done
  std::deque<Saved> _done GUARDED_BY(_lock);
  std::deque<Leftover> _told GUARDED_BY(_lock);
  bool _collects GUARDED_BY(_lock) = false;
  bool _ends GUARDED_BY(_lock) = false;
  std::thread _thread;
};

}  // namespace tether
