// libgphoto2, as far as it is one for the whole process: its lists of drivers and ports, the lock that they need, and
// cameras on their way in and out.
//
// Threads: any. Loading, opening and letting go take turns, for the library's loader of plug-ins is not safe otherwise;
// a camera that does not answer holds all of them up, for seven seconds on a network. Everything that is called on an
// open camera needs no lock, but a single thread at a time.
#pragma once

#include <gphoto2/gphoto2-camera.h>

#include <string>
#include <vector>

#include "Mutex.h"

namespace gphoto2camera {

// Deletes what the library made: the deleter of a pointer to it.
template <auto Free>
struct FreeWith {
  template <typename T>
  void operator()(T* what) const {
    Free(what);
  }
};

// What a call was given for messages of the library; used by one thread at a time.
class Context {
 public:
  Context();
  ~Context();
  Context(const Context&) = delete;
  Context& operator=(const Context&) = delete;

  // To be passed to a call; what an earlier one left is forgotten.
  GPContext* fresh();
  // The last call's failure: the library's own words where it had some, else what the result means.
  std::string words(int result) const;

 private:
  static void keep(GPContext*, const char* text, void* self);

  GPContext* const _context;
  std::string _words;
};

// Where a camera is, as the library spells it.
struct Address {
  std::string model;  // of the driver
  std::string port;

  bool isNetwork() const { return port.starts_with("ptpip:"); }
  bool operator==(const Address&) const = default;
};

class Library {
 public:
  static Library& get();

  // The ports of USB devices, cameras or not. Cheap.
  std::vector<std::string> usbPorts() KIT_EXCLUDES(_mutex);
  // The still cameras at these ports. Leaks some memory with every call.
  std::vector<Address> detect(const std::vector<std::string>& ports) KIT_EXCLUDES(_mutex);

  // The library's result; with GP_OK the camera is the caller's, who gives it to close.
  int open(const Address& address, Context& context, ::Camera*& camera) KIT_EXCLUDES(_mutex);
  // Also of one that failed. May take as long as the camera is silent.
  void close(::Camera* camera, Context& context) KIT_EXCLUDES(_mutex);

 private:
  int load() KIT_REQUIRES(_mutex);
  int prepare(const Address& address, ::Camera* camera) KIT_REQUIRES(_mutex);
  GPPortInfoList* ports() KIT_REQUIRES(_mutex);

  camerakit::Mutex _mutex;
  CameraAbilitiesList* _drivers KIT_GUARDED_BY(_mutex) = nullptr;  // loaded once
  Context _context KIT_GUARDED_BY(_mutex);
};

}  // namespace gphoto2camera
