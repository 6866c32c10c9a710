// A camera as the helper announces it.
#pragma once

#include <cstdint>
#include <string>

namespace tether::command {

struct Camera {
  std::int32_t id = 0;
  std::string name;
};

}  // namespace tether::command
