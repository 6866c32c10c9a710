// Names of the SDK's numbers, for the debug log and nothing else. Any thread.
#pragma once

#include <cstdint>

struct EnumMapEntry {
  std::int32_t value;
  const char* name;  // null in the row that ends a table, whose value is 0
};

extern const EnumMapEntry CommandDebugList[];
extern const EnumMapEntry EventDebugList[];
extern const EnumMapEntry ErrorDebugList[];
extern const EnumMapEntry CapabilityDebugList[];

// The value's name. For a value that the table does not hold, a text in one buffer that all such look-ups, on all
// threads, write to: use it at once. Null for 0 in a table without a row for 0.
const char* enumToName(std::int32_t value, const EnumMapEntry* table);

const char* errorToName(std::int32_t result);
const char* eventToName(std::int32_t event);
const char* commandToName(std::int32_t command);
const char* capabilityToName(std::int32_t capability);

// Writes a result and its name to the debug log.
void debugDumpError(std::int32_t result);
