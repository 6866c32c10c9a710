// One camera and the calls on it, in this module's words. Belongs to one thread, which every call holds up for as long
// as the camera takes: seconds, where it does not answer. Results are the library's; words() says more about the last
// failure.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "File.h"
#include "Library.h"

namespace gphoto2camera {

struct Event {
  enum class Kind { None, Added, Changed, Other };
  Kind kind = Kind::None;
  File file{};  // Added: without size and time
};

class Device {
 public:
  explicit Device(Address address) : _address(std::move(address)) {}
  ~Device() { close(); }
  Device(const Device&) = delete;
  Device& operator=(const Device&) = delete;

  const Address& address() const { return _address; }
  // Whether the camera, and not the connection, said so: busy, or that it cannot.
  static bool isAnswer(int result);

  int open();
  void close();  // what is closed may be opened again
  bool isOpen() const { return _camera != nullptr; }
  // A call timed out, or the connection failed within it. It must not be used again: the next call might be given the
  // late answer to that one, and take it for its own.
  bool isBroken() const { return _isBroken; }
  std::string words(int result) const { return _context.words(result); }

  // One event, or none after that time. With an error an event may be lost, and is not found by listing either: the
  // camera has to be opened anew.
  int wait(int milliseconds, Event& event);
  // Size and time. Costs nothing of a file that an event named or that was listed.
  int describe(File& file);
  // Size: room on entry, bytes that came on return.
  int read(const File& file, uint64_t offset, uint8_t* bytes, uint64_t& size);
  // The whole of it, into a descriptor, which stays the caller's; onBytes is called whenever some came.
  int fetch(const File& file, int descriptor, const std::function<void()>& onBytes);
  // Fires the shutter. Where the camera can only take a picture and wait for it, that is done, and `waited` says so:
  // events were lost meanwhile.
  int trigger(bool& waited);
  bool canCapture() const;

  // Names in a folder. Listing a folder for the first time is what costs.
  int list(const std::string& folder, bool folders, std::vector<std::string>& names);
  // Asks the camera for something that it cannot say from memory.
  int ask();
  // Free space in pictures, where the camera knows, and in bytes.
  void space(std::optional<uint64_t>& pictures, std::optional<uint64_t>& bytes);

  // The names of everything that can be set or read.
  std::vector<std::string> names();
  // As the camera shows it; nothing where it has none or does not say.
  std::optional<std::string> value(const std::string& name);
  std::vector<std::string> choices(const std::string& name);
  int set(const std::string& name, const std::string& value);
  // The library's description, in lines of `Key: value`; empty where there is no such line.
  std::string summary(const std::string& key);

 private:
  int note(int result);

  const Address _address;
  Context _context;
  ::Camera* _camera = nullptr;
  bool _isBroken = false;
};

}  // namespace gphoto2camera
