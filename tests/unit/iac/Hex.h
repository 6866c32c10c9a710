// Bytes written as hexadecimal, for tests of encodings.
#pragma once

#include <cstdlib>
#include <sstream>
#include <string>

// "1a 00 ff" as the three bytes.
inline std::string bytesFromHex(const std::string& hex) {
  std::istringstream in(hex);
  std::string bytes;
  for (std::string pair; in >> pair;) bytes += static_cast<char>(std::strtol(pair.c_str(), nullptr, 16));
  return bytes;
}
