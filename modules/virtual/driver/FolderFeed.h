// Feeds a model from a folder. Every folder in it that is named <id>-<name> ("1-Studio") is a camera, plugged in when
// it appears and out when it goes (of several with one id, the first by name). In a camera's folder:
//
//   *.jpg *.jpeg *.tif *.tiff *.nef *.ndf *.dat    shot on that camera when they appear, or are there at first; a .nef
//                                                  and a .jpg of one base name are a pair (see PictureFolder)
//   roll/                                          what the shutter takes next, by name; when all is taken the camera
//                                                  makes pictures of its own
//   camera.json                                    settings and faults (see CameraFile.h); read again when it changes.
//                                                  A file with an error is ignored, with one line on standard error
//
// Nothing in the folder is ever changed or removed by the module. A picture has to stay until it is transferred.
#pragma once

#include <chrono>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "CameraFile.h"
#include "PictureFolder.h"
#include "VirtualCamera.h"

namespace virtualcamera {

// What the shutter of a camera without a script takes: its roll, then pictures of its own. Used from whichever thread
// polls, hence the lock.
class Shutter {
 public:
  Shutter(std::string name, std::string rollFolder) : name_(std::move(name)), roll_(std::move(rollFolder)) {}

  void configure(const FileTypes& types, bool pairs);
  Shot take(uint32_t number);

 private:
  std::mutex mutex_;
  std::string name_;
  Roll roll_;
  FileTypes types_;
  bool pairs_ = false;
};

// One camera of the feed: plugged in by the constructor, out by the destructor.
class CameraFolder {
 public:
  CameraFolder(Model& model, uint32_t id, const std::string& name, const std::string& path);
  ~CameraFolder();
  CameraFolder(const CameraFolder&) = delete;
  CameraFolder& operator=(const CameraFolder&) = delete;

  void look();

 private:
  bool fileChanged();
  std::optional<CameraFile> readFile();
  void apply(CameraFile file);
  void applySettings(Camera& camera, const CameraFile& file);

  Model& model_;
  uint32_t id_;
  std::string filePath_;
  struct stat fileStatus_ {};
  CameraFile file_;
  FileTypes types_;
  std::vector<FaultPlan::Id> faults_;
  std::shared_ptr<Shutter> shutter_;
  PictureFolder pictures_;
};

// The model outlives it.
class FolderFeed {
 public:
  FolderFeed(Model& model, std::string folder);

  // To be called with every poll, from any thread: looks at most every 50 ms, and not while another thread does.
  void look();

 private:
  using Clock = std::chrono::steady_clock;

  void listCameras();

  Model& model_;
  std::mutex mutex_;
  Clock::time_point nextLook_{};
  FolderWatch watch_;
  std::map<std::string, std::unique_ptr<CameraFolder>> cameras_;  // by the folder's name
};

}  // namespace virtualcamera
