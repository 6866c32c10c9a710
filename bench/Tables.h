// The values that are encoded and decoded: the same ones as ours and as the peers hold them.
#pragma once

#include <memory>
#include <msgpack.hpp>
#include <nlohmann/json.hpp>
#include <string>

#include "KtLuaTableMarshalling.h"

struct Tables {
  KtLuaTETable ours;
  nlohmann::json theirs = nlohmann::json::object();

  void set(const std::string& key, double number);
  void set(const std::string& key, const std::string& text);
};

// What a camera tells of itself.
std::unique_ptr<Tables> settings();
// Every tenth value is a table of five; the others are numbers and strings in turn.
std::unique_ptr<Tables> manyKeys(int count);

// As MessagePack.
msgpack::object_handle packable(const Tables& tables);
// An id, a name, and a table or a nil, as an array.
std::string packedMessage(const std::string& name, const Tables* tables);
