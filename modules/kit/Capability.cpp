#include "Capability.h"

#include <algorithm>
#include <cstring>

namespace camerakit {
namespace {

bool ofStrings(const Enumeration& list) {
  return list.elementType == kNkMAIDArrayType_PackedString || list.elementType == kNkMAIDArrayType_String;
}

size_t packedSize(const std::vector<std::string>& strings) {
  size_t size = 0;
  for (const std::string& string : strings) size += string.size() + 1;
  return size;
}

int32_t readString(const std::string& value, void* data) {
  const size_t length = std::min<size_t>(value.size(), kNkMAIDStringSize - 1);
  std::memcpy(data, value.data(), length);
  std::memset(static_cast<char*>(data) + length, 0, kNkMAIDStringSize - length);
  return kNkMAIDResult_NoError;
}

template <typename T>
int32_t store(const T& value, void* data) {
  std::memcpy(data, &value, sizeof value);
  return kNkMAIDResult_NoError;
}

}  // namespace

tagNkMAIDEnum Enumeration::header() const {
  tagNkMAIDEnum record{};
  record.elementType = elementType;
  record.currentIndex = current;
  if (elementType == kNkMAIDArrayType_PackedString) {
    record.elementCount = static_cast<uint32_t>(packedSize(strings));
    record.elementSize = 1;
  } else if (elementType == kNkMAIDArrayType_String) {
    record.elementCount = static_cast<uint32_t>(strings.size());
    record.elementSize = kNkMAIDStringSize;
  } else {
    record.elementCount = static_cast<uint32_t>(numbers.size());
    record.elementSize = sizeof(uint32_t);
  }
  return record;
}

std::vector<uint8_t> Enumeration::elements() const {
  const tagNkMAIDEnum record = header();
  std::vector<uint8_t> bytes(size_t{record.elementCount} * static_cast<size_t>(record.elementSize));
  if (!ofStrings(*this)) {
    if (!bytes.empty()) std::memcpy(bytes.data(), numbers.data(), bytes.size());
    return bytes;
  }
  size_t offset = 0;
  for (const std::string& string : strings) {
    const bool packed = elementType == kNkMAIDArrayType_PackedString;
    const size_t length = packed ? string.size() : std::min<size_t>(string.size(), kNkMAIDStringSize - 1);
    std::copy_n(string.begin(), length, bytes.begin() + static_cast<std::ptrdiff_t>(offset));
    offset += packed ? length + 1 : size_t{kNkMAIDStringSize};
  }
  return bytes;
}

Capability Capability::integers(uint32_t id, const std::vector<int32_t>& values, uint32_t current) {
  return enumeration(id, {kNkMAIDArrayType_Integer, {values.begin(), values.end()}, {}, current});
}

Capability Capability::unsigneds(uint32_t id, std::vector<uint32_t> values, uint32_t current) {
  return enumeration(id, {kNkMAIDArrayType_Unsigned, std::move(values), {}, current});
}

Capability Capability::packedStrings(uint32_t id, std::vector<std::string> values, uint32_t current) {
  return enumeration(id, {kNkMAIDArrayType_PackedString, {}, std::move(values), current});
}

Capability Capability::strings(uint32_t id, std::vector<std::string> values, uint32_t current) {
  return enumeration(id, {kNkMAIDArrayType_String, {}, std::move(values), current});
}

int32_t Capability::read(uint32_t dataType, void* data) const {
  if (data == nullptr) return kNkMAIDResult_UnexpectedDataType;
  if (const bool* flag = std::get_if<bool>(&value); flag && dataType == kNkMAIDDataType_BooleanPtr)
    return store<uint8_t>(*flag ? 1 : 0, data);
  if (const int32_t* number = std::get_if<int32_t>(&value); number && dataType == kNkMAIDDataType_IntegerPtr)
    return store(*number, data);
  if (const uint32_t* number = std::get_if<uint32_t>(&value); number && dataType == kNkMAIDDataType_UnsignedPtr)
    return store(*number, data);
  if (const std::string* text = std::get_if<std::string>(&value); text && dataType == kNkMAIDDataType_StringPtr)
    return readString(*text, data);
  if (const Enumeration* list = std::get_if<Enumeration>(&value); list && dataType == kNkMAIDDataType_EnumPtr)
    return store(list->header(), data);
  return kNkMAIDResult_UnexpectedDataType;
}

int32_t Capability::readElements(uint32_t dataType, void* data) const {
  const Enumeration* list = std::get_if<Enumeration>(&value);
  if (list == nullptr || dataType != kNkMAIDDataType_EnumPtr || data == nullptr)
    return kNkMAIDResult_UnexpectedDataType;
  const auto* room = static_cast<const tagNkMAIDEnum*>(data);
  const tagNkMAIDEnum header = list->header();
  if (room->elementCount != header.elementCount || room->elementSize != header.elementSize)
    return kNkMAIDResult_BufferSize;
  const std::vector<uint8_t> bytes = list->elements();
  if (bytes.empty()) return kNkMAIDResult_NoError;
  if (room->elements == nullptr) return kNkMAIDResult_BufferSize;
  std::memcpy(room->elements, bytes.data(), bytes.size());
  return kNkMAIDResult_NoError;
}

}  // namespace camerakit
