// Reading and setting what an object announces.

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <new>

#include "DebugTrace.h"
#include "ModuleLoading.h"
#include "NameTables.h"
#include "NikonObject.h"

namespace {

// How often a list that changes between its count and its reading is read again before that counts as a failure.
constexpr int kMostListReads = 100;

const char* capabilityName(std::int32_t capability) {
  const char* const name = capabilityToName(capability);
  return name == nullptr ? "(could not be found)" : name;
}

// A string in a buffer of the SDK's filling, which may lack its end.
std::string textIn(const char* buffer, std::size_t size) { return {buffer, strnlen(buffer, size)}; }

bool isIntegers(const tagNkMAIDEnum& record) {
  return record.elementType == kNkMAIDArrayType_Integer || record.elementType == kNkMAIDArrayType_Unsigned;
}

}  // namespace

// The list.

void CNikonObject::readCapabilities() {
  if (!checkObject()) return;
  std::int32_t result = kNkMAIDResult_NoError;
  bool again = true;
  for (int reads = 0; again && reads < kMostListReads; ++reads) result = readCapabilitiesOnce(again);
  if (result != kNkMAIDResult_NoError) debugmsgint("Error from kNkMAIDCommand_GetCapInfo: %ld", result);
}

std::int32_t CNikonObject::readCapabilitiesOnce(bool& again) {
  again = false;
  std::uint32_t count = 0;
  std::int32_t result = send(kNkMAIDCommand_GetCapCount, 0, kNkMAIDDataType_UnsignedPtr, sdkData(&count));
  if (result != kNkMAIDResult_NoError) return result;
  if (count * std::uint64_t{sizeof(tagNkMAIDCapInfo)} > kLargestSdkArray) return kNkMAIDResult_OutOfMemory;
  std::unique_ptr<tagNkMAIDCapInfo[]> list(new (std::nothrow) tagNkMAIDCapInfo[count]());
  if (!list) return kNkMAIDResult_OutOfMemory;
  result = send(kNkMAIDCommand_GetCapInfo, count, kNkMAIDDataType_CapInfoPtr, sdkData(list.get()));
  again = result == kNkMAIDResult_BufferSize;
  if (result != kNkMAIDResult_NoError) return result;
  _capabilityCount = static_cast<std::int32_t>(count);
  _capabilities = std::move(list);
  return kNkMAIDResult_NoError;
}

const tagNkMAIDCapInfo* CNikonObject::findCapability(std::int32_t capability) const {
  const tagNkMAIDCapInfo* const begin = _capabilities.get();
  const tagNkMAIDCapInfo* const end = begin + _capabilityCount;
  const auto* const found = std::find_if(
      begin, end, [&](const tagNkMAIDCapInfo& entry) { return entry.id == static_cast<std::uint32_t>(capability); });
  return found == end ? nullptr : found;
}

bool CNikonObject::hasCapability(std::int32_t capability, const tagNkMAIDCapInfo** info) const {
  const tagNkMAIDCapInfo* const found = findCapability(capability);
  if (info != nullptr) *info = found;
  return found != nullptr;
}

void CNikonObject::debugDumpCapabilities() {
  if (!_capabilities) readCapabilities();
  debugmsgint("Nikon Capabilities - count: %d", _capabilityCount);
  for (std::int32_t index = 0; index < _capabilityCount; ++index) {
    const tagNkMAIDCapInfo& entry = _capabilities[index];
    const auto capability = static_cast<std::int32_t>(entry.id);
    char line[160];
    std::snprintf(line, sizeof line, "\t%d\t%s\t%ld", capability, capabilityName(capability),
                  static_cast<long>(entry.valueType));
    debugmsg(line);
  }
  debugmsg("------");
}

// Raw access.

std::int32_t CNikonObject::send(std::uint32_t command, std::uint32_t parameter, std::uint32_t dataType,
                                std::uint64_t data) {
  const SdkRecord::Call call(record());
  if (!call) return kNotOpen;
  return CallMAIDEntryPoint(_entryPoint, call.object(), command, parameter, dataType, data, nullptr, nullptr);
}

std::int32_t CNikonObject::getCapability(std::int32_t capability, std::uint32_t dataType, std::uint64_t data) {
  if (!checkObject()) return kNotOpen;
  if (!hasCapability(capability)) return kNotAnnounced;
  return send(kNkMAIDCommand_CapGet, capability, dataType, data);
}

