#include "Reader.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>

#include "Log.h"

namespace gphoto2camera {
namespace {

constexpr int kMostFailures = 3;  // at one place of a file
// The library copies what a camera sends, which may be more than it was asked for.
constexpr uint64_t kSlack = 1u << 20;

// An unlinked file; -1 where there is no room for one.
int temporaryFile() {
  const char* folder = std::getenv("TMPDIR");
  std::string path = std::string(folder != nullptr ? folder : "/tmp") + "/gphoto2-XXXXXX";
  const int descriptor = mkostemp(path.data(), O_CLOEXEC);
  if (descriptor >= 0) unlink(path.c_str());
  return descriptor;
}

}  // namespace

bool Reader::holds(const File& file) const {
  return std::any_of(_jobs.begin(), _jobs.end(), [&](const Job& job) {
    return !job.transfer->state().ended && job.transfer->file().path() == file.path();
  });
}

void Reader::reconnected() {
  for (Job& job : _jobs) job.verified = false;
}

Reader::Job* Reader::next() {
  std::erase_if(_jobs, [](const Job& job) { return job.transfer->state().ended; });
  Job* ahead = nullptr;
  size_t waiting = 0;
  for (Job& job : _jobs) {
    const Transfer::State state = job.transfer->state();
    if (state.taken && !state.whole && state.pieces < kMostPieces) return &job;
    if (!state.taken) waiting += state.pieces;
    if (ahead == nullptr && !state.taken && !state.whole) ahead = &job;
  }
  return ahead != nullptr && _inPieces && waiting < kMostPieces ? ahead : nullptr;
}

Reader::Outcome Reader::step(Device& device) {
  Job* const job = next();
  if (job == nullptr) return Outcome::Idle;
  if (Outcome outcome = Outcome::Idle; !verify(device, *job, outcome)) return outcome;
  return _inPieces ? readPiece(device, *job) : fetch(device, *job);
}

bool Reader::verify(Device& device, Job& job, Outcome& outcome) {
  if (job.verified) return true;
  File there = job.transfer->file();
  const int result = device.describe(there);
  if (result == GP_OK && there.size == job.transfer->file().size) return job.verified = true;
  if (result == GP_OK || result == GP_ERROR_FILE_NOT_FOUND) {
    giveUp(job, kNkMAIDResult_FileRemoved, "it is not on the camera any more");
    outcome = Outcome::Read;
  } else {
    outcome = failed(job, device.words(result));
  }
  return false;
}

Reader::Outcome Reader::readPiece(Device& device, Job& job) {
  const File& file = job.transfer->file();
  const uint64_t offset = job.transfer->state().missing;
  const uint64_t wanted = std::min(kPieceBytes - offset % kPieceBytes, file.size - offset);
  uint64_t size = wanted;
  _buffer.resize(kPieceBytes + kSlack);
  const int result = device.read(file, offset, _buffer.data(), size);
  if (result == GP_ERROR_NOT_SUPPORTED) {
    _inPieces = false;
    return Outcome::Read;
  }
  if (result == GP_ERROR_CAMERA_BUSY) return Outcome::Idle;
  if (result != GP_OK) return failed(job, device.words(result));
  if (size == 0 || size > wanted)
    return failed(job, "at byte " + std::to_string(offset) + " the camera sent " + std::to_string(size) + " of " +
                           std::to_string(wanted));
  job.transfer->put(offset, _buffer.data(), size);
  return Outcome::Read;
}

Reader::Outcome Reader::fetch(Device& device, Job& job) {
  const int descriptor = temporaryFile();
  if (descriptor < 0) {
    giveUp(job, kNkMAIDResult_DataTransFailure, "there is no room for a file in the temporary folder");
    return Outcome::Read;
  }
  const int result = device.fetch(job.transfer->file(), descriptor, [&job] { job.transfer->noteBytes(); });
  if (result == GP_OK && lseek(descriptor, 0, SEEK_END) == static_cast<off_t>(job.transfer->file().size)) {
    job.transfer->putWhole(descriptor);
    return Outcome::Read;
  }
  close(descriptor);
  if (result == GP_ERROR_CAMERA_BUSY) return Outcome::Idle;
  return failed(job, result == GP_OK ? "the camera sent another number of bytes" : device.words(result));
}

Reader::Outcome Reader::failed(Job& job, const std::string& why) {
  const uint64_t offset = job.transfer->state().missing;
  if (offset != job.stuckAt) job.failures = 0;
  job.stuckAt = offset;
  _why = "reading " + job.transfer->file().path() + ": " + why;
  if (++job.failures >= kMostFailures) giveUp(job, kNkMAIDResult_DataTransFailure, why);
  return Outcome::Lost;
}

void Reader::giveUp(Job& job, int32_t result, const std::string& why) {
  log(_camera, "the transfer of " + job.transfer->file().path() + " is given up: " + why);
  job.transfer->fail(result);
}

}  // namespace gphoto2camera
