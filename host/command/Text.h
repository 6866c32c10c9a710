// Values in words and in JSON.
#pragma once

#include <chrono>
#include <cstdint>
#include <nlohmann/json.hpp>
#include <string>

#include "Messages.h"

namespace tether::command {

using Json = nlohmann::ordered_json;

// "12.3 MB", "1.2 s", "f/2.8": for people.
std::string sizeText(std::int64_t bytes);
std::string secondsText(std::chrono::duration<double> time);
std::string numberText(double number);
std::string settingText(const SettingValue& value);
Json settingJson(const SettingValue& value);

// A payload as JSON. Keys that are no strings are written as text; data becomes {"data": hexadecimal}.
Json payloadJson(KtLuaTE& payload);

// An object of one event, with the present time.
Json eventJson(const char* name);
// Adds a path to an object. One that is not UTF-8 is exact under the key with "_bytes" behind it only: every byte but
// letters, digits and -._~/ as % and two hexadecimal digits.
void addPath(Json& object, const std::string& key, const std::string& path);

// "1 picture", "2 pictures".
std::string countText(std::size_t count, const std::string& noun);

// Text from outside, safe to print in one line on a terminal: control characters become "?".
std::string printable(std::string text);

}  // namespace tether::command
