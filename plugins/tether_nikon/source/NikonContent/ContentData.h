// The image data of one item: asks the SDK for it, collects its deliveries and writes the file.
//
// The data object that an item opens while it is being initialised has no download thread, and one that was opened
// later has none once its transfer starts: callbacks run where the SDK delivers them. One delivery of the process is
// handled at a time.
#pragma once

#include <cstdint>
#include <cstdio>
#include <map>
#include <memory>
#include <string>

#include "MemoryBlock.h"
#include "NikonThreadedObject.h"

class CContentContainer;

// Base file names by download id. Entries are added and never removed.
extern std::map<std::int32_t, std::string>& gDownloadIdToNameMap;

class CContentData : public CNikonThreadedObject {
 public:
  // Opens the data object and enters it into the container. Throws the SDK's result when it cannot be opened; what
  // cannot be read of it is logged.
  CContentData(CContentContainer* container, std::int32_t dataType, std::int32_t downloadId);
  ~CContentData() override;

  // Starts the transfer and drives the SDK on this thread until it has ended. Without a name the file gets one of its
  // own with the first delivery.
  void startDownload(const std::string& name);
  std::int32_t dataCallback_thread(void* dataInfo, void* data) override;
  void completionCallback_thread(std::int32_t command, std::int32_t result, void* context) override;

  bool isRawPlusJPEG() const { return _rawPlusJpeg; }
  void setDownloadId(std::int32_t downloadId) { _downloadId = downloadId; }

  // The buffer of a picture is kept for the next one. Gives it back when there has been none for a while. Any thread.
  static void giveRestedBufferBack();

 private:
  struct FileCloser {
    void operator()(std::FILE* file) const { std::fclose(file); }
  };

  void beginFile(const tagNkMAIDFileInfo& info);
  void makeFileName(std::uint32_t fileDataType);
  bool openFile();
  bool takeBuffer();
  void zeroUpTo(std::size_t end);
  void store(const tagNkMAIDFileInfo& info, const void* data);
  void finishFile();
  void giveFileUp();
  void reportFinishedFile();  // once

  static std::int32_t _fileNumber;

  [[maybe_unused]] CContentContainer* _container;
  std::int32_t _dataSize = 0;
  bool _rawPlusJpeg = false;
  std::unique_ptr<std::FILE, FileCloser> _file;  // null before the first delivery and after the last
  platform::MemoryBlock _buffer;                 // the whole file, in its first _dataSize bytes
  std::size_t _known = 0;                        // so many bytes of it are delivered ones, or zero
  bool _finished = false;                        // the file is written
  bool _reported = false;                        // and the host knows
  std::int32_t _captureId = 0;
  std::string _fileName;
  std::string _path;
  std::int32_t _downloadId;
  bool _abandoned = false;  // the file cannot be had: what else is delivered goes nowhere
};
