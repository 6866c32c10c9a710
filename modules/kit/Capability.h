// A capability with its value: what a client finds when it reads what an object announces.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "MAID.h"

namespace camerakit {

// The entries of an enumeration, all of one element type, and which of them is the current one. The index is passed on
// as it is, beyond the entries too.
struct Enumeration {
  uint32_t elementType = kNkMAIDArrayType_Unsigned;  // kNkMAIDArrayType_...
  std::vector<uint32_t> numbers{};                   // of element types Integer and Unsigned
  std::vector<std::string> strings{};                // of element types PackedString and String (cut at 255 bytes)
  uint32_t current = 0;

  bool operator==(const Enumeration&) const = default;

  // As CapGet answers it; the elements pointer is null.
  tagNkMAIDEnum header() const;
  // The elements as CapGetArray lays them out.
  std::vector<uint8_t> elements() const;
};

struct Capability {
  uint32_t id = 0;
  uint32_t valueType = kNkMAIDCapType_Process;  // kNkMAIDCapType_..., or any other number: announced, never readable
  std::variant<std::monostate, bool, int32_t, uint32_t, std::string, Enumeration> value{};

  bool operator==(const Capability&) const = default;

  static Capability process(uint32_t id) { return {id, kNkMAIDCapType_Process, {}}; }
  static Capability boolean(uint32_t id, bool value) { return {id, kNkMAIDCapType_Boolean, value}; }
  static Capability integer(uint32_t id, int32_t value) { return {id, kNkMAIDCapType_Integer, value}; }
  static Capability unsignedInteger(uint32_t id, uint32_t value) { return {id, kNkMAIDCapType_Unsigned, value}; }
  static Capability string(uint32_t id, std::string value) { return {id, kNkMAIDCapType_String, std::move(value)}; }
  static Capability ofValueType(uint32_t id, uint32_t valueType) { return {id, valueType, {}}; }
  static Capability enumeration(uint32_t id, Enumeration value) { return {id, kNkMAIDCapType_Enum, std::move(value)}; }
  static Capability integers(uint32_t id, const std::vector<int32_t>& values, uint32_t current = 0);
  static Capability unsigneds(uint32_t id, std::vector<uint32_t> values, uint32_t current = 0);
  static Capability packedStrings(uint32_t id, std::vector<std::string> values, uint32_t current = 0);
  static Capability strings(uint32_t id, std::vector<std::string> values, uint32_t current = 0);

  // The value into what data points to, as the data type says. Answers UnexpectedDataType where the two do not fit.
  int32_t read(uint32_t dataType, void* data) const;
  // The elements into the block of the record that data points to. BufferSize where there is no room for just these.
  int32_t readElements(uint32_t dataType, void* data) const;
};

}  // namespace camerakit
