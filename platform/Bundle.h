// Application and module bundles: folders with an executable at Contents/<platform>/.
#pragma once

#include <memory>
#include <string>

namespace platform {

// The path of the running executable, without links; "" when the system does not tell.
std::string executablePath();

// Whether everything that the loader would map is in the file. False also for what cannot be read.
bool libraryFileIsWhole(const std::string& path);

class Bundle {
 public:
  // The folder above Contents/<platform>/<executable>; an executable that stands elsewhere has its own folder.
  static std::string mainBundlePath();

  // Null when there is no folder of that path, or no executable in it.
  static std::unique_ptr<Bundle> create(const std::string& path);
  Bundle(const Bundle&) = delete;
  Bundle& operator=(const Bundle&) = delete;
  // Unloads the executable, unless it is to stay.
  ~Bundle();

  // Loads the executable with all its symbols resolved and kept to itself. False, with a log line, when it cannot be.
  bool loadExecutable();
  // The function of that name in the loaded executable, or null.
  void* functionPointer(const char* name) const;
  // Leaves the executable loaded for the rest of the process.
  void stayLoaded() { _stays = true; }

 private:
  explicit Bundle(std::string executable) : _executable(std::move(executable)) {}

  std::string _executable;
  void* _image = nullptr;
  bool _stays = false;
};

}  // namespace platform
