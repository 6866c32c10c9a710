// The byte encoding of elements: a 32-bit tag, then the body of the kind. Everything is little-endian.

#include <algorithm>
#include <bit>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <new>
#include <typeinfo>
#include <utility>

#include "KtLuaTableMarshalling.h"
#include "KtNSDataStreamBuf.h"

static_assert(std::endian::native == std::endian::little, "fields are copied as they lie in memory");

namespace {

// The least that an element takes: its tag.
constexpr std::int64_t kSmallestElement = 4;
constexpr std::int64_t kSmallestEntry = 2 * kSmallestElement;

// How many bytes the stream still has, or a negative number where its buffer does not tell.
std::int64_t available(std::istream& in) {
  const std::streambuf* const buffer = in.rdbuf();
  // The usual type is told by one comparison; the others take a search.
  if (buffer != nullptr && typeid(*buffer) == typeid(KtNSDataReadStreamBuf)) {
    return static_cast<const KtNSDataReadStreamBuf*>(buffer)->available();
  }
  const auto* const derived = dynamic_cast<const KtNSDataReadStreamBuf*>(buffer);
  return derived == nullptr ? -1 : derived->available();
}

// Every byte of an element passes through here. A short read is a stream error that knows what was missing.
void readBytes(std::istream& in, void* destination, std::int64_t count) {
  // Past the stream to its buffer: what the stream adds to a read costs more than most fields.
  const std::int64_t got = in.good() ? in.rdbuf()->sgetn(static_cast<char*>(destination), count) : 0;
  if (got == count) return;
  in.setstate(std::ios_base::eofbit | std::ios_base::failbit);
  throw KtStreamError(std::max<std::int64_t>(count - got, 1));
}

template <typename Field>
Field readField(std::istream& in) {
  Field field{};
  readBytes(in, &field, sizeof field);
  return field;
}

void writeBytes(std::ostream& out, const void* bytes, std::streamsize count) {
  // Past the stream to its buffer, as with reading.
  if (out.rdbuf()->sputn(static_cast<const char*>(bytes), count) != count) out.setstate(std::ios_base::badbit);
}

// Fields that follow each other, in one piece.
template <typename... Fields>
void writeFields(std::ostream& out, Fields... fields) {
  char bytes[(sizeof fields + ...)];
  char* end = bytes;
  ((std::memcpy(end, &fields, sizeof fields), end += sizeof fields), ...);
  writeBytes(out, bytes, sizeof bytes);
}

// Before a block of that length is allocated: it must be possible at all, and all of it must be there.
void checkLength(std::istream& in, std::int64_t length, const char* what) {
  if (length > kKtLuaLargestElement) throw KtMalformedElement(std::string(what) + " longer than 64 MiB");
  const std::int64_t there = available(in);
  if (there >= 0 && there < length) throw KtStreamError(length - there);
}

// Counts the tables that are being decoded inside each other on this thread.
class NestingGuard {
 public:
  NestingGuard() {
    if (_depth >= kKtLuaDeepestNesting) throw KtMalformedElement("tables nested deeper than 200");
    ++_depth;
  }
  NestingGuard(const NestingGuard&) = delete;
  NestingGuard& operator=(const NestingGuard&) = delete;
  ~NestingGuard() { --_depth; }

 private:
  static thread_local int _depth;
};

thread_local int NestingGuard::_depth = 0;

std::unique_ptr<KtLuaTE> readKey(std::istream& in) {
  std::unique_ptr<KtLuaTE> key(KtLuaTE::createFromStream(in));
  if (!key) throw KtMalformedElement("unknown tag of a table key");
  if (key->getType() == kKtLuaTypeNumber && std::isnan(static_cast<double>(*key))) {
    throw KtMalformedElement("a table key is not a number");
  }
  return key;
}

std::unique_ptr<KtLuaTE> readValue(std::istream& in) {
  std::unique_ptr<KtLuaTE> value(KtLuaTE::createFromStream(in));
  if (!value) throw KtMalformedElement("unknown tag of a table value");
  return value;
}

}  // namespace

// Reading.

