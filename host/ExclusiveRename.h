// Renaming that never takes the place of anything.
#pragma once

#include <string>

namespace tether {

// Gives a file another name in one step. 0, or an error number: EEXIST when anything has that name, a link included;
// EXDEV for a name in another file system; EINVAL, ENOSYS or ENOTSUP where the file system cannot do it.
int renameExclusively(const std::string& from, const std::string& to);

}  // namespace tether