std::int32_t CNikonObject::setCapability(std::int32_t capability, std::uint32_t dataType, std::uint64_t data) {
  if (!checkObject()) return kNotOpen;
  if (!hasCapability(capability)) return kNotAnnounced;
  return send(kNkMAIDCommand_CapSet, capability, dataType, data);
}

std::int32_t CNikonObject::getCapabilityArray(std::int32_t capability, std::uint32_t dataType, std::uint64_t data) {
  if (!checkObject()) return kNotOpen;
  if (!hasCapability(capability)) return kNotAnnounced;
  return send(kNkMAIDCommand_CapGetArray, capability, dataType, data);
}

// Typed values.

std::int32_t CNikonObject::getIntCapability(std::int32_t capability, std::int32_t& value) {
  if (!checkObject()) return kNotOpen;
  const tagNkMAIDCapInfo* const info = findCapability(capability);
  if (info == nullptr) return kNotAnnounced;
  std::uint32_t dataType = 0;
  if (info->valueType == kNkMAIDCapType_Integer) {
    dataType = kNkMAIDDataType_IntegerPtr;
  } else if (info->valueType == kNkMAIDCapType_Unsigned) {
    dataType = kNkMAIDDataType_UnsignedPtr;
  } else {
    return kNotOpen;
  }
  std::int32_t read = 0;
  const std::int32_t result = getCapability(capability, dataType, sdkData(&read));
  if (result == kNkMAIDResult_NoError) value = read;
  return result;
}

std::int32_t CNikonObject::getBoolCapability(std::int32_t capability, bool& value) {
  std::uint8_t read = 0;
  const std::int32_t result = getCapability(capability, kNkMAIDDataType_BooleanPtr, sdkData(&read));
  if (result == kNkMAIDResult_NoError) value = read != 0;
  return result;
}

std::int32_t CNikonObject::getStringCapability(std::int32_t capability, std::string& value) {
  char read[kNkMAIDStringSize] = {};
  const std::int32_t result = getCapability(capability, kNkMAIDDataType_StringPtr, sdkData(read));
  if (result == kNkMAIDResult_NoError) value = textIn(read, sizeof read);
  return result;
}

// Enumerations.

// Reads the elements that the record announces, into a block that is as large as the record said before the SDK got it
// to fill in.
std::int32_t CNikonObject::readEnumArray(std::int32_t capability, tagNkMAIDEnum& record, std::vector<char>& elements) {
  if (record.elementSize <= 0) return kNotOpen;
  const std::uint64_t size = std::uint64_t{record.elementCount} * static_cast<std::uint64_t>(record.elementSize);
  if (size > kLargestSdkArray) return kNotOpen;
  try {
    elements.assign(size, '\0');
  } catch (const std::bad_alloc&) {
    return kNoMemory;
  }
  record.elements = elements.data();
  return getCapabilityArray(capability, kNkMAIDDataType_EnumPtr, sdkData(&record));
}

std::int32_t CNikonObject::getEnumIntCapability(std::int32_t capability, std::int32_t& value) {
  const tagNkMAIDCapInfo* const info = findCapability(capability);
  if (info == nullptr || info->valueType != kNkMAIDCapType_Enum) return kNotOpen;
  tagNkMAIDEnum record{};
  std::int32_t result = getCapability(capability, kNkMAIDDataType_EnumPtr, sdkData(&record));
  if (result != kNkMAIDResult_NoError) return result;
  if (!isIntegers(record) || record.elementSize != sizeof value) return kNotOpen;
  if (record.elementCount == 0) {
    debugmsgint("enum had no elements for parameter: %d", capability);
    value = 0;
    return kNkMAIDResult_NoError;
  }
  std::vector<char> elements;
  result = readEnumArray(capability, record, elements);
  if (result != kNkMAIDResult_NoError) return result == kNoMemory ? kNotOpen : result;
  const std::uint64_t offset = std::uint64_t{record.currentIndex} * sizeof value;
  if (offset >= elements.size()) return kNotOpen;
  std::memcpy(&value, elements.data() + offset, sizeof value);
  return kNkMAIDResult_NoError;
}

std::int32_t CNikonObject::getEnumStringCapability(std::int32_t capability, std::string& value) {
  const tagNkMAIDCapInfo* const info = findCapability(capability);
  if (info == nullptr || info->valueType != kNkMAIDCapType_Enum) return kNotOpen;
  tagNkMAIDEnum record{};
  const std::int32_t result = getCapability(capability, kNkMAIDDataType_EnumPtr, sdkData(&record));
  if (result != kNkMAIDResult_NoError) return result;
  if (record.elementType == kNkMAIDArrayType_String) return getEnumStringCapability_unpacked(capability, record, value);
  if (record.elementType == kNkMAIDArrayType_PackedString) {
    return getEnumStringCapability_packed(capability, record, value);
  }
  return kNotOpen;
}

