// The byte encoding of elements: a 32-bit tag, then the body of the kind. Everything is little-endian.

#include <algorithm>
#include <bit>
#include <cmath>
#include <cstring>
#include <memory>
#include <string_view>
#include <typeinfo>
#include <utility>

#include "KtLuaTableMarshalling.h"
#include "KtNSDataStreamBuf.h"

static_assert(std::endian::native == std::endian::little, "fields are copied as they lie in memory");

namespace {

// The least that an element takes: its tag.
constexpr std::int64_t kSmallestElement = 4;
constexpr std::int64_t kSmallestEntry = 2 * kSmallestElement;
constexpr std::int64_t kPiece = 64 * 1024;  // of a stream that does not tell how much it has

void writeThrough(std::streambuf& buffer, std::ostream& out, std::string_view bytes) {
  const auto count = static_cast<std::streamsize>(bytes.size());
  if (buffer.sputn(bytes.data(), count) != count) out.setstate(std::ios_base::badbit);
}

template <typename... Fields>
void put(char* end, Fields... fields) {
  ((std::memcpy(end, &fields, sizeof fields), end += sizeof fields), ...);
}

// Every byte of an element passes through here: fields that follow each other, and the block behind them. Past the
// stream, as with reading, straight into a growable buffer where there is one.
template <typename... Fields>
void write(std::ostream& out, std::string_view block, Fields... fields) {
  constexpr std::size_t kFields = (sizeof fields + ...);
  std::streambuf* const buffer = out.rdbuf();
  if (typeid(*buffer) == typeid(KtNSDataWriteStreamBuf)) {
    char* const start = static_cast<KtNSDataWriteStreamBuf*>(buffer)->extend(kFields + block.size());
    put(start, fields...);
    if (!block.empty()) std::memcpy(start + kFields, block.data(), block.size());
  } else {
    char copy[kFields];
    put(copy, fields...);
    writeThrough(*buffer, out, {copy, kFields});
    writeThrough(*buffer, out, block);
  }
}

}  // namespace

// Reading.

// Decodes one element, with all that is in it.
class KtElementReader {
 public:
  explicit KtElementReader(std::istream& in) : _in(in) {
    std::streambuf* const buffer = in.rdbuf();
    if (in.good() && typeid(*buffer) == typeid(KtNSDataReadStreamBuf)) {
      _block = static_cast<KtNSDataReadStreamBuf*>(buffer);
    }
  }

  template <typename Field>
  Field field() {
    Field field{};
    std::memcpy(&field, take(sizeof field), sizeof field);
    return field;
  }

  std::string text() {
    const auto announced = field<std::int32_t>();
    if (announced < 1) return {};
    checkLength(announced, "string");
    const char* const bytes = take(announced);
    return {bytes, strnlen(bytes, static_cast<std::size_t>(announced))};
  }

  // Valid until the next read.
  std::string_view block() {
    const auto announced = field<std::int32_t>();
    if (announced < 0) throw KtMalformedElement("negative data length");
    checkLength(announced, "data");
    return {take(announced), static_cast<std::size_t>(announced)};
  }

  void fill(KtLuaTETable& table) {
    if (_depth >= kKtLuaDeepestNesting) throw KtMalformedElement("tables nested deeper than 200");
    ++_depth;
    const auto count = field<std::int32_t>();
    checkLength(count * kSmallestEntry, "table");
    std::int32_t index = 0;
    bool hasKey = false;
    try {
      for (; index < count; ++index) {
        hasKey = false;
        std::unique_ptr<KtLuaTE> key = readKey();
        hasKey = true;
        std::unique_ptr<KtLuaTE> value = readValue();
        // Encoded tables arrive in order. A key that comes again keeps its first object and takes the later value.
        const auto place = table.entries.emplace_hint(table.entries.end(), key.get(), value.get());
        if (place->first != key.get()) {
          delete std::exchange(place->second, value.release());
        } else {
          static_cast<void>(key.release());
          static_cast<void>(value.release());
        }
      }
    } catch (KtStreamError& error) {
      // What this table still needs behind the element that ran out.
      error.add((count - index - 1) * kSmallestEntry + (hasKey ? 0 : kSmallestElement));
      throw;
    }
    --_depth;
  }

