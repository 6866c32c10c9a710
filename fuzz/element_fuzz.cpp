// Any bytes through the element decoder: what decodes can be written and read again, and what does not says how much is
// missing at the least.
#include <memory>
#include <string>

#include "Input.h"
#include "KtLuaTableMarshalling.h"
#include "KtNSDataStreamBuf.h"

using testkit::check;
using Element = std::unique_ptr<KtLuaTE>;

namespace {

struct Decoded {
  enum { element, unknownTag, incomplete, malformed } kind;
  Element value;
  std::int64_t consumed = 0;
  std::int64_t missing = 0;
};

Decoded decode(const char* bytes, std::size_t count) {
  KtNSDataReadStreamBuf buffer(std::make_shared<platform::Data>(std::vector<char>(bytes, bytes + count)));
  std::istream in(&buffer);
  try {
    Element value(KtLuaTE::createFromStream(in));
    const std::int64_t consumed = in.tellg();
    const auto kind = value ? Decoded::element : Decoded::unknownTag;
    return {kind, std::move(value), consumed, 0};
  } catch (const KtStreamError& error) {
    return {Decoded::incomplete, nullptr, 0, error.missing()};
  } catch (const platform::Exception&) {
    return {Decoded::malformed, nullptr, 0, 0};
  }
}

std::string encode(const KtLuaTE& element) {
  KtNSDataWriteStreamBuf buffer;
  std::ostream out(&buffer);
  element.writeToStream(out);
  check(out.good(), "writing never fails");
  return {buffer.getNSData()->bytes(), buffer.getNSData()->length()};
}

// Data and tables as keys stand in order of their addresses, which differ between two objects of one content.
bool hasAddressKeys(const KtLuaTE& element) {
  const auto* const table = dynamic_cast<const KtLuaTETable*>(&element);
  if (table == nullptr) return false;
  for (const auto& [key, value] : table->getEntries()) {
    check(key != nullptr && value != nullptr, "a table holds no null");
    const bool byAddress = key->getType() == kKtLuaTypeData || key->getType() == kKtLuaTypeTable;
    if (byAddress || hasAddressKeys(*value)) return true;
  }
  return false;
}

void checkSame(const std::string& one, const std::string& other, bool byAddress) {
  check(one.size() == other.size(), "the same element has the same size");
  check(byAddress || one == other, "the same element has the same bytes");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t count) {
  const auto* const text = reinterpret_cast<const char*>(bytes);
  const Decoded first = decode(text, count);
  if (first.kind == Decoded::incomplete) check(first.missing > 0, "what is incomplete misses something");
  if (first.kind == Decoded::unknownTag) check(first.consumed == 4, "an unknown tag is all that is read");
  if (first.kind != Decoded::element) return 0;

  const bool byAddress = hasAddressKeys(*first.value);
  const std::string written = encode(*first.value);
  const Decoded second = decode(written.data(), written.size());
  check(second.kind == Decoded::element, "what was written can be read");
  check(second.consumed == static_cast<std::int64_t>(written.size()), "what was written is read to its end");
  checkSame(written, encode(*second.value), byAddress);
  const Element copy(first.value->copy());
  checkSame(written, encode(*copy), byAddress);

  // Every beginning is incomplete, and says no more than the truth of what is missing.
  const std::int64_t part = bytes[count - 1] * first.consumed / 256;
  const Decoded beginning = decode(text, static_cast<std::size_t>(part));
  check(beginning.kind == Decoded::incomplete, "the beginning of an element is incomplete");
  check(beginning.missing > 0 && beginning.missing <= first.consumed - part, "no more is missing than there is");
  return 0;
}
