// A picture of the test camera: its bytes follow from its name, so that whoever receives it can check all of them
// without having stored one.
#pragma once

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace ptpip {

struct Picture {
  std::string name{};
  std::uint64_t size = 0;
  std::uint64_t seed = 0;  // tells pictures of one name apart
  std::string head{};      // what it begins with; a JPEG without one as such do

  // No more than there are.
  std::string bytes(std::uint64_t offset, std::size_t length) const {
    length = static_cast<std::size_t>(std::min<std::uint64_t>(length, size - std::min(size, offset)));
    std::string result(length, '\0');
    std::uint64_t base = seed ^ 0xCBF29CE484222325;
    for (const char letter : name) base = (base ^ static_cast<unsigned char>(letter)) * 0x100000001B3;
    for (std::uint64_t word = offset / 8; word * 8 < offset + length; ++word) {
      std::uint64_t value = base + word * 0x9E3779B97F4A7C15;
      value = (value ^ (value >> 30)) * 0xBF58476D1CE4E5B9;
      value ^= value >> 27;
      lay(result, offset, word * 8, {reinterpret_cast<const char*>(&value), sizeof value});
    }
    const bool jpeg = name.ends_with(".JPG");
    lay(result, offset, 0, jpeg && head.empty() ? kJpegBeginning : head);
    if (jpeg && size > 1024) lay(result, offset, size - 2, "\xFF\xD9");
    return result;
  }

 private:
  // JFIF, a frame of 6000 x 4000 in one component, a scan of it.
  static constexpr std::string_view kJpegBeginning{
      "\xFF\xD8\xFF\xE0\0\x10JFIF\0\1\1\0\0\1\0\1\0\0\xFF\xC0\0\x0B\x08\x0F\xA0\x17\x70\1\1\x11\0"
      "\xFF\xDA\0\x08\1\1\0\0\x3F\0",
      43};
  // `part` stands at `place` of the file, `result` at `offset`.
  static void lay(std::string& result, std::uint64_t offset, std::uint64_t place, std::string_view part) {
    const std::uint64_t from = std::max(offset, place), to = std::min(offset + result.size(), place + part.size());
    if (from < to) std::memcpy(result.data() + (from - offset), part.data() + (from - place), to - from);
  }
};

}  // namespace ptpip
