// Puts messages into the frames that KtRCMessageAccumulator.h describes, and elements into their bytes.
#pragma once

#include <cstdint>
#include <ostream>
#include <string>
#include <string_view>

#include "Data.h"
#include "KtLuaTableMarshalling.h"
#include "KtNSDataStreamBuf.h"

// Keeps its memory and its stream for the next message: making them costs more than encoding most. One thread at a
// time.
class FrameWriter {
 public:
  FrameWriter() = default;
  FrameWriter(const FrameWriter&) = delete;
  FrameWriter& operator=(const FrameWriter&) = delete;

  // One frame, valid until the next call. Without a payload it carries a nil.
  const platform::Data& frame(std::int32_t id, const KtLuaTE& name, const KtLuaTE* payload);
  // The element's encoding, valid until the next call.
  const platform::Data& luaTableElementToNSData(const KtLuaTE* element);

 private:
  platform::MutableData& startAnew();

  KtNSDataWriteStreamBuf _encoding;
  std::ostream _stream{&_encoding};
};

// The same in a string of its own, for who sends now and then.
std::string encodeFrame(std::int32_t id, std::string_view name, const KtLuaTE* payload);
std::string encodeElement(const KtLuaTE& element);
