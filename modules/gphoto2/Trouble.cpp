#include "Trouble.h"

#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <system_error>

namespace gphoto2camera {
namespace {

namespace fs = std::filesystem;

// "usb:001,005" is /dev/bus/usb/001/005.
std::string deviceFile(const std::string& port) {
  const size_t comma = port.find(',');
  if (!port.starts_with("usb:") || comma == std::string::npos) return {};
  return "/dev/bus/usb/" + port.substr(4, comma - 4) + "/" + port.substr(comma + 1);
}

bool holds(const fs::path& process, const std::string& file) {
  std::error_code error;
  for (fs::directory_iterator it(process / "fd", error), end; !error && it != end; it.increment(error)) {
    std::error_code unreadable;
    if (fs::read_symlink(it->path(), unreadable) == file) return true;
  }
  return false;
}

// Another process that has the file open; only those of the same user can be seen.
std::string holderOf(const std::string& file) {
  std::error_code error;
  for (fs::directory_iterator it("/proc", error), end; !error && it != end; it.increment(error)) {
    const std::string id = it->path().filename();
    const bool isProcess = std::all_of(id.begin(), id.end(), [](unsigned char c) { return std::isdigit(c) != 0; });
    if (!isProcess || id == std::to_string(getpid()) || !holds(it->path(), file)) continue;
    std::string name;
    std::getline(std::ifstream(it->path() / "comm"), name);
    return name.append(" (process ").append(id).append(")");
  }
  return {};
}

}  // namespace

std::string explain(const Address& address, int result, const std::string& words) {
  const std::string file = deviceFile(address.port);
  if (result == GP_ERROR_IO_USB_CLAIM || result == GP_ERROR_IO_LOCK) {
    const std::string holder = holderOf(file);
    const std::string who = holder.empty() ? "another process" : holder;
    return "held by " + who + "; where that is the desktop, `gio mount -s gphoto2` lets go";
  }
  if (!file.empty() && access(file.c_str(), R_OK | W_OK) != 0 && errno == EACCES)
    return "no permission for " + file +
           "; the package libgphoto2-6 brings the rule for that, which wants the camera to "
           "be plugged in again, and the user to sit at the machine or to be in the group plugdev";
  if (address.isNetwork())
    return words +
           "; is it switched on, connected to this network, and free of other programs? Its display may ask "
           "whether this computer may connect";
  return words;
}

}  // namespace gphoto2camera
