// What crosses the pipes: messages as they are, and the helper's own as typed events.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "FrameWriter.h"
#include "KtRCMessageAccumulator.h"
#include "MessageNames.h"

namespace tether {

// One message. The payload is shared, read-only by agreement, and never null.
struct Message {
  std::int32_t id = 0;
  std::string name;
  std::shared_ptr<KtLuaTE> payload;
};

// The names of the settings, in the order in which Settings holds their values.
inline constexpr std::array<const char*, 7> kSettingNames = {
    kKeyIsoSpeed, kKeyBatteryLevel, kKeyAvailableShots, kKeyAeMode, kKeyAperture, kKeyShutter, kKeyWhiteBalance};
// Nothing where the camera does not tell.
using SettingValue = std::variant<std::monostate, double, std::string>;
using Settings = std::array<SettingValue, kSettingNames.size()>;

struct DeviceAdded {
  std::int32_t device_id = 0;
  std::string name;
};
struct DeviceRemoved {
  std::int32_t device_id = 0;
};
struct SettingsChanged {
  Settings settings;
};
// A picture has begun to arrive.
struct ObjectWasAdded {
  std::int32_t capture_id = 0;
  bool has_sidecar = false;  // one of the two files of a RAW and JPEG pair
  std::string file_name;     // as announced: a bare name in good faith, to be taken for text all the same
  std::int64_t file_size = 0;
};
struct FileDownloadComplete {
  std::int32_t capture_id = 0;
  std::string file_path;
};
struct Heartbeat {};
// A message of another name, replies that nobody waits for any more among them.
struct OtherMessage {
  std::string name;
  std::int32_t id = 0;
};
// A line that the helper wrote to its standard error, without the stamp of its log.
struct LogLine {
  std::string text;
};
// The helper is of no more use; its process has been ended.
struct HelperLost {
  enum class How {
    kEnded,       // its process is gone, or has closed its output
    kSilent,      // nothing came from it for too long
    kNotReading,  // it does not take what is sent to it
  };
  How how = How::kEnded;
  int status = 0;           // as waitpid() gives it
  std::string description;  // for people
};

using Event = std::variant<DeviceAdded, DeviceRemoved, SettingsChanged, ObjectWasAdded, FileDownloadComplete, Heartbeat,
                           OtherMessage, LogLine, HelperLost>;

// How much memory a message takes, about.
std::size_t memoryOf(const Message& message);

Message messageFrom(std::unique_ptr<CRCMessage> received);
// Never fails: what a payload lacks is 0 or "".
Event eventFrom(const Message& message);
Settings settingsFrom(const KtLuaTE& payload);

// The value under a key of a table; 0 or "" where there is none of that kind. A number outside 32 bits gives 0.
std::int32_t integerIn(const KtLuaTE& payload, const char* key);
std::string textIn(const KtLuaTE& payload, const char* key);

// The table { "device_id" = device }.
std::unique_ptr<KtLuaTETable> devicePayload(std::int32_t device);

}  // namespace tether
