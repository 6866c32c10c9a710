// A fresh directory under the system's temporary directory that only this user can enter: where one helper leaves its
// pictures, so that nothing collides with another's.
#pragma once

#include <string>
#include <vector>

namespace tether {

class PrivateDirectory {
 public:
  // Makes it. Throws std::system_error when that cannot be done.
  PrivateDirectory();
  PrivateDirectory(const PrivateDirectory&) = delete;
  PrivateDirectory& operator=(const PrivateDirectory&) = delete;
  // As tidy().
  ~PrivateDirectory();

  const std::string& path() const { return _path; }
  // Removes empty files, and the directory if nothing else is in it. Returns the paths of what stays.
  std::vector<std::string> tidy() const;

 private:
  std::string _path;
};

}  // namespace tether
