// What a virtual camera takes: bytes with a file type, from memory, from a file or made up on the fly.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "MAID.h"

namespace virtualcamera {

// Where a picture's bytes come from. Immutable; read from whichever thread polls, one piece at a time per transfer.
class PictureSource {
 public:
  virtual ~PictureSource() = default;

  virtual uint64_t size() const = 0;

  // Whether its bytes are still what they were when it was made.
  virtual bool isThere() const { return true; }
  // Nothing more will be read for now: what is open for it need not stay so.
  virtual void rest() const {}

  // The bytes from offset on, length of them, both within size(). The pointer is valid until the next call with the
  // same scratch, or until scratch or the source goes. Null: they could not be read.
  virtual const uint8_t* piece(uint64_t offset, uint32_t length, std::vector<uint8_t>& scratch) const = 0;
};

// A picture, copied freely: its bytes are shared. The fields after the source are what the item and its data object
// say about themselves; scripts change them to have a camera that tells other things than it delivers.
struct Picture {
  uint32_t fileDataType = kNkMAIDFileDataType_JPEG;
  std::string name{};
  std::shared_ptr<const PictureSource> source{};

  std::optional<uint32_t> storedBytes{};          // other than the true size
  uint32_t dataTypes = kNkMAIDDataObjType_Image;  // bits that the item announces and that can be opened
  std::vector<uint32_t> withoutCapabilities{};    // not announced by the item and its data object

  uint64_t size() const { return source ? source->size() : 0; }

  static Picture memory(uint32_t fileDataType, std::vector<uint8_t> bytes);
  static Picture jpeg(std::vector<uint8_t> bytes) { return memory(kNkMAIDFileDataType_JPEG, std::move(bytes)); }
  static Picture raw(std::vector<uint8_t> bytes) { return memory(kNkMAIDFileDataType_NEF, std::move(bytes)); }

  // A file, opened at its first delivery and read in delivery-sized pieces. Its size is taken now. One that has another
  // size then, is no regular file, or changes during the transfer ends it with kNkMAIDResult_DataTransFailure.
  static Picture file(uint32_t fileDataType, const std::string& path);

  // That many bytes of a pattern, stored nowhere: byte i is patternByte(i).
  static Picture pattern(uint32_t fileDataType, uint64_t size);
  static uint8_t patternByte(uint64_t offset) { return static_cast<uint8_t>(offset % kPatternPeriod); }

  static constexpr uint64_t kPatternPeriod = 251;
};

// What one press of the shutter yields: one picture, or the two of a pair.
using Shot = std::vector<Picture>;

}  // namespace virtualcamera
