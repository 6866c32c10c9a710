// The interface's numbers as people read them: the header's names without their prefix, or the number.
#pragma once

#include <cstdint>
#include <string>

namespace modulecheck {

std::string commandText(uint32_t command);
std::string capabilityText(uint32_t capability);
std::string resultText(int32_t result);

}  // namespace modulecheck
