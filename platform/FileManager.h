// Questions to the file system, and text operations on UTF-8 paths.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace platform {

class FileManager {
 public:
  // Whether anything has this name: a file, a directory, a link wherever it leads.
  static bool exists(const std::string& path);
  static bool isDirectory(const std::string& path);
  // Removes a file. False when it is still there or never was.
  static bool remove(const std::string& path);
  // Keeps room on the disk for that many bytes of an open file, whose size stays. 0, or the error where there is not
  // as much room or the process may not write as much; a file system that cannot keep any answers 0 too.
  static int reserve(int file, std::uint64_t bytes);
  // Names in a directory without "." and "..", sorted; none when it cannot be read.
  static std::vector<std::string> contents(const std::string& directory);

 private:
  // 0, or any error.
  static int keepRoom(int file, std::uint64_t bytes);
};

// The directory for files that others take away: TMPDIR where it names a directory, else the system's, with a line in
// the log where TMPDIR names something else. No slash at the end.
std::string temporaryDirectory();

// The directory part: all but the last component. "" for a bare name.
std::string_view deletingLastPathComponent(std::string_view path);
std::string_view lastPathComponent(std::string_view path);
// What follows the last period of the last component, "" where there is none; a leading period starts no extension.
std::string_view pathExtension(std::string_view path);
// A file name without its extension and the period before it.
std::string_view deletingPathExtension(std::string_view path);
std::string appendingPathComponent(std::string_view path, std::string_view component);

}  // namespace platform
