#include "CameraFile.h"

#include <algorithm>
#include <limits>
#include <nlohmann/json.hpp>
#include <stdexcept>

#include "Names.h"

namespace virtualcamera {
namespace {

using Json = nlohmann::json;

constexpr int kDeepest = 16;  // twice what anything here needs

[[noreturn]] void fail(const std::string& message) { throw std::runtime_error(message); }

// Numbers within a type's range; JSON's own conversion would cut them.
template <typename T>
T number(const Json& json, const std::string& what) {
  if (!json.is_number_integer()) fail(what + " is not a whole number");
  const bool tooLarge = json.is_number_unsigned() && json.get<uint64_t>() > uint64_t{std::numeric_limits<T>::max()};
  if (tooLarge || (json.is_number_integer() && !json.is_number_unsigned() &&
                   (json.get<int64_t>() < int64_t{std::numeric_limits<T>::min()})))
    fail(what + " is out of range");
  return json.get<T>();
}

// An object whose keys are all asked for: what is left over is unknown.
class Reader {
 public:
  Reader(const Json& json, std::string what) : _json(json), _what(std::move(what)) {
    if (!json.is_object()) fail(_what + " is not an object");
  }

  const Json* find(const char* key) {
    _known.emplace_back(key);
    const auto found = _json.find(key);
    return found != _json.end() ? &*found : nullptr;
  }
  void read(const char* key, bool& value) {
    const Json* json = find(key);
    if (json == nullptr) return;
    if (!json->is_boolean()) fail(label(key) + " is neither true nor false");
    value = json->get<bool>();
  }
  template <typename T>
  void read(const char* key, T& value) {
    if (const Json* json = find(key)) value = number<T>(*json, label(key));
  }
  template <typename T>
  void read(const char* key, std::optional<T>& value) {
    if (const Json* json = find(key)) value = number<T>(*json, label(key));
  }
  // A number, or a name for one.
  template <typename T>
  void read(const char* key, std::optional<T>& value, std::optional<int64_t> (*byName)(std::string_view)) {
    const Json* json = find(key);
    if (json == nullptr) return;
    if (!json->is_string()) {
      value = number<T>(*json, label(key));
    } else if (const std::optional<int64_t> named = byName(json->get<std::string>())) {
      value = static_cast<T>(*named);
    } else {
      fail(label(key) + ": unknown name \"" + json->get<std::string>() + "\"");
    }
  }
  std::string label(const std::string& key) const { return _what + " \"" + key + "\""; }
  void end() const {
    for (const auto& [key, value] : _json.items())
      if (std::find(_known.begin(), _known.end(), key) == _known.end()) fail(_what + ": unknown key \"" + key + "\"");
  }

