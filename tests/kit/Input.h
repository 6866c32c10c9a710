// Rules that hold for every input, and the bytes of a run as numbers.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace testkit {

// A rule that holds for every input. One that does not ends the program, which is a finding.
inline void check(bool holds, const char* rule) {
  if (holds) return;
  std::fprintf(stderr, "Broken rule: %s\n", rule);
  std::abort();
}

// The bytes of one run, taken from the front. Where there are none left, everything that is drawn is 0.
class Input {
 public:
  Input(const uint8_t* bytes, std::size_t count) : _bytes(bytes), _left(count) {}

  bool empty() const { return _left == 0; }
  uint8_t byte() { return draw<uint8_t>(); }
  uint16_t word() { return draw<uint16_t>(); }
  uint32_t dword() { return draw<uint32_t>(); }
  // True for one first byte in `times`, and never at the end of the input.
  bool onceIn(unsigned times) { return byte() >= 256 - 256 / times; }
  // Mostly small.
  uint32_t number() {
    const uint8_t kind = byte();
    if (kind < 160) return kind;
    return kind < 240 ? word() : dword();
  }

 private:
  template <typename Field>
  Field draw() {
    Field field{};
    const std::size_t taken = std::min(_left, sizeof field);
    if (taken > 0) std::memcpy(&field, _bytes, taken);
    _bytes += taken;
    _left -= taken;
    return field;
  }

  const uint8_t* _bytes;
  std::size_t _left;
};

}  // namespace testkit
