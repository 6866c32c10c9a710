// The file of one picture on its way: made under a name of its own, with its room kept on the disk and its bytes
// collected in memory, and written in one piece when all of them are there. It knows no camera.
//
// One thread at a time. A process that ends meanwhile takes a file that is not whole along.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>

#include "MemoryBlock.h"

class PictureFile {
 public:
  PictureFile() = default;
  PictureFile(const PictureFile&) = delete;
  PictureFile& operator=(const PictureFile&) = delete;
  ~PictureFile() { giveUp(); }

  // Makes the file, exclusively and for its owner alone, under the first free name like `name` in the directory, and
  // gets the room and the memory for `size` bytes. False when it cannot be, with a line in the log; nothing stays then.
  bool begin(std::string& directory, const std::string& name, std::size_t size);
  bool isOpen() const { return _file != nullptr; }
  const std::string& path() const { return _path; }

  // Puts bytes at their place. What lies outside the size is dropped.
  void store(std::uint64_t offset, const void* bytes, std::size_t count);
  // Writes the file, with zeros for what never came, and closes it. False when that failed: logged, and removed.
  bool finish();
  // Leaves the file as it is, empty. Again, or when it is not open: nothing.
  void giveUp();

  // The memory of a picture is kept for the next one. Gives it back when there has been none for a while. Any thread.
  static void giveRestedBufferBack();

 private:
  struct FileCloser {
    void operator()(std::FILE* file) const { std::fclose(file); }
  };

  bool create(std::string& directory, const std::string& name);
  bool takeRoom(const std::string& name);
  void zeroUpTo(std::size_t end);

  std::unique_ptr<std::FILE, FileCloser> _file;
  std::string _path;
  std::size_t _size = 0;
  platform::MemoryBlock _buffer;  // the whole file, in its first _size bytes
  std::size_t _known = 0;         // so many bytes of it are stored ones, or zero
};
