// What is known of one camera's pictures, so that each is announced once: those that lay on its card from the
// beginning, those that were announced, and those of which every byte was taken.
//
// Where TETHER_STATE names a folder, it is kept there in a text file per camera and outlives the process: rewritten
// whole at every connection, a line added with every picture, and nothing lost but that line when the process dies
// within it. A file that cannot be written is said once; the memory then ends with the process. Any thread.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "File.h"
#include "Mutex.h"

namespace gphoto2camera {

class Memory {
 public:
  // The camera's name and serial number; without one nothing is kept beyond the process.
  Memory(const std::string& model, const std::string& serial);

  // The camera was here before.
  bool knowsCamera() const KIT_EXCLUDES(_mutex);
  // The newest folder for pictures in there, when the camera was last looked at: an empty text where there was none
  // yet, nothing where nobody looked.
  std::optional<std::string> newestFolder(const std::string& parent) const KIT_EXCLUDES(_mutex);
  void setNewestFolder(const std::string& parent, const std::string& folder) KIT_EXCLUDES(_mutex);

  // Lay there before.
  void see(const File& file) KIT_EXCLUDES(_mutex);
  bool knows(const File& file) const KIT_EXCLUDES(_mutex);  // as what it is, by name and size
  // It was just shot: true where that is to be told.
  bool isNew(const File& file) const KIT_EXCLUDES(_mutex);
  // False where that has been done too often without anybody taking it.
  bool announce(const File& file) KIT_EXCLUDES(_mutex);
  void finish(const File& file) KIT_EXCLUDES(_mutex);  // delivered, or given up
  // Announced and not finished, in order.
  std::vector<File> owed() const KIT_EXCLUDES(_mutex);

  // Writes it anew.
  void save() KIT_EXCLUDES(_mutex);

 private:
  enum class Mark { Seen, Announced, Finished };
  struct Entry {
    File file;
    Mark mark = Mark::Seen;
    int announced = 0;   // times, in this process
    uint64_t order = 0;  // of the announcement
  };

  static std::string lineOf(Mark mark, const File& file);
  void load() KIT_REQUIRES(_mutex);
  void take(const std::string& line) KIT_REQUIRES(_mutex);
  void put(Mark mark, const File& file) KIT_REQUIRES(_mutex);
  void append(const std::string& line) KIT_REQUIRES(_mutex);
  void complain() KIT_REQUIRES(_mutex);

  const std::string _model;
  std::string _path{};  // empty: not kept; never changes
  mutable camerakit::Mutex _mutex{};
  std::map<std::string, Entry> _entries KIT_GUARDED_BY(_mutex){};  // by path
  std::map<std::string, std::string> _folders KIT_GUARDED_BY(_mutex){};
  uint64_t _lastOrder KIT_GUARDED_BY(_mutex) = 0;
  bool _known KIT_GUARDED_BY(_mutex) = false;
  bool _complained KIT_GUARDED_BY(_mutex) = false;
};

}  // namespace gphoto2camera
