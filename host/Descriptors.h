// Descriptors with an owner. Everything made here is closed on exec and numbered above standard error.
#pragma once

#include <utility>

#include "Locks.h"

namespace tether {

// Closes its descriptor in the end.
class Descriptor {
 public:
  Descriptor() = default;
  explicit Descriptor(int descriptor) : _descriptor(descriptor) {}
  Descriptor(Descriptor&& other) noexcept : _descriptor(std::exchange(other._descriptor, -1)) {}
  Descriptor& operator=(Descriptor&& other) noexcept {
    std::swap(_descriptor, other._descriptor);
    return *this;
  }
  ~Descriptor() { reset(); }

  int get() const { return _descriptor; }
  explicit operator bool() const { return _descriptor >= 0; }
  // Hands the descriptor over to the caller.
  int release() { return std::exchange(_descriptor, -1); }
  void reset();

 private:
  int _descriptor = -1;
};

// The same open file under a number above standard error, where it is in the way of no child's standard descriptors.
// Throws std::system_error when there are no descriptors left.
Descriptor aboveStandardError(Descriptor low);

struct Pipe {
  Descriptor read;
  Descriptor write;
  // Throws std::system_error when there are no descriptors left.
  static Pipe make();
};

void setNonBlocking(int descriptor);

// Held while a descriptor is being made that is not closed on exec yet, and while a child is being started.
platform::Mutex& spawnLock();

}  // namespace tether
