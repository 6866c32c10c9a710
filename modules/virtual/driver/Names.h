// The names under which camera.json knows the numbers of the interface: those of the header without their prefix.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

namespace virtualcamera {

// Nothing for a name that is not known.
std::optional<int64_t> capabilityNumber(std::string_view name);  // "Aperture"
std::optional<int64_t> commandNumber(std::string_view name);     // "CapStart"
std::optional<int64_t> resultNumber(std::string_view name);      // "HardwareError"

}  // namespace virtualcamera
