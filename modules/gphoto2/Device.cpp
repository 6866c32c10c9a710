#include "Device.h"

#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <utility>

namespace gphoto2camera {
namespace {

using List = std::unique_ptr<CameraList, FreeWith<gp_list_free>>;
using Widget = std::unique_ptr<CameraWidget, FreeWith<gp_widget_free>>;

List makeList() {
  CameraList* list = nullptr;
  gp_list_new(&list);
  return List(list);
}

std::vector<std::string> namesOf(CameraList* list) {
  std::vector<std::string> names;
  for (int i = 0; i < gp_list_count(list); ++i)
    if (const char* name = nullptr; gp_list_get_name(list, i, &name) == GP_OK && name != nullptr)
      names.emplace_back(name);
  return names;
}

// Strings, or the ones that people would read for a switch and a number.
std::optional<std::string> textOf(CameraWidget* widget) {
  CameraWidgetType type{};
  gp_widget_get_type(widget, &type);
  if (type == GP_WIDGET_RADIO || type == GP_WIDGET_MENU || type == GP_WIDGET_TEXT) {
    const char* text = nullptr;
    if (gp_widget_get_value(widget, &text) != GP_OK || text == nullptr) return std::nullopt;
    return text;
  }
  if (type == GP_WIDGET_TOGGLE) {
    int on = 0;
    if (gp_widget_get_value(widget, &on) != GP_OK) return std::nullopt;
    return on != 0 ? "On" : "Off";
  }
  float number = 0;
  if (type != GP_WIDGET_RANGE || gp_widget_get_value(widget, &number) != GP_OK) return std::nullopt;
  char text[32];
  std::snprintf(text, sizeof text, "%g", static_cast<double>(number));
  return text;
}

// Tells of the bytes of a transfer that is one call.
class Progress {
 public:
  Progress(GPContext* context, const std::function<void()>& onBytes) : _context(context), _onBytes(onBytes) {
    gp_context_set_progress_funcs(context, started, came, stopped, this);
  }
  ~Progress() { gp_context_set_progress_funcs(_context, nullptr, nullptr, nullptr, nullptr); }
  Progress(const Progress&) = delete;
  Progress& operator=(const Progress&) = delete;

 private:
  static unsigned int started(GPContext*, float, const char*, void*) { return 1; }
  static void came(GPContext*, unsigned int, float, void* self) { static_cast<Progress*>(self)->_onBytes(); }
  static void stopped(GPContext*, unsigned int, void*) {}

