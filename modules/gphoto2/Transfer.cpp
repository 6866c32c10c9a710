#include "Transfer.h"

#include <unistd.h>

#include <algorithm>

#include "Log.h"

namespace gphoto2camera {
namespace {

using camerakit::Guard;

constexpr std::chrono::milliseconds kPatience{30};
constexpr std::chrono::seconds kSilence{10};

bool readFrom(int descriptor, uint64_t offset, std::vector<uint8_t>& bytes) {
  for (size_t at = 0; at < bytes.size();) {
    const ssize_t count = pread(descriptor, bytes.data() + at, bytes.size() - at, static_cast<off_t>(offset + at));
    if (count <= 0) return false;
    at += static_cast<size_t>(count);
  }
  return true;
}

}  // namespace

Transfer::~Transfer() {
  if (_whole >= 0) close(_whole);
}

uint64_t Transfer::lengthAt(uint64_t offset) const { return std::min(kPieceBytes, _file.size - offset); }

void Transfer::startFrom(uint64_t offset) {
  _pieces.clear();
  _missing = offset;
  _bell->ring();
}

bool Transfer::holds(uint64_t offset, uint64_t length) const {
  return !_pieces.empty() && _pieces.front().offset == offset && _pieces.front().bytes.size() == length;
}

camerakit::Piece Transfer::take(uint64_t offset, uint64_t length, std::vector<uint8_t>& scratch) {
  const Guard guard(_mutex);
  const Clock::time_point now = Clock::now();
  if (!_taken) {
    _taken = true;
    _lastBytes = now;
    _bell->ring();
  }
  if (length != lengthAt(offset)) return camerakit::Piece::failed(kNkMAIDResult_UnexpectedError);
  if (_whole >= 0) {
    scratch.resize(length);
    if (!readFrom(_whole, offset, scratch)) return camerakit::Piece::failed(kNkMAIDResult_DataTransFailure);
    return scratch.data();
  }
  const uint64_t first = _pieces.empty() ? _missing : _pieces.front().offset;
  if (first != offset) startFrom(offset);
  while (!holds(offset, length) && !_failure && _whole < 0 && _came.waitUntil(_mutex, now + kPatience)) continue;
  if (holds(offset, length)) {
    scratch.swap(_pieces.front().bytes);
    _spare.swap(_pieces.front().bytes);
    _pieces.pop_front();
    _lastBytes = Clock::now();
    _bell->ring();
    return scratch.data();
  }
  if (!_failure && Clock::now() - _lastBytes > kSilence) {
    log(_camera, "no byte of " + _file.path() + " came for ten seconds; its transfer is given up");
    _failure = kNkMAIDResult_DataTransFailure;
    _bell->ring();
  }
  return _failure ? camerakit::Piece::failed(*_failure) : camerakit::Piece::notYet();
}

void Transfer::end() {
  const Guard guard(_mutex);
  _ended = true;
  _pieces.clear();
  _bell->ring();
}

Transfer::State Transfer::state() const {
  const Guard guard(_mutex);
  const bool whole = _whole >= 0 || _missing >= _file.size;
  return {_ended || _failure.has_value(), _taken, whole, _pieces.size(), _missing};
}

void Transfer::put(uint64_t offset, const uint8_t* bytes, uint64_t size) {
  const Guard guard(_mutex);
  _lastBytes = Clock::now();
  if (_ended || offset != _missing) return;
  const bool grows = !_pieces.empty() && _pieces.back().bytes.size() < lengthAt(_pieces.back().offset);
  if (!grows) {
    _pieces.push_back({offset, {}});
    _pieces.back().bytes.swap(_spare);
    _pieces.back().bytes.clear();
    _pieces.back().bytes.reserve(lengthAt(offset));
  }
  std::vector<uint8_t>& into = _pieces.back().bytes;
  size = std::min(size, lengthAt(_pieces.back().offset) - into.size());
  into.insert(into.end(), bytes, bytes + size);
  _missing += size;
  _came.notifyAll();
}

void Transfer::putWhole(int descriptor) {
  const Guard guard(_mutex);
  if (_whole >= 0) close(_whole);
  _whole = descriptor;
  _lastBytes = Clock::now();
  _came.notifyAll();
}

void Transfer::noteBytes() {
  const Guard guard(_mutex);
  _lastBytes = Clock::now();
}

void Transfer::fail(int32_t result) {
  const Guard guard(_mutex);
  if (!_failure) _failure = result;
  _came.notifyAll();
}

}  // namespace gphoto2camera
