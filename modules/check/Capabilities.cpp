// What objects announce, and its values.
#include <algorithm>
#include <cstring>

#include "Names.h"
#include "Object.h"

namespace modulecheck {
namespace {

constexpr uint64_t kLargestArray = uint64_t{64} << 20;
constexpr int kMostListReads = 100;
constexpr uint32_t kUntouchedWord = 0xA5A5A5A5;

bool isString(const tagNkMAIDEnum& header) {
  return header.elementType == kNkMAIDArrayType_PackedString || header.elementType == kNkMAIDArrayType_String;
}

std::string sizeText(const tagNkMAIDEnum& header) {
  return std::to_string(header.elementCount) + " elements of " + std::to_string(header.elementSize) + " bytes";
}

bool isUtf8(const char* text) {
  for (const auto* at = reinterpret_cast<const unsigned char*>(text); *at != 0;) {
    const int more = *at < 0x80 ? 0 : *at < 0xC2 ? -1 : *at < 0xE0 ? 1 : *at < 0xF0 ? 2 : *at < 0xF5 ? 3 : -1;
    if (more < 0) return false;
    ++at;
    for (int i = 0; i < more; ++i) {
      if ((*at++ & 0xC0) != 0x80) return false;
    }
  }
  return true;
}

}  // namespace

// The list.

bool Object::readList() {
  uint32_t count = 0;
  int32_t result = kNkMAIDResult_BufferSize;
  for (int reads = 0; result == kNkMAIDResult_BufferSize && reads < kMostListReads; ++reads) {
    result = readListOnce(count);
  }
  if (result != kNkMAIDResult_NoError) {
    fault("its capabilities cannot be read: " + resultText(result), "GetCapCount and GetCapInfo that answer NoError");
    return false;
  }
  checkList();
  checkListRoom(count);
  return true;
}

int32_t Object::readListOnce(uint32_t& count) {
  Room number(sizeof count);
  int32_t result = call(kNkMAIDCommand_GetCapCount, 0, kNkMAIDDataType_UnsignedPtr, number.address());
  checkRoom(number, "GetCapCount");
  if (result != kNkMAIDResult_NoError) {
    return result == kNkMAIDResult_BufferSize ? static_cast<int32_t>(kNkMAIDResult_UnexpectedError) : result;
  }
  count = *number.as<uint32_t>();
  const uint64_t size = uint64_t{count} * sizeof(tagNkMAIDCapInfo);
  if (size > kLargestArray) {
    fault("GetCapCount counts " + std::to_string(count) + " capabilities",
          "a number that was filled in, at most 64 MiB of records");
    return kNkMAIDResult_OutOfMemory;
  }
  Room records(size);
  result = call(kNkMAIDCommand_GetCapInfo, count, kNkMAIDDataType_CapInfoPtr, records.address());
  checkRoom(records, "GetCapInfo");
  if (result == kNkMAIDResult_NoError) {
    _list.resize(count);
    if (count != 0) std::memcpy(_list.data(), records.as(), size);
  }
  return result;
}

void Object::checkList() {
  for (size_t i = 0; i < _list.size(); ++i) {
    const uint32_t id = _list[i].id;
    if (id == kUntouchedWord || _list[i].valueType == kUntouchedWord) {
      fault("GetCapInfo left record " + std::to_string(i + 1) + " of " + std::to_string(_list.size()) + " as it was",
            "as many capabilities as GetCapCount counts, id and value type in each");
    } else if (find(id) != &_list[i]) {
      fault("it announces " + capabilityText(id) + " twice", "every capability once");
    }
  }
}

// The list may change between the count and the reading: then it must not be written as if it had not.
void Object::checkListRoom(uint32_t count) {
  if (count == 0) return;
  Room records((count - 1) * sizeof(tagNkMAIDCapInfo));
  const int32_t result = call(kNkMAIDCommand_GetCapInfo, count - 1, kNkMAIDDataType_CapInfoPtr, records.address());
  if (records.isIntact() && result == kNkMAIDResult_BufferSize) return;
  fault("GetCapInfo with room for one capability less answered " + resultText(result) +
            (records.isIntact() ? "" : " and wrote outside it"),
        "BufferSize, and nothing written, where the count is another one");
}

const tagNkMAIDCapInfo* Object::find(uint32_t capability) const {
  const auto found =
      std::find_if(_list.begin(), _list.end(), [&](const tagNkMAIDCapInfo& info) { return info.id == capability; });
  return found == _list.end() ? nullptr : &*found;
}

bool Object::mustAnnounce(uint32_t capability, std::initializer_list<uint32_t> types, const char* why) {
  const tagNkMAIDCapInfo* const info = find(capability);
  if (info == nullptr) {
    fault("it does not announce " + capabilityText(capability), why);
    return false;
  }
  if (std::find(types.begin(), types.end(), info->valueType) != types.end()) return true;
  fault("it announces " + capabilityText(capability) + " with value type " + std::to_string(info->valueType),
        "the value type that the page gives for it");
  return false;
}

// Values.

int32_t Object::get(uint32_t capability, uint32_t dataType, Room& room) {
  const int32_t result = call(kNkMAIDCommand_CapGet, capability, dataType, room.address());
  checkRoom(room, "CapGet " + capabilityText(capability));
  return result;
}

int32_t Object::getOrComplain(uint32_t capability, uint32_t dataType, Room& room, Reading reading) {
  const int32_t result = get(capability, dataType, room);
  if (result == kNkMAIDResult_NoError) return result;
  const std::string what = "CapGet " + capabilityText(capability) + " answered " + resultText(result);
  if (reading == Reading::kMust) {
    fault(what, "NoError and the value of " + capabilityText(capability));
  } else {
    note(what + ": the host is told nothing");
  }
  return result;
}

std::optional<uint32_t> Object::number(uint32_t capability, Reading reading) {
  const tagNkMAIDCapInfo* const info = find(capability);
  if (info == nullptr) return {};
  const bool isSigned = info->valueType == kNkMAIDCapType_Integer;
  Room room(sizeof(uint32_t));
  const uint32_t dataType = isSigned ? kNkMAIDDataType_IntegerPtr : kNkMAIDDataType_UnsignedPtr;
  if (getOrComplain(capability, dataType, room, reading) != kNkMAIDResult_NoError) return {};
  if (room.isUntouchedAtTheEnd(room.size())) {
    fault("CapGet " + capabilityText(capability) + " answered NoError and left the number as it was",
          "a number of 32 bits, filled in");
  }
  return *room.as<uint32_t>();
}

std::optional<bool> Object::flag(uint32_t capability) {
  Room room(1);
  if (getOrComplain(capability, kNkMAIDDataType_BooleanPtr, room, Reading::kMust) != kNkMAIDResult_NoError) return {};
  return *room.as() != 0;
}

std::optional<std::string> Object::text(uint32_t capability, Reading reading) {
  Room room(kNkMAIDStringSize);
  if (getOrComplain(capability, kNkMAIDDataType_StringPtr, room, reading) != kNkMAIDResult_NoError) return {};
  checkText(capability, room.as<char>(), room.size());
  return std::string(room.as<char>(), strnlen(room.as<char>(), room.size()));
}

void Object::checkText(uint32_t capability, const char* bytes, size_t size) const {
  if (std::memchr(bytes, 0, size) == nullptr) {
    fault("a string of " + capabilityText(capability) + " has no end", "a zero byte within the 256 bytes of a string");
  } else if (!isUtf8(bytes)) {
    note("a string of " + capabilityText(capability) + " is no UTF-8; the host gets its bytes as they are");
  }
}

// Enumerations.

bool Object::fitsItsType(uint32_t capability, const tagNkMAIDEnum& header) const {
  const std::string what = capabilityText(capability) + " has " + sizeText(header);
  int size = 0;
  switch (header.elementType) {
    case kNkMAIDArrayType_Integer:
    case kNkMAIDArrayType_Unsigned:
      size = sizeof(uint32_t);
      break;
    case kNkMAIDArrayType_PackedString:
      size = 1;
      break;
    case kNkMAIDArrayType_String:
      size = kNkMAIDStringSize;
      break;
    default:
      fault(what + ", of element type " + std::to_string(header.elementType), "element type 1, 2, 7 or 8");
      return false;
  }
  if (header.elementSize != size) {
    fault(what + ", of element type " + std::to_string(header.elementType),
          "the element size of the type: 4 for numbers, 1 for packed strings, 256 for strings");
    return false;
  }
  if (uint64_t{header.elementCount} * static_cast<uint64_t>(size) > kLargestArray) {
    fault(what, "at most 64 MiB of elements");
    return false;
  }
  return true;
}

// The header and, in a room as large as it says, the elements.
std::optional<Room> Object::list(uint32_t capability, tagNkMAIDEnum& header, Reading reading) {
  Room room(sizeof header, 0);
  if (getOrComplain(capability, kNkMAIDDataType_EnumPtr, room, reading) != kNkMAIDResult_NoError) return {};
  header = *room.as<tagNkMAIDEnum>();
  if (header.elementCount == 0 || !fitsItsType(capability, header)) return {};
  checkListArrayRoom(capability, header);
  Room elements(size_t{header.elementCount} * static_cast<size_t>(header.elementSize));
  room.as<tagNkMAIDEnum>()->elements = elements.as();
  const int32_t result = call(kNkMAIDCommand_CapGetArray, capability, kNkMAIDDataType_EnumPtr, room.address());
  checkRoom(elements, "CapGetArray " + capabilityText(capability));
  if (result != kNkMAIDResult_NoError) {
    fault("CapGetArray " + capabilityText(capability) + " answered " + resultText(result) + " to " + sizeText(header),
          "NoError and as many elements as CapGet has counted");
    return {};
  }
  checkElements(capability, header, elements);
  return elements;
}

// As it is when the list has grown since its header was read.
void Object::checkListArrayRoom(uint32_t capability, const tagNkMAIDEnum& header) {
  Room room(sizeof header, 0);
  Room elements(size_t{header.elementCount - 1} * static_cast<size_t>(header.elementSize));
  *room.as<tagNkMAIDEnum>() = header;
  room.as<tagNkMAIDEnum>()->elementCount = header.elementCount - 1;
  room.as<tagNkMAIDEnum>()->elements = elements.as();
  const int32_t result = call(kNkMAIDCommand_CapGetArray, capability, kNkMAIDDataType_EnumPtr, room.address());
  if (!elements.isIntact()) {
    fault("CapGetArray " + capabilityText(capability) + " with room for one element less answered " +
              resultText(result) + " and wrote outside it",
          "BufferSize, and nothing written, where the list does not fit the record");
  }
}

void Object::checkElements(uint32_t capability, const tagNkMAIDEnum& header, Room& room) const {
  const char* const bytes = room.as<char>();
  uint64_t elements = header.elementCount;
  if (header.elementType == kNkMAIDArrayType_PackedString) {
    elements = static_cast<uint64_t>(std::count(bytes, bytes + room.size(), '\0'));
    if (bytes[room.size() - 1] != 0) {
      fault("the packed strings of " + capabilityText(capability) + " have no end within their " +
                std::to_string(room.size()) + " bytes",
            "a count of the bytes of all strings, each with its zero byte");
    }
  } else if (header.elementType == kNkMAIDArrayType_String) {
    for (uint64_t i = 0; i < elements; ++i) checkText(capability, bytes + i * kNkMAIDStringSize, kNkMAIDStringSize);
  }
  if (!isString(header) && room.isUntouchedAtTheEnd(sizeof(uint32_t))) {
    fault("CapGetArray " + capabilityText(capability) + " did not fill the last of " + sizeText(header),
          "every element filled in that CapGet has counted");
  }
  if (capability != kNkMAIDCapability_Children && header.currentIndex >= elements) {
    fault("the current index of " + capabilityText(capability) + " is " + std::to_string(header.currentIndex) +
              ", of " + std::to_string(elements) + " elements",
          "an index of an element, counted from 0");
  }
}

std::optional<std::vector<uint32_t>> Object::children() {
  tagNkMAIDEnum header{};
  header.elementCount = kUntouchedWord;
  auto elements = list(kNkMAIDCapability_Children, header, Reading::kMust);
  if (!elements) return header.elementCount == 0 ? std::optional(std::vector<uint32_t>()) : std::nullopt;
  if (isString(header)) {
    fault("Children lists strings", "an enumeration of 4-byte ids");
    return {};
  }
  const auto* const ids = elements->as<uint32_t>();
  return std::vector<uint32_t>(ids, ids + header.elementCount);
}

void Object::checkSetting(uint32_t capability) {
  const tagNkMAIDCapInfo* const info = find(capability);
  if (info == nullptr) return note("it does not announce " + capabilityText(capability) + ": the host is told nothing");
  tagNkMAIDEnum header{};
  switch (info->valueType) {
    case kNkMAIDCapType_Boolean: {
      Room room(1);
      getOrComplain(capability, kNkMAIDDataType_BooleanPtr, room, Reading::kMay);
      break;
    }
    case kNkMAIDCapType_Integer:
    case kNkMAIDCapType_Unsigned:
      number(capability, Reading::kMay);
      break;
    case kNkMAIDCapType_String:
      text(capability, Reading::kMay);
      break;
    case kNkMAIDCapType_Enum:
      list(capability, header, Reading::kMay);
      break;
    default:
      fault("it announces " + capabilityText(capability) + " with value type " + std::to_string(info->valueType),
            "a setting that is boolean, integer, unsigned, string or enumeration");
  }
}

}  // namespace modulecheck
