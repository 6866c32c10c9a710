#include "Library.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <set>
#include <system_error>

namespace gphoto2camera {
namespace {

using camerakit::Guard;

using PortList = std::unique_ptr<GPPortInfoList, FreeWith<gp_port_info_list_free>>;
using List = std::unique_ptr<CameraList, FreeWith<gp_list_free>>;

// Letting a network camera go closes descriptor 0, which the library never opened. The next file of anyone would get
// that number, and be closed with the next camera. So what stood there is put back.
class InputKept {
 public:
  InputKept() : _copy(fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, STDERR_FILENO + 1)) {}
  ~InputKept() {
    restore();
    if (_copy >= 0) ::close(_copy);
  }
  InputKept(const InputKept&) = delete;
  InputKept& operator=(const InputKept&) = delete;

  void restore() const {
    if (_copy >= 0 && fcntl(STDIN_FILENO, F_GETFD) < 0) dup2(_copy, STDIN_FILENO);
  }

 private:
  const int _copy;  // -1 where nothing stood there
};

// A network camera that could not be opened all the way leaves its sockets behind. Nothing else in the process makes
// any while the library's lock is held.
class LeftSockets {
 public:
  LeftSockets() : _before(sockets()) {}
  void close() const {
    for (const int socket : sockets())
      if (!_before.contains(socket)) ::close(socket);
  }

 private:
  static std::set<int> sockets() {
    std::set<int> found;
    std::error_code error;
    for (std::filesystem::directory_iterator it("/proc/self/fd", error), end; !error && it != end;
         it.increment(error)) {
      const int descriptor = std::atoi(it->path().filename().c_str());
      int domain = 0;
      socklen_t size = sizeof domain;
      if (getsockopt(descriptor, SOL_SOCKET, SO_DOMAIN, &domain, &size) == 0 && domain == AF_INET)
        found.insert(descriptor);
    }
    return found;
  }

  const std::set<int> _before;
};

std::string pathOf(GPPortInfoList* ports, int at) {
  GPPortInfo info{};
  char* path = nullptr;
  if (gp_port_info_list_get_info(ports, at, &info) != GP_OK || gp_port_info_get_path(info, &path) != GP_OK) return {};
  return path;
}

}  // namespace

Context::Context() : _context(gp_context_new()) { gp_context_set_error_func(_context, keep, this); }

Context::~Context() { gp_context_unref(_context); }

GPContext* Context::fresh() {
  _words.clear();
  return _context;
}

std::string Context::words(int result) const { return _words.empty() ? gp_result_as_string(result) : _words; }

void Context::keep(GPContext*, const char* text, void* self) { static_cast<Context*>(self)->_words = text; }

Library& Library::get() {
  static Library& library = *new Library;  // its cameras' threads use it to the very end
  return library;
}

int Library::load() {
  if (_drivers != nullptr) return GP_OK;
  CameraAbilitiesList* drivers = nullptr;
  if (const int result = gp_abilities_list_new(&drivers); result != GP_OK) return result;
  const int result = gp_abilities_list_load(drivers, _context.fresh());
  if (result == GP_OK)
    _drivers = drivers;
  else
    gp_abilities_list_free(drivers);
  return result;
}

// Null where there is no memory for it.
GPPortInfoList* Library::ports() {
  GPPortInfoList* ports = nullptr;
  if (gp_port_info_list_new(&ports) != GP_OK) return nullptr;
  gp_port_info_list_load(ports);
  return ports;
}

std::vector<std::string> Library::usbPorts() {
  const Guard guard(_mutex);
  const PortList list(ports());
  std::vector<std::string> found;
  for (int i = 0; list && i < gp_port_info_list_count(list.get()); ++i)
    if (std::string path = pathOf(list.get(), i); path.starts_with("usb:") && path.size() > 4)
      found.push_back(std::move(path));
  return found;
}

std::vector<Address> Library::detect(const std::vector<std::string>& wanted) {
  const Guard guard(_mutex);
  const PortList list(ports());
  CameraList* raw = nullptr;
  if (!list || load() != GP_OK || gp_list_new(&raw) != GP_OK) return {};
  const List cameras(raw);
  if (gp_abilities_list_detect(_drivers, list.get(), raw, _context.fresh()) < GP_OK) return {};
  std::vector<Address> found;
  for (int i = 0; i < gp_list_count(raw); ++i) {
    const char *model = nullptr, *port = nullptr;
    CameraAbilities abilities{};
    if (gp_list_get_name(raw, i, &model) != GP_OK || gp_list_get_value(raw, i, &port) != GP_OK) continue;
    const int driver = gp_abilities_list_lookup_model(_drivers, model);
    if (driver < 0 || gp_abilities_list_get_abilities(_drivers, driver, &abilities) != GP_OK) continue;
    if (abilities.device_type != GP_DEVICE_STILL_CAMERA) continue;
    if (std::find(wanted.begin(), wanted.end(), port) != wanted.end()) found.push_back({model, port});
  }
  return found;
}

int Library::prepare(const Address& address, ::Camera* camera) {
  if (const int result = load(); result != GP_OK) return result;
  const int driver = gp_abilities_list_lookup_model(_drivers, address.model.c_str());
  if (driver < 0) return driver;
  CameraAbilities abilities{};
  gp_abilities_list_get_abilities(_drivers, driver, &abilities);
  if (const int result = gp_camera_set_abilities(camera, abilities); result != GP_OK) return result;
  const PortList list(ports());
  if (!list) return GP_ERROR_NO_MEMORY;
  const int port = gp_port_info_list_lookup_path(list.get(), address.port.c_str());
  GPPortInfo info{};
  if (port < 0) return port;
  if (const int result = gp_port_info_list_get_info(list.get(), port, &info); result != GP_OK) return result;
  return gp_camera_set_port_info(camera, info);
}

int Library::open(const Address& address, Context& context, ::Camera*& camera) {
  const Guard guard(_mutex);
  const InputKept kept;
  const LeftSockets left;
  ::Camera* made = nullptr;
  if (const int result = gp_camera_new(&made); result != GP_OK) return result;
  int result = prepare(address, made);
  if (result == GP_OK) result = gp_camera_init(made, context.fresh());
  if (result == GP_OK) {
    camera = made;
  } else {
    gp_camera_unref(made);
    left.close();
  }
  return result;
}

void Library::close(::Camera* camera, Context& context) {
  const Guard guard(_mutex);
  const InputKept kept;
  gp_camera_exit(camera, context.fresh());
  kept.restore();  // or the next line closes what took the place
  gp_camera_unref(camera);
}

}  // namespace gphoto2camera
