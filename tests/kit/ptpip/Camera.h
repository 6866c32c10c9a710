// What the test camera has and does: a card with folders and pictures, properties, events, and what goes wrong in it.
#pragma once

#include <list>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Locks.h"
#include "Picture.h"
#include "Wire.h"

namespace ptpip {

constexpr std::uint16_t kGood = 0x2001, kNotOpen = 0x2003, kNotSupported = 0x2005, kNoObject = 0x2009;
constexpr std::uint16_t kNoProperty = 0x200A, kStoreFull = 0x200C, kAccessDenied = 0x200F, kBusy = 0x2019;
constexpr std::uint16_t kAdded = 0x4002, kRemoved = 0x4003, kPropertyChanged = 0x4006, kCaptureComplete = 0x400D;

struct Object {
  std::uint32_t parent = 0;
  Picture picture{};
  bool isFolder() const { return picture.name.find('.') == std::string::npos; }
  std::uint16_t format() const;
};

struct Property {
  std::size_t width = 2;  // of the number; one, two or four bytes
  bool writable = false;
  std::uint64_t value = 0;
  std::vector<std::uint64_t> choices{};
};

// What happens instead of an answer. `kind` is
//   answer    the response `at`, and nothing is done
//   cut       all connections end before byte `at`, of the file where it is one
//   stall     nothing more from byte `at` on, until `resume` or for `milliseconds`
//   clip      only `at` bytes, said so; 0 is a success without bytes
//   short     only `at` bytes, although more were announced
//   more      `at` bytes more than there are or were asked for
//   garbage   as many bytes, but others
//   noise     `at` bytes that are no packet
//   lose      no answer
struct Fault {
  std::uint16_t operation = 0;  // 0: any
  std::string kind{};
  std::optional<std::uint64_t> at{};
  int milliseconds = 0;
  int skip = 0;
  int times = 1;
  std::string of{};  // the picture's name; empty: any
};

struct Line {
  std::shared_ptr<Connection> connection{};
  bool ofEvents = false;
  std::string waiting{};  // events that are not heard yet
};

struct Camera {
  std::string model = "Test Camera", serial = "0001";
  std::vector<std::uint16_t> operations{0x1001, 0x1002, 0x1003, 0x1004, 0x1005, 0x1006, 0x1007, 0x1008,
                                        0x1009, 0x100A, 0x100B, 0x100E, 0x1014, 0x1015, 0x1016, 0x101B};
  std::map<std::uint16_t, Property> properties{{0x5001, {1, false, 80, {}}},
                                               {0x5005, {2, true, 2, {2, 4, 5, 6}}},
                                               {0x5007, {2, true, 560, {280, 400, 560, 800, 1100}}},
                                               {0x500D, {4, true, 80, {10, 20, 40, 80, 166, 5000, 10000}}},
                                               {0x500E, {2, true, 3, {1, 2, 3, 4}}},
                                               {0x500F, {2, true, 200, {100, 200, 400, 800, 1600}}}};
  std::map<std::uint32_t, Object> objects{{1, {0, {.name = "DCIM"}}}, {2, {1, {.name = "100TEST"}}}};
  std::uint32_t folder = 2, lastHandle = 2, lastShot = 0;
  std::vector<std::string> roll{"JPG"};  // the files of each shot, by extension
  std::vector<std::uint64_t> sizes{200'000};
  std::uint64_t free = 64'000'000'000;
  std::uint64_t rate = 0;  // bytes a second, where not 0
  bool plugged = true, held = false, commandsSilent = false, eventsSilent = false;
  unsigned resumed = 0;  // how often
  std::list<Line> lines{};
  std::list<Fault> faults{};
  std::map<std::uint16_t, unsigned> asked{};

  bool hasRoom() const;                    // for a shot
  std::string shoot(std::uint64_t shots);  // where there is room; gives the names, in order
  std::uint32_t add(std::uint32_t parent, const Picture& picture, bool announced = true);
  std::uint32_t handleOf(const std::string& name) const;  // 0: there is none
  std::vector<std::uint32_t> handles(std::uint32_t parent, std::uint32_t format) const;
  void announce(std::uint16_t event, std::uint32_t parameter);
  void speak();  // says events that wait, if they can be heard
  void cut(bool commands, bool events);
  // What is planned for this operation: before it is done, or after, when its answer brings that part of a file.
  std::optional<Fault> insteadOf(std::uint16_t operation, const std::string& of, bool done = false,
                                 std::uint64_t from = 0, std::uint64_t size = 0);
  std::string counts() const;
};

// The camera, and the lock under which it is used; it lives as long as the process.
struct Studio {
  platform::Mutex lock{};
  platform::Condition changed{};
  Camera camera GUARDED_BY(lock){};
};

// Serves one connection, for commands or for events, until it ends. It is among the camera's lines until then.
void serve(Studio& studio, const std::shared_ptr<Connection>& connection);

// One line to the test, whole.
void note(const std::string& line);
std::string hexadecimal(std::uint16_t code);

}  // namespace ptpip