  GPContext* const _context;
  const std::function<void()>& _onBytes;
};

}  // namespace

bool Device::isAnswer(int result) { return result == GP_ERROR_CAMERA_BUSY || result == GP_ERROR_NOT_SUPPORTED; }

int Device::note(int result) {
  switch (result) {
    case GP_ERROR_IO:
    case GP_ERROR_TIMEOUT:
    case GP_ERROR_IO_READ:
    case GP_ERROR_IO_WRITE:
    case GP_ERROR_IO_USB_FIND:
    case GP_ERROR_IO_USB_CLEAR_HALT:
      _isBroken = true;
      break;
    default:
      break;
  }
  return result;
}

int Device::open() {
  close();
  _isBroken = false;
  return Library::get().open(_address, _context, _camera);
}

void Device::close() {
  if (_camera != nullptr) Library::get().close(std::exchange(_camera, nullptr), _context);
}

int Device::wait(int milliseconds, Event& event) {
  event = {};
  CameraEventType type = GP_EVENT_TIMEOUT;
  void* raw = nullptr;
  const int result = note(gp_camera_wait_for_event(_camera, milliseconds, &type, &raw, _context.fresh()));
  const std::unique_ptr<void, FreeWith<std::free>> data(raw);
  if (result != GP_OK || type == GP_EVENT_TIMEOUT) return result;
  event.kind = Event::Kind::Other;
  if (type == GP_EVENT_FILE_ADDED && raw != nullptr) {
    const auto* path = static_cast<const CameraFilePath*>(raw);
    event = {Event::Kind::Added, {.folder = path->folder, .name = path->name}};
  } else if (type == GP_EVENT_UNKNOWN && raw != nullptr) {
    if (std::string(static_cast<const char*>(raw)).find("Property") != std::string::npos)
      event.kind = Event::Kind::Changed;
  }
  return result;
}

int Device::describe(File& file) {
  CameraFileInfo info{};
  const int result =
      note(gp_camera_file_get_info(_camera, file.folder.c_str(), file.name.c_str(), &info, _context.fresh()));
  if (result != GP_OK) return result;
  file.size = (info.file.fields & GP_FILE_INFO_SIZE) != 0 ? info.file.size : 0;
  file.time = (info.file.fields & GP_FILE_INFO_MTIME) != 0 ? info.file.mtime : 0;
  return result;
}

int Device::read(const File& file, uint64_t offset, uint8_t* bytes, uint64_t& size) {
  return gp_camera_file_read(_camera, file.folder.c_str(), file.name.c_str(), GP_FILE_TYPE_NORMAL, offset,
                             reinterpret_cast<char*>(bytes), &size, _context.fresh());
}

int Device::fetch(const File& file, int descriptor, const std::function<void()>& onBytes) {
  const int own = dup(descriptor);  // which the library closes
  CameraFile* raw = nullptr;
  if (own < 0) return GP_ERROR_OS_FAILURE;
  if (const int result = gp_file_new_from_fd(&raw, own); result != GP_OK) {
    ::close(own);
    return result;
  }
  const std::unique_ptr<CameraFile, FreeWith<gp_file_unref>> sink(raw);
  const Progress progress(_context.fresh(), onBytes);
  return gp_camera_file_get(_camera, file.folder.c_str(), file.name.c_str(), GP_FILE_TYPE_NORMAL, raw,
                            _context.fresh());
}

bool Device::canCapture() const {
  CameraAbilities abilities{};
  if (_camera == nullptr || gp_camera_get_abilities(_camera, &abilities) != GP_OK) return false;
  return (abilities.operations & (GP_OPERATION_CAPTURE_IMAGE | GP_OPERATION_TRIGGER_CAPTURE)) != 0;
}

int Device::trigger(bool& waited) {
  const int result = note(gp_camera_trigger_capture(_camera, _context.fresh()));
  if (result != GP_ERROR_NOT_SUPPORTED) return result;
  CameraFilePath path{};
  waited = true;
  return note(gp_camera_capture(_camera, GP_CAPTURE_IMAGE, &path, _context.fresh()));
}

int Device::list(const std::string& folder, bool folders, std::vector<std::string>& names) {
  const List list = makeList();
  if (!list) return GP_ERROR_NO_MEMORY;
  const auto call = folders ? gp_camera_folder_list_folders : gp_camera_folder_list_files;
  const int result = note(call(_camera, folder.c_str(), list.get(), _context.fresh()));
  if (result == GP_OK) names = namesOf(list.get());
  return result;
}

int Device::ask() {
  CameraStorageInformation* storages = nullptr;
  int count = 0;
  const int result = note(gp_camera_get_storageinfo(_camera, &storages, &count, _context.fresh()));
  std::free(storages);
  return result;
}

void Device::space(std::optional<uint64_t>& pictures, std::optional<uint64_t>& bytes) {
  CameraStorageInformation* raw = nullptr;
  int count = 0;
  if (note(gp_camera_get_storageinfo(_camera, &raw, &count, _context.fresh())) != GP_OK) return;
  const std::unique_ptr<CameraStorageInformation, FreeWith<std::free>> storages(raw);
  for (int i = 0; i < count; ++i) {
    // Cameras that do not know say all ones.
    if ((raw[i].fields & GP_STORAGEINFO_FREESPACEIMAGES) != 0 && raw[i].freeimages < UINT32_MAX)
      pictures = pictures.value_or(0) + raw[i].freeimages;
    if ((raw[i].fields & GP_STORAGEINFO_FREESPACEKBYTES) != 0) bytes = bytes.value_or(0) + raw[i].freekbytes * 1024;
  }
}

std::vector<std::string> Device::names() {
  const List list = makeList();
  if (!list || note(gp_camera_list_config(_camera, list.get(), _context.fresh())) != GP_OK) return {};
  return namesOf(list.get());
}

std::optional<std::string> Device::value(const std::string& name) {
  CameraWidget* raw = nullptr;
  if (note(gp_camera_get_single_config(_camera, name.c_str(), &raw, _context.fresh())) != GP_OK) return std::nullopt;
  const Widget widget(raw);
  return textOf(raw);
}

std::vector<std::string> Device::choices(const std::string& name) {
  CameraWidget* raw = nullptr;
  if (note(gp_camera_get_single_config(_camera, name.c_str(), &raw, _context.fresh())) != GP_OK) return {};
  const Widget widget(raw);
  std::vector<std::string> found;
  for (int i = 0; i < gp_widget_count_choices(raw); ++i)
    if (const char* choice = nullptr; gp_widget_get_choice(raw, i, &choice) == GP_OK) found.emplace_back(choice);
  return found;
}

int Device::set(const std::string& name, const std::string& value) {
  CameraWidget* raw = nullptr;
  if (const int result = gp_camera_get_single_config(_camera, name.c_str(), &raw, _context.fresh()); result != GP_OK)
    return result;
  const Widget widget(raw);
  if (const int result = gp_widget_set_value(raw, value.c_str()); result != GP_OK) return result;
  return note(gp_camera_set_single_config(_camera, name.c_str(), raw, _context.fresh()));
}

std::string Device::summary(const std::string& key) {
  CameraText text{};
  if (gp_camera_get_summary(_camera, &text, _context.fresh()) != GP_OK) return {};
  const std::string all(text.text);
  const size_t at = all.find(key + ": ");
  if (at == std::string::npos) return {};
  const size_t from = at + key.size() + 2;
  std::string found = all.substr(from, all.find('\n', from) - from);
  while (!found.empty() && (found.back() == ' ' || found.back() == '\r')) found.pop_back();
  return found;
}

}  // namespace gphoto2camera
