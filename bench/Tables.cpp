#include "Tables.h"

#include <vector>

void Tables::set(const std::string& key, double number) {
  ours.Set(key.c_str(), new KtLuaTENumber(number));
  theirs[key] = number;
}

void Tables::set(const std::string& key, const std::string& text) {
  ours.Set(key.c_str(), new KtLuaTEString(text));
  theirs[key] = text;
}

std::unique_ptr<Tables> settings() {
  auto tables = std::make_unique<Tables>();
  tables->set("isoSpeed", "ISO 400");
  tables->set("batteryLevel", 85);
  tables->set("availableShots", 1234);
  tables->set("aeMode", "Manual");
  tables->set("aperture", "f/5.6");
  tables->set("shutter", "1/125");
  tables->set("whiteBalance", "Auto");
  return tables;
}

std::unique_ptr<Tables> manyKeys(int count) {
  auto tables = std::make_unique<Tables>();
  for (int index = 0; index < count; ++index) {
    const std::string key = "key number " + std::to_string(index);
    if (index % 10 == 0) {
      Tables inner;
      for (int number = 0; number < 5; ++number) inner.set("inner " + std::to_string(number), number + 0.1);
      tables->ours.Set(key.c_str(), inner.ours.copy());
      tables->theirs[key] = inner.theirs;
    } else if (index % 2 == 0) {
      tables->set(key, index + 0.1);
    } else {
      tables->set(key, "value number " + std::to_string(index));
    }
  }
  return tables;
}

msgpack::object_handle packable(const Tables& tables) {
  const auto bytes = nlohmann::json::to_msgpack(tables.theirs);
  return msgpack::unpack(reinterpret_cast<const char*>(bytes.data()), bytes.size());
}

std::string packedMessage(const std::string& name, const Tables* tables) {
  const auto bytes = nlohmann::json::to_msgpack({0, name, tables == nullptr ? nlohmann::json() : tables->theirs});
  return {bytes.begin(), bytes.end()};
}
