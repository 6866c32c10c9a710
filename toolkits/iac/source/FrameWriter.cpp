#include "FrameWriter.h"

namespace {

constexpr std::size_t kFrameToKeep = 64 * 1024;  // the memory of a longer one is given back with the next

std::string stringOf(const platform::Data& data) { return {data.bytes(), data.length()}; }

}  // namespace

platform::MutableData& FrameWriter::startAnew() {
  platform::MutableData& bytes = _encoding.bytes();
  if (bytes.capacity() > kFrameToKeep) bytes.release();
  bytes.clear();
  return bytes;
}

const platform::Data& FrameWriter::luaTableElementToNSData(const KtLuaTE* element) {
  const platform::Data& bytes = startAnew();
  element->writeToStream(_stream);
  return bytes;
}

const platform::Data& FrameWriter::frame(std::int32_t id, const KtLuaTE& name, const KtLuaTE* payload) {
  platform::MutableData& bytes = startAnew();
  std::int32_t length = 0;
  bytes.append(reinterpret_cast<const char*>(&length), sizeof length);
  bytes.append(reinterpret_cast<const char*>(&id), sizeof id);
  name.writeToStream(_stream);
  if (payload != nullptr) {
    payload->writeToStream(_stream);
  } else {
    KtLuaTENil().writeToStream(_stream);
  }
  length = static_cast<std::int32_t>(bytes.length() - sizeof length);
  bytes.replace(0, reinterpret_cast<const char*>(&length), sizeof length);
  return bytes;
}

std::string encodeFrame(std::int32_t id, std::string_view name, const KtLuaTE* payload) {
  FrameWriter writer;
  return stringOf(writer.frame(id, KtLuaTEString(std::string(name)), payload));
}

std::string encodeElement(const KtLuaTE& element) {
  FrameWriter writer;
  return stringOf(writer.luaTableElementToNSData(&element));
}
