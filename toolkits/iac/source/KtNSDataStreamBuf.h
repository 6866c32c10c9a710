// Two stream buffers that connect the standard streams to byte buffers. Only block reads and writes, seeks and position
// queries work: single characters see the end of the stream.
#pragma once

#include <cstdint>
#include <memory>
#include <streambuf>

#include "Data.h"

// Collects what is written. Writing never fails.
class KtNSDataWriteStreamBuf : public std::streambuf {
 public:
  KtNSDataWriteStreamBuf() : KtNSDataWriteStreamBuf(0) {}
  explicit KtNSDataWriteStreamBuf(long capacity);

  // What was written so far; it changes with later writes. A caller that needs it longer than the stream buffer lives
  // keeps a reference of its own.
  std::shared_ptr<const platform::Data> getNSData() const { return data; }
  // The same buffer, to be changed.
  platform::MutableData& bytes() { return *data; }
  // Writes that many bytes, without the stream around it; returns where they are to be put.
  char* extend(std::size_t count) { return data->extend(count); }

 protected:
  std::streamsize xsputn(const char* bytes, std::streamsize count) override;

 private:
  std::shared_ptr<platform::MutableData> data;
};

// Reads a block of bytes that does not change meanwhile, and keeps it alive.
class KtNSDataReadStreamBuf : public std::streambuf {
 public:
  explicit KtNSDataReadStreamBuf(std::shared_ptr<const platform::Data> source);

  // Bytes between the position and the end.
  std::int64_t available() const { return length - std::int64_t{position}; }
  // Reads `count` bytes, at most available(), where they lie: without the stream around it.
  const char* take(std::int64_t count) {
    const char* const from = data->bytes() + std::int64_t{position};
    position += count;
    return from;
  }

 protected:
  // The end of the data is where an offset from the end begins to count, backwards: +2 is two bytes before it.
  // Positions outside the data are moved to its nearer end. There is one position, whatever the open mode.
  pos_type seekoff(off_type offset, std::ios_base::seekdir direction, std::ios_base::openmode mode) override;
  pos_type seekpos(pos_type target, std::ios_base::openmode mode) override;
  std::streamsize xsgetn(char* destination, std::streamsize count) override;
  virtual std::streambuf* setnsbuf(std::shared_ptr<const platform::Data> source);
  // Copies up to `count` bytes, no more than the destination's `size`; returns how many.
  virtual std::streamsize _Xsgetn_s(char* destination, std::size_t size, std::streamsize count);

 private:
  std::shared_ptr<const platform::Data> data;
  std::int64_t length = 0;
  pos_type position = 0;
};
