#include "Messages.h"

#include <cmath>

namespace tether {
namespace {

KtLuaTE* valueIn(const KtLuaTE& payload, const char* key) {
  const auto* const table = dynamic_cast<const KtLuaTETable*>(&payload);
  return table == nullptr ? nullptr : table->elementForKey(key);
}

double numberIn(const KtLuaTE& payload, const char* key) {
  KtLuaTE* const value = valueIn(payload, key);
  return value == nullptr ? 0.0 : static_cast<double>(*value);
}

template <class Integer>
Integer truncated(double value, double largest) {
  return std::abs(value) <= largest ? static_cast<Integer>(value) : Integer{0};  // a NaN compares false
}

SettingValue settingFrom(KtLuaTE* value) {
  if (value == nullptr) return {};
  if (value->getType() == kKtLuaTypeNumber) return static_cast<double>(*value);
  if (value->getType() == kKtLuaTypeString) return static_cast<std::string>(*value);
  return {};
}

// What the system adds to each piece of memory, and a table to each of its entries.
constexpr std::size_t kMemoryPiece = 16;
constexpr std::size_t kTableEntry = 48 + kMemoryPiece;

std::size_t memoryOf(const KtLuaTE& element) {
  const std::size_t memory = sizeof(KtLuaTEString) + kMemoryPiece;
  if (element.getType() == kKtLuaTypeString) return memory + static_cast<std::string>(element).size();
  if (const auto* const data = dynamic_cast<const KtLuaTEData*>(&element)) {
    return memory + static_cast<std::size_t>(data->getLength());
  }
  const auto* const table = dynamic_cast<const KtLuaTETable*>(&element);
  if (table == nullptr) return memory;
  std::size_t sum = memory;
  for (const auto& [key, value] : table->getEntries()) sum += kTableEntry + memoryOf(*key) + memoryOf(*value);
  return sum;
}

}  // namespace

std::size_t memoryOf(const Message& message) {
  return sizeof message + message.name.size() + 3 * kMemoryPiece + memoryOf(*message.payload);
}

Message messageFrom(std::unique_ptr<CRCMessage> received) {
  Message message;
  message.id = received->id;
  if (received->name) message.name = static_cast<std::string>(*received->name);
  message.payload = std::move(received->data);
  if (!message.payload) message.payload = std::make_shared<KtLuaTENil>();
  return message;
}

std::int32_t integerIn(const KtLuaTE& payload, const char* key) {
  return truncated<std::int32_t>(numberIn(payload, key), INT32_MAX);
}

std::string textIn(const KtLuaTE& payload, const char* key) {
  KtLuaTE* const value = valueIn(payload, key);
  return value == nullptr ? std::string() : static_cast<std::string>(*value);
}

Settings settingsFrom(const KtLuaTE& payload) {
  Settings settings;
  for (std::size_t i = 0; i < settings.size(); ++i) settings[i] = settingFrom(valueIn(payload, kSettingNames[i]));
  return settings;
}

Event eventFrom(const Message& message) {
  const KtLuaTE& payload = *message.payload;
  if (message.id != 0) return OtherMessage{message.name, message.id};
  if (message.name == kMessageHeartbeat) return Heartbeat{};
  if (message.name == kMessageDeviceAdded)
    return DeviceAdded{integerIn(payload, kKeyDeviceId), textIn(payload, kKeyName)};
  if (message.name == kMessageDeviceRemoved) return DeviceRemoved{integerIn(payload, kKeyDeviceId)};
  if (message.name == kMessageCameraSettingsChanged) return SettingsChanged{settingsFrom(payload)};
  if (message.name == kMessageObjectWasAdded) {
    constexpr double kLargestExact = 9007199254740992.0;  // 2 to the 53rd
    auto size = truncated<std::int64_t>(numberIn(payload, kKeyFileSize), kLargestExact);
    // A helper counts in 32 bits, and does not know that none of them is a sign.
    if (size < 0 && size >= INT32_MIN) size += std::int64_t{1} << 32;
    return ObjectWasAdded{integerIn(payload, kKeyCaptureId), integerIn(payload, kKeyHasSidecar) != 0,
                          textIn(payload, kKeyFileName), size};
  }
  if (message.name == kMessageFileDownloadComplete) {
    return FileDownloadComplete{integerIn(payload, kKeyCaptureId), textIn(payload, kKeyFilePath)};
  }
  return OtherMessage{message.name, 0};
}

std::unique_ptr<KtLuaTETable> devicePayload(std::int32_t device) {
  auto table = std::make_unique<KtLuaTETable>();
  table->Set(kKeyDeviceId, new KtLuaTENumber(device));
  return table;
}

}  // namespace tether