 private:
  const Json& _json;
  std::string _what;
  std::vector<std::string> _known;
};

uint32_t capabilityFromKey(const std::string& key) {
  if (const std::optional<int64_t> known = capabilityNumber(key)) return static_cast<uint32_t>(*known);
  size_t used = 0;
  unsigned long long value = 0;
  try {
    value = std::stoull(key, &used, 0);
  } catch (const std::exception&) {
    used = 0;
  }
  if (used != key.size() || key.empty() || value > UINT32_MAX) fail("settings: unknown capability \"" + key + "\"");
  return static_cast<uint32_t>(value);
}

template <typename T>
std::vector<T> numbers(const Json& json, const std::string& what) {
  if (!json.is_array()) fail(what + " is not a list");
  std::vector<T> values;
  for (const Json& value : json) values.push_back(number<T>(value, what));
  return values;
}

std::vector<std::string> strings(const Json& json, const std::string& what) {
  if (!json.is_array()) fail(what + " is not a list");
  std::vector<std::string> values;
  for (const Json& value : json) {
    if (!value.is_string()) fail(what + " holds something else than strings");
    values.push_back(value.get<std::string>());
  }
  return values;
}

Capability listSetting(uint32_t id, const std::string& type, Reader& reader, const std::string& what) {
  static const Json kNone = Json::array();
  const Json* found = reader.find("values");
  const Json& values = found ? *found : kNone;
  uint32_t current = 0;
  reader.read("current", current);
  if (type == "integers") return Capability::integers(id, numbers<int32_t>(values, what), current);
  if (type == "unsigneds") return Capability::unsigneds(id, numbers<uint32_t>(values, what), current);
  if (type == "packedStrings") return Capability::packedStrings(id, strings(values, what), current);
  if (type == "strings") return Capability::strings(id, strings(values, what), current);
  fail(what + ": unknown type \"" + type + "\"");
}

Capability typedSetting(uint32_t id, const Json& json, const std::string& what) {
  Reader reader(json, what);
  const Json* type = reader.find("type");
  if (type == nullptr) fail(what + " has no type");
  if (!type->is_string()) {
    reader.end();
    return Capability::ofValueType(id, number<uint32_t>(*type, what));
  }
  const auto name = type->get<std::string>();
  Capability setting;
  if (name != "boolean" && name != "integer" && name != "unsigned" && name != "string") {
    setting = listSetting(id, name, reader, what);
  } else {
    const Json* value = reader.find("value");
    if (value == nullptr) fail(what + " has no value");
    if (name == "boolean") setting = Capability::boolean(id, value->get<bool>());
    if (name == "integer") setting = Capability::integer(id, number<int32_t>(*value, what));
    if (name == "unsigned") setting = Capability::unsignedInteger(id, number<uint32_t>(*value, what));
    if (name == "string") setting = Capability::string(id, value->get<std::string>());
  }
  reader.end();
  return setting;
}

template <typename T>
void select(Enumeration& list, const std::vector<T>& values, const T& wanted, const std::string& what) {
  const auto found = std::find(values.begin(), values.end(), wanted);
  if (found == values.end()) fail(what + " is not among the values");
  list.current = static_cast<uint32_t>(found - values.begin());
}

void select(Enumeration& list, const Json& json, const std::string& what) {
  if (list.numbers.empty() || json.is_string()) return select(list, list.strings, json.get<std::string>(), what);
  const uint32_t wanted = list.elementType == kNkMAIDArrayType_Integer
                              ? static_cast<uint32_t>(number<int32_t>(json, what))
                              : number<uint32_t>(json, what);
  select(list, list.numbers, wanted, what);
}

// A bare value: the setting keeps its type.
void changeSetting(Capability& setting, const Json& json, const std::string& what) {
  if (std::holds_alternative<bool>(setting.value))
    setting.value = json.get<bool>();
  else if (std::holds_alternative<int32_t>(setting.value))
    setting.value = number<int32_t>(json, what);
  else if (std::holds_alternative<uint32_t>(setting.value))
    setting.value = number<uint32_t>(json, what);
  else if (std::holds_alternative<std::string>(setting.value))
    setting.value = json.get<std::string>();
  else if (auto* list = std::get_if<Enumeration>(&setting.value))
    select(*list, json, what);
}

void readSettings(const Json& json, CameraFile& file) {
  if (!json.is_object()) fail("settings is not an object");
  for (const auto& [key, value] : json.items()) {
    const uint32_t id = capabilityFromKey(key);
    const std::string what = "settings \"" + key + "\"";
    const auto found = std::find_if(file.settings.begin(), file.settings.end(),
                                    [id](const Capability& setting) { return setting.id == id; });
    if (value.is_null()) {
      if (found != file.settings.end()) file.settings.erase(found);
      file.withoutCapabilities.push_back(id);
    } else if (value.is_object()) {
      Capability setting = typedSetting(id, value, what);
      if (found != file.settings.end())
        *found = std::move(setting);
      else
        file.settings.push_back(std::move(setting));
    } else {
      if (found == file.settings.end()) fail(what + " needs a type");
      changeSetting(*found, value, what);
    }
  }
}

void readTransfer(const Json& json, TransferOptions& options) {
  Reader reader(json, "transfer");
  reader.read("deliveryBytes", options.deliveryBytes);
  reader.read("deliveriesPerPoll", options.deliveriesPerPoll);
  reader.read("pollsPerDelivery", options.pollsPerDelivery);
  reader.read("bytesPerSecond", options.bytesPerSecond);
  reader.read("inModulePolls", options.inModulePolls);
  reader.end();
}

void readCapture(const Json& json, CaptureOptions& options) {
  Reader reader(json, "capture");
  std::optional<int32_t> answer;
  reader.read("polls", options.polls);
  reader.read("completeEvent", options.completeEvent);
  reader.read("answer", answer, resultNumber);
  reader.end();
  options.answer = answer.value_or(options.answer);
}

void readFileTypes(const Json& json, CameraFile& file) {
  if (!json.is_object()) fail("fileTypes is not an object");
  for (const auto& [key, value] : json.items()) {
    std::string extension = key;
    std::transform(extension.begin(), extension.end(), extension.begin(), [](unsigned char c) {
      return c >= 'A' && c <= 'Z' ? static_cast<char>(c + 32) : static_cast<char>(c);
    });
    if (extension.size() < 2 || extension[0] != '.') fail("fileTypes: \"" + key + "\" is not an extension");
    file.fileTypes[extension] = number<uint32_t>(value, "fileTypes \"" + key + "\"");
  }
}

void readCompletion(const Json& json, Fault& fault) {
  Reader reader(json, "completion");
  reader.read("result", fault.completionResult, resultNumber);
  reader.read("none", fault.noCompletion);
  reader.read("polls", fault.completionPolls);
  reader.read("afterClose", fault.completionAfterClose);
  reader.read("twice", fault.completionTwice);
  reader.end();
}

void readRecord(const Json& json, DeliveryFault& fault) {
  std::optional<uint32_t> dataType, fileDataType, totalLength, start, length;
  Reader reader(json, "record");
  reader.read("dataType", dataType);
  reader.read("fileDataType", fileDataType);
  reader.read("totalLength", totalLength);
  reader.read("ulStart", start);
  reader.read("ulLength", length);
  reader.end();
  fault.edit = [=](tagNkMAIDFileInfo& info) {
    info.dataType = dataType.value_or(info.dataType);
    info.fileDataType = fileDataType.value_or(info.fileDataType);
    info.totalLength = totalLength.value_or(info.totalLength);
    info.ulStart = start.value_or(info.ulStart);
    info.ulLength = length.value_or(info.ulLength);
  };
}

void readDelivery(const Json& json, DeliveryFault& fault) {
  Reader reader(json, "delivery");
  reader.read("first", fault.first);
  reader.read("count", fault.count);
  reader.read("drop", fault.drop);
  reader.read("twice", fault.twice);
  reader.read("cutTo", fault.cutTo);
  if (const Json* record = reader.find("record")) readRecord(*record, fault);
  reader.end();
}

void readEnum(const Json& json, Fault& fault) {
  std::optional<uint32_t> type, count, current;
  std::optional<int16_t> size;
  Reader reader(json, "enum");
  reader.read("elementType", type);
  reader.read("elementCount", count);
  reader.read("currentIndex", current);
  reader.read("elementSize", size);
  reader.end();
  fault.editEnum = [=](tagNkMAIDEnum& header) {
    header.elementType = type.value_or(header.elementType);
    header.elementCount = count.value_or(header.elementCount);
    header.currentIndex = current.value_or(header.currentIndex);
    header.elementSize = size.value_or(header.elementSize);
  };
}

Level level(const Json& json) {
  if (json == "module") return Level::Module;
  if (json == "camera") return Level::Camera;
  if (json == "item") return Level::Item;
  if (json == "data") return Level::Data;
  fail("faults: unknown object " + json.dump());
}

Fault readFault(const Json& json, uint32_t camera) {
  Fault fault;
  Reader reader(json, "fault");
  if (const Json* object = reader.find("object")) fault.level = level(*object);
  if (fault.level != Level::Module) fault.camera = camera;
  uint32_t delay = 0;
  reader.read("item", fault.item);
  reader.read("command", fault.command, commandNumber);
  reader.read("parameter", fault.parameter);
  reader.read("capability", fault.parameter, capabilityNumber);
  reader.read("skip", fault.skip);
  reader.read("times", fault.times);
  reader.read("delayMs", delay);
  reader.read("answer", fault.answer, resultNumber);
  reader.read("doAnyway", fault.doAnyway);
  reader.read("anyArraySize", fault.anyArraySize);
  reader.read("unterminated", fault.unterminated);
  reader.read("ownThread", fault.ownThread);
  reader.read("stopAfter", fault.stopAfter);
  if (const Json* list = reader.find("children")) {
    const std::vector<int64_t> ids = numbers<int64_t>(*list, "children");  // negative ones too
    fault.children.emplace(ids.begin(), ids.end());
  }
  if (const Json* header = reader.find("enum")) readEnum(*header, fault);
  if (const Json* completion = reader.find("completion")) readCompletion(*completion, fault);
  if (const Json* delivery = reader.find("delivery")) readDelivery(*delivery, fault.delivery);
  reader.end();
  fault.delay = std::chrono::milliseconds(delay);
  return fault;
}

}  // namespace

CameraFile parseCameraFile(const std::string& text, uint32_t camera) {
  const Json json = Json::parse(text, [](int depth, Json::parse_event_t, const Json&) {
    if (depth > kDeepest) fail("nested deeper than " + std::to_string(kDeepest) + " levels");
    return true;
  });
  CameraFile file;
  Reader reader(json, "camera.json");
  if (const Json* name = reader.find("name")) file.name = name->get<std::string>();
  reader.read("pairs", file.pairs);
  reader.read("alive", file.alive);
  if (const Json* transfer = reader.find("transfer")) readTransfer(*transfer, file.transfer);
  if (const Json* capture = reader.find("capture")) readCapture(*capture, file.capture);
  if (const Json* types = reader.find("fileTypes")) readFileTypes(*types, file);
  if (const Json* settings = reader.find("settings")) readSettings(*settings, file);
  if (const Json* faults = reader.find("faults")) {
    if (!faults->is_array()) fail("faults is not a list");
    for (const Json& fault : *faults) file.faults.push_back(readFault(fault, camera));
  }
  reader.end();
  return file;
}

}  // namespace virtualcamera