  // Null for an unknown tag.
  std::unique_ptr<KtLuaTE> element() {
    switch (field<std::int32_t>()) {
      case kKtLuaTypeNil:
        return std::make_unique<KtLuaTENil>();
      case kKtLuaTypeNumber:
        return std::make_unique<KtLuaTENumber>(field<double>());
      case kKtLuaTypeString:
        return std::make_unique<KtLuaTEString>(text());
      case kKtLuaTypeData:
        return std::make_unique<KtLuaTEData>(block());
      case kKtLuaTypeTable: {
        auto table = std::make_unique<KtLuaTETable>();
        fill(*table);
        return table;
      }
      default:
        return nullptr;
    }
  }

 private:
  std::unique_ptr<KtLuaTE> readKey() {
    auto key = element();
    if (!key) throw KtMalformedElement("unknown tag of a table key");
    if (key->getType() == kKtLuaTypeNumber && std::isnan(static_cast<double>(*key))) {
      throw KtMalformedElement("a table key is not a number");
    }
    return key;
  }

  std::unique_ptr<KtLuaTE> readValue() {
    auto value = element();
    if (!value) throw KtMalformedElement("unknown tag of a table value");
    return value;
  }

  static void checkLength(std::int64_t length, const char* what) {
    if (length > kKtLuaLargestElement) throw KtMalformedElement(std::string(what) + " longer than 64 MiB");
  }

  // Every byte of an element passes through here. Straight from the block behind the stream, where there is one: what
  // the stream and its buffer add to a read costs more than most fields. Valid until the next read.
  const char* take(std::int64_t count) {
    if (_block != nullptr && count <= _block->available()) return _block->take(count);
    return takeFromStream(count);
  }

  // A short read is a stream error that knows what was missing. Nothing is allocated for what is not there.
  const char* takeFromStream(std::int64_t count) {
    std::int64_t got = 0;
    if (_block != nullptr) {
      got = _block->available();  // too few
      _block->take(got);
    }
    for (std::int64_t piece = 1; _block == nullptr && _in.good() && got < count && piece > 0; got += piece) {
      _copy.resize(static_cast<std::size_t>(std::min(count, got + kPiece)));
      piece = _in.rdbuf()->sgetn(_copy.data() + got, static_cast<std::int64_t>(_copy.size()) - got);
    }
    if (got == count) return _copy.data();
    _in.setstate(std::ios_base::eofbit | std::ios_base::failbit);
    throw KtStreamError(std::max<std::int64_t>(count - got, 1));
  }

  std::istream& _in;
  KtNSDataReadStreamBuf* _block = nullptr;
  std::string _copy;  // of what was read last, where there is no block
  int _depth = 0;
};

KtLuaTE* KtLuaTE::createFromStream(std::istream& in) { return KtElementReader(in).element().release(); }

KtLuaTENil::KtLuaTENil(std::istream& /*in*/) : KtLuaTENil() {}

KtLuaTENumber::KtLuaTENumber(std::istream& in) : KtLuaTENumber(KtElementReader(in).field<double>()) {}

KtLuaTEString::KtLuaTEString(std::istream& in) : KtLuaTEString(KtElementReader(in).text()) {}

KtLuaTEData::KtLuaTEData(std::istream& in) : KtLuaTEData(KtElementReader(in).block()) {}

KtLuaTETable::KtLuaTETable(std::istream& in) : KtLuaTETable() { KtElementReader(in).fill(*this); }

// Writing.

void KtLuaTENil::writeToStream(std::ostream& out) const { write(out, {}, getType()); }

void KtLuaTENumber::writeToStream(std::ostream& out) const { write(out, {}, getType(), value); }

void KtLuaTEString::writeToStream(std::ostream& out) const {
  const std::string_view text(value.c_str(), std::strlen(value.c_str()) + 1);  // with its NUL
  write(out, text, getType(), static_cast<std::int32_t>(text.size()));
}

void KtLuaTEData::writeToStream(std::ostream& out) const {
  write(out, {static_cast<const char*>(bytes), static_cast<std::size_t>(length)}, getType(), length);
}

void KtLuaTETable::writeToStream(std::ostream& out) const {
  write(out, {}, getType(), static_cast<std::int32_t>(entries.size()));
  for (const auto& [key, value] : entries) {
    key->writeToStream(out);
    value->writeToStream(out);
  }
}
