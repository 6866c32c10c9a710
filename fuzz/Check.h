// A rule that holds for every input. One that does not ends the program, which is a finding.
#pragma once

#include <cstdio>
#include <cstdlib>

namespace fuzz {

inline void check(bool holds, const char* rule) {
  if (holds) return;
  std::fprintf(stderr, "Broken rule: %s\n", rule);
  std::abort();
}

}  // namespace fuzz