std::int32_t CNikonObject::getEnumStringCapability_packed(std::int32_t capability, tagNkMAIDEnum& record,
                                                          std::string& value) {
  if (record.elementSize != 1) return kNotOpen;
  if (record.elementCount == 0) {
    value.clear();
    return kNkMAIDResult_NoError;
  }
  std::vector<char> packed;
  const std::int32_t result = readEnumArray(capability, record, packed);
  if (result == kNoMemory) return kNkMAIDResult_NoError;
  if (result != kNkMAIDResult_NoError) return result;
  std::size_t offset = 0;
  for (std::uint32_t left = record.currentIndex; offset < packed.size() && left > 0; --left) {
    offset += strnlen(packed.data() + offset, packed.size() - offset) + 1;
  }
  if (offset >= packed.size()) {
    debugmsgint("Ran out of space in packed string while attempting to get enum value for parameter %d", capability);
    return kNotOpen;
  }
  value = textIn(packed.data() + offset, packed.size() - offset);
  return kNkMAIDResult_NoError;
}

std::int32_t CNikonObject::getEnumStringCapability_unpacked(std::int32_t capability, tagNkMAIDEnum& record,
                                                            std::string& value) {
  if (record.elementSize != kNkMAIDStringSize) return kNkMAIDResult_NoError;
  if (record.elementCount == 0) {
    value.clear();
    return kNkMAIDResult_NoError;
  }
  std::vector<char> strings;
  const std::int32_t result = readEnumArray(capability, record, strings);
  if (result == kNoMemory) return kNkMAIDResult_NoError;
  if (result != kNkMAIDResult_NoError) return result;
  const std::uint64_t offset = std::uint64_t{record.currentIndex} * kNkMAIDStringSize;
  if (offset >= strings.size()) return kNotOpen;
  value = textIn(strings.data() + offset, kNkMAIDStringSize);
  return kNkMAIDResult_NoError;
}

// Values for the host.

std::unique_ptr<KtLuaTE> CNikonObject::getCapabilityAsTE(std::int32_t capability) {
  const tagNkMAIDCapInfo* const info = findCapability(capability);
  if (info == nullptr) return nullptr;
  switch (info->valueType) {
    case kNkMAIDCapType_Boolean: {
      bool value = false;
      if (getBoolCapability(capability, value) != kNkMAIDResult_NoError) return nullptr;
      return std::make_unique<KtLuaTENumber>(value ? 1.0 : 0.0);
    }
    case kNkMAIDCapType_Integer:
    case kNkMAIDCapType_Unsigned: {
      std::int32_t value = 0;
      if (getIntCapability(capability, value) != kNkMAIDResult_NoError) return nullptr;
      return std::make_unique<KtLuaTENumber>(value);
    }
    case kNkMAIDCapType_String: {
      std::string value;
      if (getStringCapability(capability, value) != kNkMAIDResult_NoError) return nullptr;
      return std::make_unique<KtLuaTEString>(value);
    }
    case kNkMAIDCapType_Enum:
      return getEnumAsTE(capability);
    default:
      debugmsgstr("Unhandled parameter type for parameter %s", capabilityName(capability));
      debugmsgint("Parameter type was %d", static_cast<std::int32_t>(info->valueType));
      return nullptr;
  }
}

std::unique_ptr<KtLuaTE> CNikonObject::getEnumAsTE(std::int32_t capability) {
  tagNkMAIDEnum record{};
  if (getCapability(capability, kNkMAIDDataType_EnumPtr, sdkData(&record)) != kNkMAIDResult_NoError) return nullptr;
  if (isIntegers(record)) {
    std::int32_t value = 0;
    if (getEnumIntCapability(capability, value) != kNkMAIDResult_NoError) return nullptr;
    return std::make_unique<KtLuaTENumber>(value);
  }
  if (record.elementType == kNkMAIDArrayType_PackedString || record.elementType == kNkMAIDArrayType_String) {
    std::string value;
    if (getEnumStringCapability(capability, value) != kNkMAIDResult_NoError) return nullptr;
    return std::make_unique<KtLuaTEString>(value);
  }
  debugmsgstr("Unhandled enum type for parameter id: %s", capabilityName(capability));
  debugmsgint("enum type was %d", static_cast<std::int32_t>(record.elementType));
  return nullptr;
}
