#include "OwnPicture.h"

#include <csetjmp>
#include <cstdio>
#include <cstdlib>
#include <new>

#include <jpeglib.h>

#include "Font.h"

namespace virtualcamera {
namespace {

constexpr int kWidth = 960;
constexpr int kHeight = 640;
constexpr int kMargin = 40;
constexpr int kQuality = 85;

class Image {
 public:
  explicit Image(uint32_t number) : _rgb(size_t{kWidth} * kHeight * 3) {
    for (int y = 0; y < kHeight; ++y)
      for (int x = 0; x < kWidth; ++x)
        set(x, y, static_cast<uint8_t>(40 + x * 100 / kWidth), static_cast<uint8_t>(50 + y * 90 / kHeight),
            static_cast<uint8_t>(80 + number * 37 % 100));
  }

  // Dots beyond the right edge are cut.
  void write(int x, int y, int scale, const std::string& text) {
    for (const char character : text) {
      const Glyph& columns = glyph(character);
      for (int column = 0; column < kGlyphWidth; ++column)
        for (int row = 0; row < kGlyphHeight; ++row)
          if (columns[static_cast<size_t>(column)] >> row & 1) dot(x + column * scale, y + row * scale, scale);
      x += (kGlyphWidth + 1) * scale;
    }
  }

  uint8_t* row(int y) { return _rgb.data() + size_t{kWidth} * 3 * static_cast<size_t>(y); }

 private:
  void set(int x, int y, uint8_t red, uint8_t green, uint8_t blue) {
    uint8_t* dot = row(y) + x * 3;
    dot[0] = red;
    dot[1] = green;
    dot[2] = blue;
  }
  void dot(int left, int top, int size) {
    for (int y = top; y < top + size && y < kHeight; ++y)
      for (int x = left; x < left + size && x < kWidth; ++x) set(x, y, 255, 255, 255);
  }

  std::vector<uint8_t> _rgb;
};

// What the encoder leaves, also when it gives up in the middle.
struct Encoded {
  unsigned char* bytes = nullptr;
  unsigned long size = 0;
  ~Encoded() { std::free(bytes); }
};

struct ErrorExit {
  jpeg_error_mgr manager;
  std::jmp_buf back;
};

// Jumped out of on errors: nothing in here may need a destructor.
bool encode(Image& image, Encoded& encoded) {
  jpeg_compress_struct encoder{};
  ErrorExit errors{};
  encoder.err = jpeg_std_error(&errors.manager);
  encoder.client_data = &errors;
  errors.manager.error_exit = [](j_common_ptr info) {
    std::longjmp(static_cast<ErrorExit*>(info->client_data)->back, 1);
  };
  if (setjmp(errors.back) != 0) {
    jpeg_destroy_compress(&encoder);
    return false;
  }
  jpeg_create_compress(&encoder);
  jpeg_mem_dest(&encoder, &encoded.bytes, &encoded.size);
  encoder.image_width = kWidth;
  encoder.image_height = kHeight;
  encoder.input_components = 3;
  encoder.in_color_space = JCS_RGB;
  jpeg_set_defaults(&encoder);
  jpeg_set_quality(&encoder, kQuality, TRUE);
  jpeg_start_compress(&encoder, TRUE);
  while (encoder.next_scanline < encoder.image_height) {
    JSAMPROW row = image.row(static_cast<int>(encoder.next_scanline));
    jpeg_write_scanlines(&encoder, &row, 1);
  }
  jpeg_finish_compress(&encoder);
  jpeg_destroy_compress(&encoder);
  return true;
}

std::string timeText(std::time_t time) {
  std::tm parts{};
  localtime_r(&time, &parts);
  char text[32];
  return {text, std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", &parts)};
}

// A TIFF as it is written here: header, one directory, the plane.
class TiffWriter {
 public:
  void put16(uint32_t value) {
    bytes.push_back(static_cast<uint8_t>(value));
    bytes.push_back(static_cast<uint8_t>(value >> 8));
  }
  void put32(uint32_t value) {
    put16(value & 0xffff);
    put16(value >> 16);
  }
  void entry(uint32_t tag, uint32_t value) {
    put16(tag);
    put16(4);  // LONG
    put32(1);
    put32(value);
  }

  std::vector<uint8_t> bytes;
};

constexpr uint32_t kRawWidth = 640;
constexpr uint32_t kRawHeight = 426;
constexpr uint32_t kRawBytes = kRawWidth * kRawHeight * 2;

}  // namespace

std::vector<uint8_t> ownJpeg(uint32_t number, const std::string& name, std::time_t time) {
  char digits[16];
  std::snprintf(digits, sizeof digits, "%04u", number);
  Image image(number);
  image.write(kMargin, 60, 32, digits);
  image.write(kMargin, 380, 8, name);
  image.write(kMargin, 500, 6, timeText(time));
  Encoded encoded;
  if (!encode(image, encoded)) throw std::bad_alloc();
  return {encoded.bytes, encoded.bytes + encoded.size};
}

std::vector<uint8_t> ownRaw(uint32_t number) {
  static constexpr uint32_t kEntries = 9;
  static constexpr uint32_t kDataOffset = 8 + 2 + kEntries * 12 + 4;
  TiffWriter tiff;
  tiff.bytes.reserve(kDataOffset + kRawBytes);
  tiff.bytes = {'I', 'I', 42, 0, 8, 0, 0, 0};
  tiff.put16(kEntries);
  tiff.entry(256, kRawWidth);
  tiff.entry(257, kRawHeight);
  tiff.entry(258, 16);  // bits per sample
  tiff.entry(259, 1);   // not compressed
  tiff.entry(262, 1);   // black is zero
  tiff.entry(273, kDataOffset);
  tiff.entry(277, 1);  // samples per dot
  tiff.entry(278, kRawHeight);
  tiff.entry(279, kRawBytes);
  tiff.put32(0);  // no other directory
  uint32_t noise = number * 2654435761u + 1;
  for (uint32_t i = 0; i < kRawWidth * kRawHeight; ++i) {
    noise = noise * 1664525u + 1013904223u;
    tiff.put16(512 + i % kRawWidth * 20 + (noise >> 24));
  }
  return std::move(tiff.bytes);
}

Shot ownShot(uint32_t number, const std::string& name, bool pair) {
  Shot shot;
  if (pair) shot.push_back(Picture::raw(ownRaw(number)));
  shot.push_back(Picture::jpeg(ownJpeg(number, name, std::time(nullptr))));
  return shot;
}

}  // namespace virtualcamera
