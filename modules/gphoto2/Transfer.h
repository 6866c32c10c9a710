// One picture's bytes on their way from the camera's thread, which reads ahead, to the one that takes them: a few
// pieces in between, so that memory does not grow with the file. Where a camera cannot be read in pieces, a file on
// disk.
//
// Owned by both sides together. The source below is what the kit asks.
#pragma once

#include <chrono>
#include <deque>
#include <memory>
#include <optional>
#include <vector>

#include "Bell.h"
#include "File.h"
#include "Mutex.h"
#include "Picture.h"

namespace gphoto2camera {

constexpr uint64_t kPieceBytes = 1u << 20;
constexpr size_t kMostPieces = 4;  // read ahead of one picture, and of all that nobody takes yet

class Transfer {
 public:
  // Rings when there may be something to read.
  Transfer(std::string camera, File file, std::shared_ptr<Bell> bell)
      : _camera(std::move(camera)), _file(std::move(file)), _bell(std::move(bell)) {}
  ~Transfer();
  Transfer(const Transfer&) = delete;
  Transfer& operator=(const Transfer&) = delete;

  const File& file() const { return _file; }

  // The taking side. The piece is in scratch then. Waits for it for a moment; fails when no byte came for ten seconds.
  camerakit::Piece take(uint64_t offset, uint64_t length, std::vector<uint8_t>& scratch) KIT_EXCLUDES(_mutex);
  // Nothing is taken any more.
  void end() KIT_EXCLUDES(_mutex);

  // The camera's side.
  struct State {
    bool ended;        // or failed
    bool taken;        // somebody takes pieces
    bool whole;        // nothing is missing any more
    size_t pieces;     // that wait to be taken
    uint64_t missing;  // where to go on
  };
  State state() const KIT_EXCLUDES(_mutex);
  // Bytes that belong at `missing`, no more than a piece; dropped where somebody wants others by now.
  void put(uint64_t offset, const uint8_t* bytes, uint64_t size) KIT_EXCLUDES(_mutex);
  // The whole file, which it closes.
  void putWhole(int descriptor) KIT_EXCLUDES(_mutex);
  void noteBytes() KIT_EXCLUDES(_mutex);  // some came, which cannot be taken yet
  void fail(int32_t result) KIT_EXCLUDES(_mutex);

 private:
  using Clock = std::chrono::steady_clock;
  struct Piece {
    uint64_t offset;
    std::vector<uint8_t> bytes;
  };

  void startFrom(uint64_t offset) KIT_REQUIRES(_mutex);
  bool holds(uint64_t offset, uint64_t length) const KIT_REQUIRES(_mutex);
  uint64_t lengthAt(uint64_t offset) const;

  const std::string _camera;
  const File _file;
  const std::shared_ptr<Bell> _bell;
  mutable camerakit::Mutex _mutex{};
  camerakit::Condition _came{};
  std::deque<Piece> _pieces KIT_GUARDED_BY(_mutex){};  // in file order; the last may be growing
  std::vector<uint8_t> _spare KIT_GUARDED_BY(_mutex){};
  uint64_t _missing KIT_GUARDED_BY(_mutex) = 0;
  int _whole KIT_GUARDED_BY(_mutex) = -1;
  bool _taken KIT_GUARDED_BY(_mutex) = false;
  bool _ended KIT_GUARDED_BY(_mutex) = false;
  std::optional<int32_t> _failure KIT_GUARDED_BY(_mutex){};
  Clock::time_point _lastBytes KIT_GUARDED_BY(_mutex){};
};

class RemotePicture final : public camerakit::PictureSource {
 public:
  explicit RemotePicture(std::shared_ptr<Transfer> transfer) : _transfer(std::move(transfer)) {}

  const std::shared_ptr<Transfer>& transfer() const { return _transfer; }
  uint64_t size() const override { return _transfer->file().size; }
  camerakit::Piece piece(uint64_t offset, uint32_t length, std::vector<uint8_t>& scratch) const override {
    return _transfer->take(offset, length, scratch);
  }

 private:
  const std::shared_ptr<Transfer> _transfer;
};

}  // namespace gphoto2camera
