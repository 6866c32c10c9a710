// The pictures of one camera that are announced and not yet taken, and which piece of them is read next: first what is
// being taken, then, as long as there is room, what will be taken next. Belongs to the camera's thread.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "Device.h"
#include "Transfer.h"

namespace gphoto2camera {

class Reader {
 public:
  explicit Reader(std::string camera) : _camera(std::move(camera)) {}

  void setCamera(const std::string& name) { _camera = name; }
  void add(std::shared_ptr<Transfer> transfer) { _jobs.push_back({std::move(transfer)}); }
  // It is on its way.
  bool holds(const File& file) const;
  // On a new connection files are asked for by name first: another one may have taken the place.
  void reconnected();
  void clear() { _jobs.clear(); }

  enum class Outcome { Idle, Read, Lost };
  // Reads one piece, or a whole file where there are no pieces. Lost: the connection must not be used again, for what
  // it brings next may be the late answer to this.
  Outcome step(Device& device);
  const std::string& why() const { return _why; }  // it was lost

 private:
  struct Job {
    std::shared_ptr<Transfer> transfer;
    bool verified = true;
    uint64_t stuckAt = 0;  // where the last failure was
    int failures = 0;      // there
  };

  Job* next();
  Outcome readPiece(Device& device, Job& job);
  Outcome fetch(Device& device, Job& job);
  bool verify(Device& device, Job& job, Outcome& outcome);
  Outcome failed(Job& job, const std::string& why);
  void giveUp(Job& job, int32_t result, const std::string& why);

  std::string _camera;
  std::vector<Job> _jobs{};
  std::vector<uint8_t> _buffer{};
  bool _inPieces = true;
  std::string _why{};
};

}  // namespace gphoto2camera
