// Feeds a model from a folder. Every folder in it that is named <id>-<name> ("1-Studio") is a camera, plugged in when
// it appears and out when it goes (of several with one id, the first by name). In a camera's folder:
//
//   *.jpg *.jpeg *.tif *.tiff *.nef *.ndf *.dat    just shot on that camera when they appear; a .nef and a .jpg of one
//                                                  base name are a pair
//   roll/                                          what the shutter takes next, by name; when all is taken the camera
//                                                  makes pictures of its own
//   camera.json                                    settings and faults (see CameraFile.h); read again when it changes.
//                                                  A file with an error is ignored, with one line on standard error
//
// What lies in a camera's folder when it is first seen is on its card and never announced. What comes while the camera
// is unplugged is announced at its return, together with what was shot before and not transferred whole. A new file of
// an old name is a new picture, in roll/ too: made again, copied over, or renamed over it. A picture that is renamed in
// its folder is no new one.
//
// A picture is there when its writer has closed it, or has moved it in. Where that cannot be known (elsewhere than on
// Linux, in a folder that another computer writes to, while the camera was unplugged) it is there when its time stamp
// is five seconds old, or has not changed for five seconds; in roll/, at once. To be quicker, and safe from longer
// pauses, write it under another name and move it.
//
// Nothing in the folder is ever changed or removed by the module. A picture has to stay until it is transferred.
#pragma once

#include <chrono>
#include <map>
#include <memory>
#include <string>

#include "CameraFile.h"
#include "FileState.h"
#include "FolderEvents.h"
#include "Mutex.h"
#include "PictureFolder.h"
#include "VirtualCamera.h"

namespace virtualcamera {

struct FeedOptions {
  std::shared_ptr<FolderEvents> events = systemFolderEvents();
  std::chrono::milliseconds rest{5000};
};

// What the shutter of a camera takes: its roll, then pictures of its own. Used from whichever thread polls, hence the
// lock.
class Shutter {
 public:
  Shutter(const std::string& rollFolder, std::shared_ptr<FolderEvents> events)
      : _roll(rollFolder, std::move(events), std::chrono::milliseconds(0), PictureFolder::First::New) {}

  void setName(const std::string& name);
  void configure(const FileTypes& types, bool pairs);
  void look();
  void leave();
  Shot take(uint32_t number);

 private:
  camerakit::Mutex _mutex;
  PictureFolder _roll KIT_GUARDED_BY(_mutex);
  std::string _name KIT_GUARDED_BY(_mutex);
  bool _pairs KIT_GUARDED_BY(_mutex) = false;
};

// One camera of the feed, which is kept while it is unplugged.
class CameraFolder {
 public:
  CameraFolder(Model& model, const FeedOptions& options, uint32_t id, std::string name, const std::string& path);
  ~CameraFolder();
  CameraFolder(const CameraFolder&) = delete;
  CameraFolder& operator=(const CameraFolder&) = delete;

  bool isPlugged() const { return _plugged; }
  void plugIn();
  void unplug();
  void look();

 private:
  bool fileChanged() const;
  std::optional<CameraFile> readFile();
  void apply(CameraFile file);
  void applySettings(Camera& camera, const CameraFile& file);

  Model& _model;
  uint32_t _id;
  std::string _name;
  std::string _path;
  std::string _filePath;
  FileState _fileState{};
  CameraFile _file;
  std::vector<FaultPlan::Id> _faults;
  std::shared_ptr<Shutter> _shutter;
  PictureFolder _pictures;
  std::vector<Shot> _left;  // on the camera when it was unplugged
  bool _plugged = false;
};

// The model outlives it.
class FolderFeed {
 public:
  FolderFeed(Model& model, std::string folder, FeedOptions options = FeedOptions());

  // To be called with every poll, from any thread: looks at most every 50 ms, and not while another thread does.
  void look();

 private:
  using Clock = std::chrono::steady_clock;

  void listCameras() KIT_REQUIRES(_mutex);

  Model& _model;
  FeedOptions _options;
  camerakit::Mutex _mutex;
  Clock::time_point _nextLook KIT_GUARDED_BY(_mutex){};
  FolderWatch _watch KIT_GUARDED_BY(_mutex);
  // By the folder's name.
  std::map<std::string, std::unique_ptr<CameraFolder>> _cameras KIT_GUARDED_BY(_mutex);
};

}  // namespace virtualcamera