KtLuaTE* KtLuaTE::createFromStream(std::istream& in) {
  switch (readField<std::int32_t>(in)) {
    case kKtLuaTypeNil:
      return new KtLuaTENil(in);
    case kKtLuaTypeNumber:
      return new KtLuaTENumber(in);
    case kKtLuaTypeString:
      return new KtLuaTEString(in);
    case kKtLuaTypeData:
      return new KtLuaTEData(in);
    case kKtLuaTypeTable:
      return new KtLuaTETable(in);
    default:
      return nullptr;
  }
}

KtLuaTENil::KtLuaTENil(std::istream& /*in*/) : KtLuaTE(kKtLuaTypeNil) {}

KtLuaTENumber::KtLuaTENumber(std::istream& in) : KtLuaTE(kKtLuaTypeNumber), value(readField<double>(in)) {}

KtLuaTEString::KtLuaTEString(std::istream& in) : KtLuaTE(kKtLuaTypeString) {
  const auto announced = readField<std::int32_t>(in);
  if (announced < 1) return;
  checkLength(in, announced, "string");
  value.resize(static_cast<std::size_t>(announced));
  readBytes(in, value.data(), announced);
  value.resize(std::min(value.find('\0'), value.size()));
}

KtLuaTEData::KtLuaTEData(std::istream& in) : KtLuaTE(kKtLuaTypeData) {
  const auto announced = readField<std::int32_t>(in);
  if (announced < 0) throw KtMalformedElement("negative data length");
  checkLength(in, announced, "data");
  std::unique_ptr<void, void (*)(void*)> block(std::malloc(announced > 0 ? static_cast<std::size_t>(announced) : 1),
                                               std::free);
  if (!block) throw std::bad_alloc();
  if (announced > 0) readBytes(in, block.get(), announced);
  length = announced;
  bytes = block.release();
}

KtLuaTETable::KtLuaTETable(std::istream& in) : KtLuaTE(kKtLuaTypeTable) {
  const NestingGuard nesting;
  const auto count = readField<std::int32_t>(in);
  if (count * kSmallestEntry > kKtLuaLargestElement) throw KtMalformedElement("table longer than 64 MiB");
  std::int32_t index = 0;
  bool hasKey = false;
  try {
    for (; index < count; ++index) {
      hasKey = false;
      std::unique_ptr<KtLuaTE> key = readKey(in);
      hasKey = true;
      std::unique_ptr<KtLuaTE> value = readValue(in);
      // A key that comes again keeps its first object and takes the later value. Encoded tables arrive in order.
      const auto place = entries.empty() || ltalte()(entries.rbegin()->first, key.get())
                             ? entries.end()
                             : entries.lower_bound(key.get());
      if (place != entries.end() && !ltalte()(key.get(), place->first)) {
        delete std::exchange(place->second, value.release());
        continue;
      }
      entries.emplace_hint(place, key.get(), value.get());
      static_cast<void>(key.release());
      static_cast<void>(value.release());
    }
  } catch (KtStreamError& error) {
    // What this table still needs behind the element that ran out.
    error.add((count - index - 1) * kSmallestEntry + (hasKey ? 0 : kSmallestElement));
    destroyEntries();
    throw;
  } catch (...) {
    destroyEntries();
    throw;
  }
}

// Writing.

void KtLuaTENil::writeToStream(std::ostream& out) const { writeFields(out, getType()); }

void KtLuaTENumber::writeToStream(std::ostream& out) const { writeFields(out, getType(), value); }

void KtLuaTEString::writeToStream(std::ostream& out) const {
  const std::size_t count = std::min(value.find('\0'), value.size());
  writeFields(out, getType(), static_cast<std::int32_t>(count + 1));
  // c_str() ends in a NUL of its own, so the one behind the text is there either way.
  writeBytes(out, value.c_str(), static_cast<std::streamsize>(count + 1));
}

void KtLuaTEData::writeToStream(std::ostream& out) const {
  writeFields(out, getType(), length);
  writeBytes(out, bytes, length);
}

void KtLuaTETable::writeToStream(std::ostream& out) const {
  writeFields(out, getType(), static_cast<std::int32_t>(entries.size()));
  for (const auto& [key, value] : entries) {
    key->writeToStream(out);
    value->writeToStream(out);
  }
}
