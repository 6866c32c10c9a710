// Files and bytes that tests make and look at.
#pragma once

#include <stdlib.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <random>
#include <stdexcept>
#include <string>
#include <vector>

namespace testkit {

// Another one for every seed.
inline std::vector<std::uint8_t> bytes(std::size_t size, unsigned seed = 1) {
  std::minstd_rand random(seed + 1);
  std::vector<std::uint8_t> made(size);
  for (std::uint8_t& byte : made) byte = static_cast<std::uint8_t>(random() >> 8);
  return made;
}

inline std::string pattern(std::size_t size, unsigned seed = 1) {
  const auto made = bytes(size, seed);
  return {made.begin(), made.end()};
}

template <typename Bytes = std::string>
Bytes readFile(const std::filesystem::path& path) {
  std::ifstream file(path, std::ios::binary | std::ios::ate);
  Bytes bytes(file ? static_cast<std::size_t>(file.tellg()) : 0, 0);
  file.seekg(0).read(reinterpret_cast<char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
  return bytes;
}

// A fresh one, gone with its object.
class Folder {
 public:
  Folder() {
    std::string name = (std::filesystem::temp_directory_path() / "tether-test-XXXXXX").string();
    if (mkdtemp(name.data()) == nullptr) throw std::runtime_error("no temporary folder");
    _path = std::filesystem::canonical(name);
  }
  Folder(const Folder&) = delete;
  Folder& operator=(const Folder&) = delete;
  ~Folder() {
    std::error_code ignored;
    std::filesystem::remove_all(_path, ignored);
  }
  const std::filesystem::path& path() const { return _path; }
  std::string operator/(const std::string& name) const { return _path / name; }

 private:
  std::filesystem::path _path;
};

}  // namespace testkit
