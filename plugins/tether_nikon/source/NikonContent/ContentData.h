// The image data of one item: asks the SDK for it, collects its deliveries and writes the file.
//
// The data object that an item opens while it is being initialised has no download thread, and one that was opened
// later has none once its transfer starts: callbacks run where the SDK delivers them. One delivery of the process is
// handled at a time.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "NikonThreadedObject.h"
#include "PictureFile.h"

class CContentData;

// The item that a data object belongs to, as that knows it.
class ContentDataOwner : public CNikonThreadedObject {
 public:
  using CNikonThreadedObject::CNikonThreadedObject;
  // The data object has come to its end, well or not.
  virtual void contentFinishedDownloading(CContentData* data) = 0;
  // What the log calls the item: "item 3 of camera 1 (Studio)".
  virtual std::string description() const = 0;
};

// Base file names by download id. Entries are added and never removed.
extern std::map<std::int32_t, std::string>& gDownloadIdToNameMap;

class CContentData : public CNikonThreadedObject {
 public:
  // Opens the data object and enters it into the container. Throws the SDK's result when it cannot be opened; what
  // cannot be read of it is logged.
  CContentData(ContentDataOwner* container, std::int32_t dataType, std::int32_t downloadId);
  ~CContentData() override;

  // Starts the transfer and drives the SDK on this thread until it has ended. Without a name the file gets one of its
  // own with the first delivery.
  void startDownload(const std::string& name);
  std::int32_t dataCallback_thread(void* dataInfo, void* data) override;
  void completionCallback_thread(std::int32_t command, std::int32_t result, void* context) override;

  bool isRawPlusJPEG() const { return _rawPlusJpeg; }
  void setDownloadId(std::int32_t downloadId);

 private:
  void beginFile(const tagNkMAIDFileInfo& info);
  void makeFileName(std::uint32_t fileDataType);
  void reportFinishedFile();  // once
  void logEndWithoutCompletion(std::int32_t startResult);
  void logFailure(const char* how, const std::string& reason) const;

  static std::int32_t _fileNumber;

  ContentDataOwner* _container;
  std::int32_t _dataSize = 0;
  bool _rawPlusJpeg = false;
  PictureFile _file;       // open from the first delivery to the last
  bool _finished = false;  // the file is written
  bool _reported = false;  // and the host knows
  std::int32_t _captureId = 0;
  std::string _fileName;
  std::int32_t _downloadId;
  bool _abandoned = false;  // the file cannot be had: what else is delivered goes nowhere
  bool _completed = false;
};
