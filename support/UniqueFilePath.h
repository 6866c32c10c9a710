// Paths for new files that collide with nothing on disk. All paths are UTF-8. Any thread.
#pragma once

#include <string>

// The path itself where nothing has that name, else the first free one of base-2, base-3 and so on with the same
// extension. Nothing reserves the name. When all up to base-99998 are taken, that last one.
std::string KtFileUtils_ensureFileNameIsUnique(const std::string& path);

// A unique path for a file of that name in the directory, which is left as it is.
std::string MakeUniqueFilePath(std::string& directory, std::string name);
