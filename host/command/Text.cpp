#include "Text.h"

#include <array>
#include <cctype>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <ctime>

namespace tether::command {
namespace {

std::string rounded(double number, int decimals) {
  std::array<char, 64> text{};
  std::snprintf(text.data(), text.size(), "%.*f", decimals, number);
  return text.data();
}

std::string hexadecimal(const void* bytes, std::size_t count) {
  static const char* const kDigits = "0123456789abcdef";
  std::string text;
  for (std::size_t i = 0; i < count; ++i) {
    const auto byte = static_cast<const unsigned char*>(bytes)[i];
    text += kDigits[byte >> 4U];
    text += kDigits[byte & 15U];
  }
  return text;
}

bool isPlainInteger(double number) {
  constexpr double kLargestPlain = 1e15;
  return std::abs(number) < kLargestPlain && number == std::floor(number);
}

bool isUtf8(const std::string& text) {
  try {
    static_cast<void>(Json(text).dump());
    return true;
  } catch (const Json::exception&) {
    return false;
  }
}

std::string percentEncoded(const std::string& text) {
  std::string encoded;
  for (const char character : text) {
    const bool plain =
        std::strchr("-._~/", character) != nullptr || std::isalnum(static_cast<unsigned char>(character));
    encoded += plain ? std::string(1, character) : "%" + hexadecimal(&character, 1);
  }
  return encoded;
}

// In UTC, to the millisecond: 2026-01-31T23:59:59.123Z.
std::string timeText(std::chrono::system_clock::time_point time) {
  const auto sinceEpoch = std::chrono::floor<std::chrono::milliseconds>(time.time_since_epoch());
  const auto seconds = static_cast<std::time_t>(sinceEpoch.count() / 1000);
  std::tm parts{};
  gmtime_r(&seconds, &parts);
  std::array<char, 64> text{};
  const std::size_t length = std::strftime(text.data(), text.size(), "%Y-%m-%dT%H:%M:%S", &parts);
  std::snprintf(text.data() + length, text.size() - length, ".%03dZ", static_cast<int>(sinceEpoch.count() % 1000));
  return text.data();
}

Json numberJson(double number) {
  if (isPlainInteger(number)) return static_cast<std::int64_t>(number);
  return number;
}

}  // namespace

std::string sizeText(std::int64_t bytes) {
  if (bytes < 1000) return std::to_string(bytes) + " B";
  const auto amount = static_cast<double>(bytes);
  if (bytes < 1'000'000) return rounded(amount / 1e3, 1) + " kB";
  if (bytes < 1'000'000'000) return rounded(amount / 1e6, 1) + " MB";
  return rounded(amount / 1e9, 1) + " GB";
}

std::string secondsText(std::chrono::duration<double> time) { return rounded(time.count(), 1) + " s"; }

std::string numberText(double number) {
  if (isPlainInteger(number)) return rounded(number, 0);
  std::array<char, 64> text{};
  std::snprintf(text.data(), text.size(), "%.10g", number);
  return text.data();
}

std::string settingText(const SettingValue& value) {
  if (const auto* const number = std::get_if<double>(&value)) return numberText(*number);
  if (const auto* const text = std::get_if<std::string>(&value)) return *text;
  return "-";
}

Json settingJson(const SettingValue& value) {
  if (const auto* const number = std::get_if<double>(&value)) return numberJson(*number);
  if (const auto* const text = std::get_if<std::string>(&value)) return *text;
  return nullptr;
}

Json payloadJson(KtLuaTE& payload) {
  if (payload.getType() == kKtLuaTypeNumber) return numberJson(static_cast<double>(payload));
  if (payload.getType() == kKtLuaTypeString) return static_cast<std::string>(payload);
  if (const auto* const data = dynamic_cast<const KtLuaTEData*>(&payload)) {
    return {{"data", hexadecimal(data->getBytes(), static_cast<std::size_t>(data->getLength()))}};
  }
  const auto* const table = dynamic_cast<const KtLuaTETable*>(&payload);
  if (table == nullptr) return nullptr;
  Json object = Json::object();
  for (const auto& [key, value] : table->getEntries()) {
    const Json name = payloadJson(*key);
    object[name.is_string() ? name.get<std::string>() : name.dump()] = payloadJson(*value);
  }
  return object;
}

Json eventJson(const char* name) { return {{"event", name}, {"time", timeText(std::chrono::system_clock::now())}}; }

void addPath(Json& object, const std::string& key, const std::string& path) {
  object[key] = path;
  if (!isUtf8(path)) object[key + "_bytes"] = percentEncoded(path);
}

std::string countText(std::size_t count, const std::string& noun) {
  return std::to_string(count) + " " + noun + (count == 1 ? "" : "s");
}

std::string printable(std::string text) {
  for (std::size_t i = 0; i < text.size(); ++i) {
    const auto byte = static_cast<unsigned char>(text[i]);
    const bool control = byte < 0x20 || byte == 0x7f;
    // The other block of control characters, as UTF-8 writes it: c2 80 to c2 9f.
    const bool secondHalf = i > 0 && static_cast<unsigned char>(text[i - 1]) == 0xc2 && byte >= 0x80 && byte < 0xa0;
    if (secondHalf) text[i - 1] = '?';
    if (control || secondHalf) text[i] = '?';
  }
  return text;
}

}  // namespace tether::command
