// What kind of picture a file holds, where its name does not say: cameras hand over what they know no type for as data.
#pragma once

#include <string>

namespace tether {

// The name with the extension that the file's content says in the place of ".dat"; as it is where it has another one,
// or the content is of no known kind. Reads from the start of the file that is open as `descriptor`.
std::string nameByContent(const std::string& name, int descriptor);

}  // namespace tether
