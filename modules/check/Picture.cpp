#include "Picture.h"

#include <numeric>

#include "Names.h"

namespace modulecheck {
namespace {

const auto kNumbers = {uint32_t{kNkMAIDCapType_Integer}, uint32_t{kNkMAIDCapType_Unsigned}};

bool hasExtension(uint32_t fileDataType) {
  return fileDataType == kNkMAIDFileDataType_JPEG || fileDataType == kNkMAIDFileDataType_TIFF ||
         fileDataType == kNkMAIDFileDataType_NEF || fileDataType == kNkMAIDFileDataType_NDF;
}

}  // namespace

Data::Data(Item& item)
    : Object(item.context(), &item, kNkMAIDDataObjType_Image, "data object", "data object of " + item.name()),
      _item(item) {}

void Data::examine() {
  mustAnnounce(kNkMAIDCapability_Acquire, {kNkMAIDCapType_Process}, "Acquire, without which no picture comes");
  mustAnnounce(kNkMAIDCapability_DataProc, {kNkMAIDCapType_Process}, "DataProc, without which no byte comes");
  for (const uint32_t capability : {kNkMAIDCapability_StoredBytes, kNkMAIDCapability_RawJpegImageStatus}) {
    if (announces(capability)) mustAnnounce(capability, kNumbers, "");
  }
  _storedBytes = number(kNkMAIDCapability_StoredBytes);
  _isHalf = number(kNkMAIDCapability_RawJpegImageStatus).value_or(0) != 0;
  if (announces(kNkMAIDCapability_Name)) text(kNkMAIDCapability_Name, Reading::kMay);
}

void Data::transfer() {
  if (!isOpen() || !announces(kNkMAIDCapability_Acquire)) return _item.takeDown();
  _isTransferred = true;
  const Outcome outcome = perform(kNkMAIDCapability_Acquire);
  checkWhole(outcome);
  _item.takeDown();
}

void Data::checkWhole(const Outcome& outcome) {
  const platform::Guard guard(_lock);
  if (outcome.answer != kNkMAIDResult_NoError && outcome.answer != kNkMAIDResult_Pending) {
    return fault("CapStart Acquire answered " + resultText(outcome.answer),
                 "NoError or Pending; it is not tried again, and the picture is lost");
  }
  if (!outcome.result) return;
  if (*outcome.result != kNkMAIDResult_NoError) {
    fault("Acquire completed with " + resultText(*outcome.result), "NoError; it is not tried again");
  } else if (!_isWhole) {
    fault("Acquire completed with NoError after " + std::to_string(_received) + " of " + std::to_string(_total) +
              " bytes",
          "a delivery that reaches the total length before the completion");
  } else {
    ++context().report.shared().pictures;
  }
}

void Data::onDelivery(const tagNkMAIDFileInfo& info, const uint8_t* bytes) {
  bool first = false;
  {
    const platform::Guard guard(_lock);
    if (!_isTransferred)
      fault("a delivery came before its Acquire was started", "deliveries of a started Acquire only");
    if ((info.dataType & kNkMAIDDataObjType_File) == 0) {
      fault("a delivery has data type " + std::to_string(info.dataType), "the file flag, 0x10; others are ignored");
      return;
    }
    first = _count++ == 0;
    if (first) checkFirst(info);
    checkPlace(info);
    if (bytes == nullptr && info.ulLength != 0) {
      return fault("a delivery has no bytes", "a pointer to its bytes, good until the callback returns");
    }
    _sum = std::accumulate(bytes, bytes + info.ulLength, _sum.load());
  }
  const bool elsewhere = std::this_thread::get_id() != context().mainThreadId;
  if (elsewhere && first && !context().mainThreadGetsThrough()) {
    fault("another thread's call does not return as long as a callback lasts", "no lock held while calling back");
  }
}

void Data::checkFirst(const tagNkMAIDFileInfo& info) {
  _total = info.totalLength;
  if (_storedBytes.value_or(0) != 0 && *_storedBytes != _total) {
    fault("it has " + std::to_string(*_storedBytes) + " StoredBytes and delivers " + std::to_string(_total),
          "StoredBytes and the total length of deliveries alike");
  }
  if (!hasExtension(info.fileDataType)) {
    note("file data type " + std::to_string(info.fileDataType) + " has no extension of its own: its file is a .dat");
  }
}

void Data::checkPlace(const tagNkMAIDFileInfo& info) {
  const std::string which = "delivery " + std::to_string(_count) + " brings " + std::to_string(info.ulLength) +
                            " bytes at " + std::to_string(info.ulStart);
  const uint64_t end = uint64_t{info.ulStart} + info.ulLength;
  if (info.totalLength != _total) {
    fault("delivery " + std::to_string(_count) + " has a total length of " + std::to_string(info.totalLength) +
              " after one of " + std::to_string(_total),
          "the same total length in all deliveries of a file");
  }
  if (_isWhole) {
    fault(which + " after the last one", "no delivery after the one that reaches the total length");
  } else if (end > _total) {
    fault(which + " of " + std::to_string(_total), "no byte beyond the total length");
  } else if (info.ulStart != _received) {
    fault(which + " after " + std::to_string(_received) + " bytes", "deliveries in file order, without gaps");
  }
  if (end > _received) noteProgress();
  _received = std::max(_received, end);
  _isWhole = _isWhole || end >= info.totalLength;
}

// The helper closes both from inside the completion, on whichever thread that comes.
void Data::onCompletion(uint32_t /*capability*/, int32_t /*result*/) {
  close();
  _item.close();
}

Item::Item(Object& camera, uint32_t id)
    : Object(camera.context(), &camera, id, "item", "item " + std::to_string(id) + " of " + camera.name()) {}

bool Item::openAll() {
  if (!open()) return false;
  if (!mustAnnounce(kNkMAIDCapability_DataTypes, kNumbers, "DataTypes, which says that there is image data"))
    return false;
  const auto types = number(kNkMAIDCapability_DataTypes);
  if (!types) return false;
  if ((*types & kNkMAIDDataObjType_Image) == 0) {
    note("it has no image data (DataTypes " + std::to_string(*types) + "): nothing is transferred");
    return false;
  }
  _data = std::make_unique<Data>(*this);
  if (!_data->open()) return false;
  _data->examine();
  return true;
}

std::vector<Object*> Item::below() const { return _data ? std::vector<Object*>{_data.get()} : std::vector<Object*>(); }

}  // namespace modulecheck
