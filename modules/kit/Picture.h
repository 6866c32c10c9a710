// What a camera takes: bytes with a file type, read piece by piece from wherever they are.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "MAID.h"

namespace camerakit {

// What a source answers: bytes, that they are not there yet, or that they will never be.
class Piece {
 public:
  // Valid until the next call with the same scratch, or until scratch or the source goes.
  Piece(const uint8_t* bytes) : _bytes(bytes) {}  // NOLINT(google-explicit-constructor): sources return pointers
  // The next poll asks again. The helper polls without pause: wait some hundredths of a second first.
  static Piece notYet() { return {nullptr, kNkMAIDResult_Pending}; }
  // The transfer ends with that result.
  static Piece failed(int32_t result) { return {nullptr, result}; }

  const uint8_t* bytes() const { return _bytes; }
  int32_t result() const { return _result; }

 private:
  Piece(const uint8_t* bytes, int32_t result) : _bytes(bytes), _result(result) {}

  const uint8_t* _bytes;
  int32_t _result = kNkMAIDResult_DataTransFailure;  // of a null pointer
};

// Where a picture's bytes come from. Read from whichever thread polls, with no lock held: one piece at a time of each
// transfer, in file order. A piece may be asked for again. Nothing tells a source that a transfer is over: its camera
// is told (Camera::transferred).
class PictureSource {
 public:
  virtual ~PictureSource() = default;

  // Never changes; at most 4 GiB are transferred.
  virtual uint64_t size() const = 0;

  // The bytes from offset on, length of them, both within size(). The scratch is the transfer's, for the source to use.
  virtual Piece piece(uint64_t offset, uint32_t length, std::vector<uint8_t>& scratch) const = 0;
};

// Copied freely: its bytes are shared.
struct Picture {
  uint32_t fileDataType = kNkMAIDFileDataType_JPEG;
  std::string name{};
  std::shared_ptr<const PictureSource> source{};  // none: an empty file

  uint32_t dataTypes = kNkMAIDDataObjType_Image;  // bits that the item announces and that can be opened
  std::vector<uint32_t> withoutCapabilities{};    // not announced by the item and its data object

  uint64_t size() const { return source ? source->size() : 0; }

  static Picture memory(uint32_t fileDataType, std::vector<uint8_t> bytes);
  static Picture jpeg(std::vector<uint8_t> bytes) { return memory(kNkMAIDFileDataType_JPEG, std::move(bytes)); }
  static Picture raw(std::vector<uint8_t> bytes) { return memory(kNkMAIDFileDataType_NEF, std::move(bytes)); }
};

// What one press of the shutter yields: one picture, or the two of a pair.
using Shot = std::vector<Picture>;

}  // namespace camerakit
