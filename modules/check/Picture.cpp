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
      item_(item) {}

void Data::examine() {
  mustAnnounce(kNkMAIDCapability_Acquire, {kNkMAIDCapType_Process}, "Acquire, without which no picture comes");
  mustAnnounce(kNkMAIDCapability_DataProc, {kNkMAIDCapType_Process}, "DataProc, without which no byte comes");
  for (const uint32_t capability : {kNkMAIDCapability_StoredBytes, kNkMAIDCapability_RawJpegImageStatus}) {
    if (announces(capability)) mustAnnounce(capability, kNumbers, "");
  }
  storedBytes_ = number(kNkMAIDCapability_StoredBytes);
  isHalf_ = number(kNkMAIDCapability_RawJpegImageStatus).value_or(0) != 0;
  if (announces(kNkMAIDCapability_Name)) text(kNkMAIDCapability_Name, Reading::kMay);
}

void Data::transfer() {
  if (!isOpen() || !announces(kNkMAIDCapability_Acquire)) return item_.takeDown();
  isTransferred_ = true;
  const Outcome outcome = perform(kNkMAIDCapability_Acquire);
  checkWhole(outcome);
  item_.takeDown();
}

void Data::checkWhole(const Outcome& outcome) {
  const std::lock_guard guard(mutex_);
  if (outcome.answer != kNkMAIDResult_NoError && outcome.answer != kNkMAIDResult_Pending) {
    return fault("CapStart Acquire answered " + resultText(outcome.answer),
                 "NoError or Pending; it is not tried again, and the picture is lost");
  }
  if (!outcome.result) return;
  if (*outcome.result != kNkMAIDResult_NoError) {
    fault("Acquire completed with " + resultText(*outcome.result), "NoError; it is not tried again");
  } else if (!isWhole_) {
    fault("Acquire completed with NoError after " + std::to_string(received_) + " of " + std::to_string(total_) +
              " bytes",
          "a delivery that reaches the total length before the completion");
  } else {
    ++context().report.shared().pictures;
  }
}

void Data::onDelivery(const tagNkMAIDFileInfo& info, const uint8_t* bytes) {
  {
    const std::lock_guard guard(mutex_);
    if (!isTransferred_)
      fault("a delivery came before its Acquire was started", "deliveries of a started Acquire only");
    if ((info.dataType & kNkMAIDDataObjType_File) == 0) {
      fault("a delivery has data type " + std::to_string(info.dataType), "the file flag, 0x10; others are ignored");
      return;
    }
    if (count_++ == 0) checkFirst(info);
    checkPlace(info);
    if (bytes == nullptr && info.ulLength != 0) {
      return fault("a delivery has no bytes", "a pointer to its bytes, good until the callback returns");
    }
    sum_ = std::accumulate(bytes, bytes + info.ulLength, sum_.load());
  }
  const bool elsewhere = std::this_thread::get_id() != context().mainThreadId;
  if (elsewhere && count_ == 1 && !context().mainThreadGetsThrough()) {
    fault("another thread's call does not return as long as a callback lasts", "no lock held while calling back");
  }
}

void Data::checkFirst(const tagNkMAIDFileInfo& info) {
  total_ = info.totalLength;
  if (storedBytes_.value_or(0) != 0 && *storedBytes_ != total_) {
    fault("it has " + std::to_string(*storedBytes_) + " StoredBytes and delivers " + std::to_string(total_),
          "StoredBytes and the total length of deliveries alike");
  }
  if (!hasExtension(info.fileDataType)) {
    note("file data type " + std::to_string(info.fileDataType) + " has no extension of its own: its file is a .dat");
  }
}

void Data::checkPlace(const tagNkMAIDFileInfo& info) {
  const std::string which = "delivery " + std::to_string(count_) + " brings " + std::to_string(info.ulLength) +
                            " bytes at " + std::to_string(info.ulStart);
  const uint64_t end = uint64_t{info.ulStart} + info.ulLength;
  if (info.totalLength != total_) {
    fault("delivery " + std::to_string(count_) + " has a total length of " + std::to_string(info.totalLength) +
              " after one of " + std::to_string(total_),
          "the same total length in all deliveries of a file");
  }
  if (isWhole_) {
    fault(which + " after the last one", "no delivery after the one that reaches the total length");
  } else if (end > total_) {
    fault(which + " of " + std::to_string(total_), "no byte beyond the total length");
  } else if (info.ulStart != received_) {
    fault(which + " after " + std::to_string(received_) + " bytes", "deliveries in file order, without gaps");
  }
  if (end > received_) noteProgress();
  received_ = std::max(received_, end);
  isWhole_ = isWhole_ || end >= info.totalLength;
}

// The helper closes both from inside the completion, on whichever thread that comes.
void Data::onCompletion(uint32_t /*capability*/, int32_t /*result*/) {
  close();
  item_.close();
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
  data_ = std::make_unique<Data>(*this);
  if (!data_->open()) return false;
  data_->examine();
  return true;
}

std::vector<Object*> Item::below() const { return data_ ? std::vector<Object*>{data_.get()} : std::vector<Object*>(); }

}  // namespace modulecheck
