#include "Camera.h"

#include <cstdio>
#include <utility>

namespace ptpip {

void note(const std::string& line) {
  static platform::Mutex lock;
  const platform::Guard guard(lock);
  std::puts(line.c_str());
  std::fflush(stdout);
}

std::string hexadecimal(std::uint16_t code) {
  char text[8];
  std::snprintf(text, sizeof text, "%04x", code);
  return text;
}

std::uint16_t Object::format() const {
  const std::string& name = picture.name;
  return isFolder() ? 0x3001 : name.ends_with(".JPG") ? 0x3801 : name.ends_with(".MOV") ? 0x300D : 0x3000;
}

bool Camera::hasRoom() const {
  std::uint64_t each = 0;
  for (std::size_t at = 0; at < roll.size(); ++at) each += sizes[std::min(at, sizes.size() - 1)];
  return each <= free;
}

std::string Camera::shoot(std::uint64_t shots) {
  std::string names;
  for (; shots > 0 && hasRoom(); --shots) {
    char name[16];
    std::snprintf(name, sizeof name, "TEST%04u.", ++lastShot % 10'000);
    for (std::size_t at = 0; at < roll.size(); ++at) {
      add(folder, {.name = name + roll[at], .size = sizes[std::min(at, sizes.size() - 1)]});
      names += ' ' + objects[lastHandle].picture.name;
    }
  }
  return names;
}

std::uint32_t Camera::add(std::uint32_t parent, const Picture& picture, bool announced) {
  free -= std::min(free, picture.size);
  objects[++lastHandle] = {parent, picture};
  if (announced) announce(kAdded, lastHandle);
  return lastHandle;
}

std::uint32_t Camera::handleOf(const std::string& name) const {
  for (const auto& [handle, object] : objects)
    if (object.picture.name == name) return handle;
  return 0;
}

std::vector<std::uint32_t> Camera::handles(std::uint32_t parent, std::uint32_t format) const {
  std::vector<std::uint32_t> found;
  for (const auto& [handle, object] : objects)
    if ((parent == 0 || object.parent == (parent == 0xFFFFFFFF ? 0 : parent)) &&
        (format == 0 || object.format() == format))
      found.push_back(handle);
  return found;
}

void Camera::announce(std::uint16_t event, std::uint32_t parameter) {
  const std::string packet = Writer().number(2, event).number(4, 0).number(4, parameter).packet(kEvent);
  for (Line& line : lines)
    if (line.ofEvents) line.waiting += packet;
  speak();
}

void Camera::speak() {
  for (Line& line : lines)
    if (!eventsSilent && !line.waiting.empty()) line.connection->send(std::exchange(line.waiting, {}));
}

void Camera::cut(bool commands, bool events) {
  for (const Line& line : lines)
    if (line.ofEvents ? events : commands) line.connection->end();
}

std::optional<Fault> Camera::insteadOf(std::uint16_t operation, const std::string& of, bool done, std::uint64_t from,
                                       std::uint64_t size) {
  for (auto planned = faults.begin(); planned != faults.end(); ++planned) {
    const bool placed = (planned->kind == "cut" || planned->kind == "stall") && planned->at && size > 0;
    if ((planned->operation != 0 && planned->operation != operation) || (planned->kind == "answer") == done ||
        (!planned->of.empty() && planned->of != of) ||
        (placed && (*planned->at < from || *planned->at >= from + size)) || planned->skip-- > 0)
      continue;
    const Fault fault = *planned;
    if (--planned->times == 0) faults.erase(planned);
    note("note fault " + hexadecimal(operation) + ' ' + fault.kind + ' ' + of);
    return fault;
  }
  return std::nullopt;
}

std::string Camera::counts() const {
  std::string each;
  unsigned deletes = 0, writes = 0;
  for (const auto& [operation, times] : asked) {
    each += ' ' + hexadecimal(operation) + '=' + std::to_string(times);
    if (operation == 0x100B || operation == 0x100F) deletes += times;
    for (const int write : {0x100C, 0x100D, 0x1010, 0x1012, 0x1016, 0x1017, 0x1019, 0x101A})
      if (operation == write) writes += times;
  }
  return " deletes=" + std::to_string(deletes) + " writes=" + std::to_string(writes) +
         " connections=" + std::to_string(lines.size()) + each;
}

}  // namespace ptpip
