#include "KtNSDataStreamBuf.h"

#include <algorithm>
#include <cstring>

KtNSDataWriteStreamBuf::KtNSDataWriteStreamBuf(long capacity)
    : data(std::make_shared<platform::MutableData>(static_cast<std::size_t>(std::max(capacity, 0L)))) {}

std::streamsize KtNSDataWriteStreamBuf::xsputn(const char* bytes, std::streamsize count) {
  data->append(bytes, static_cast<std::size_t>(count));
  return count;
}

KtNSDataReadStreamBuf::KtNSDataReadStreamBuf(std::shared_ptr<const platform::Data> source) {
  KtNSDataReadStreamBuf::setnsbuf(std::move(source));
}

std::streambuf* KtNSDataReadStreamBuf::setnsbuf(std::shared_ptr<const platform::Data> source) {
  data = std::move(source);
  length = static_cast<std::int64_t>(data->length());
  position = 0;
  return this;
}

std::streambuf::pos_type KtNSDataReadStreamBuf::seekoff(off_type offset, std::ios_base::seekdir direction,
                                                        std::ios_base::openmode /*mode*/) {
  std::int64_t target = position;
  if (direction == std::ios_base::beg) {
    target = offset;
  } else if (direction == std::ios_base::cur) {
    target += offset;
  } else if (direction == std::ios_base::end) {
    target = length - offset;
  }
  position = std::clamp<std::int64_t>(target, 0, length);
  return position;
}

std::streambuf::pos_type KtNSDataReadStreamBuf::seekpos(pos_type target, std::ios_base::openmode mode) {
  return seekoff(off_type(target), std::ios_base::beg, mode);
}

std::streamsize KtNSDataReadStreamBuf::xsgetn(char* destination, std::streamsize count) {
  return _Xsgetn_s(destination, static_cast<std::size_t>(count), count);
}

std::streamsize KtNSDataReadStreamBuf::_Xsgetn_s(char* destination, std::size_t size, std::streamsize count) {
  const std::int64_t from = position;
  std::int64_t copied = std::min<std::int64_t>(count, length - from);
  copied = static_cast<std::int64_t>(std::min<std::uint64_t>(static_cast<std::uint64_t>(copied), size));
  if (copied > 0) std::memcpy(destination, data->bytes() + from, static_cast<std::size_t>(copied));
  position = from + copied;
  return copied;
}
