#include "KtLuaTableMarshalling.h"

#include <array>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <memory>
#include <new>
#include <utility>

#include "Log.h"

// Memory. A table takes two blocks an entry, besides the map's own: half of what decoding costs is the general
// allocator.

namespace {

#ifdef TETHER_SANITIZED
constexpr std::size_t kMostSpare = 0;  // a block that is used after its end must be seen
#else
constexpr std::size_t kMostSpare = 512;  // of each size
#endif
// Elements have at most 64 bytes; others are left to the general allocator.
constexpr std::size_t kStep = 16;
constexpr std::size_t kSizes = 4;

class SpareBlocks {
 public:
  ~SpareBlocks() {
    while (_first != nullptr) ::operator delete(std::exchange(_first, _first->next));
    _count = kMostSpare;  // elements that are destroyed later are not kept
  }
  void* take(std::size_t size) {
    if (_first == nullptr) return ::operator new(size);
    --_count;
    return std::exchange(_first, _first->next);
  }
  void give(void* memory) {
    if (_count >= kMostSpare) return ::operator delete(memory);
    ++_count;
    _first = new (memory) Block{_first};
  }

 private:
  struct Block {
    Block* next;
  };
  Block* _first = nullptr;
  std::size_t _count = 0;
};

SpareBlocks& spareBlocks(std::size_t size) {
  static thread_local std::array<SpareBlocks, kSizes> blocks;
  return blocks[(size - 1) / kStep];
}

}  // namespace

void* KtLuaTE::operator new(std::size_t size) {
  if (size > kSizes * kStep) return ::operator new(size);
  return spareBlocks(size).take((size + kStep - 1) / kStep * kStep);
}

void KtLuaTE::operator delete(void* memory, std::size_t size) noexcept {
  if (size > kSizes * kStep) return ::operator delete(memory);
  spareBlocks(size).give(memory);
}

// The base: what a kind does that does not know better.

bool KtLuaTE::operator<(const KtLuaTE& /*other*/) const { return false; }

KtLuaTE::~KtLuaTE() = default;

void KtLuaTE::writeToStream(std::ostream& /*out*/) const {}

KtLuaTE::operator std::string() const { return {}; }

KtLuaTE::operator double() { return 0.0; }

// Order. Elements of different kinds stand in order of their type codes.

bool KtLuaTENil::operator<(const KtLuaTE& other) const { return getType() < other.getType(); }

bool KtLuaTENumber::operator<(const KtLuaTE& other) const {
  if (getType() != other.getType()) return getType() < other.getType();
  return value < static_cast<const KtLuaTENumber&>(other).value;
}

bool KtLuaTEString::operator<(const KtLuaTE& other) const {
  if (getType() != other.getType()) return getType() < other.getType();
  return value.compare(static_cast<const KtLuaTEString&>(other).value) < 0;
}

bool KtLuaTEData::operator<(const KtLuaTE& other) const {
  if (getType() != other.getType()) return getType() < other.getType();
  return std::less<const void*>()(bytes, static_cast<const KtLuaTEData&>(other).bytes);
}

bool KtLuaTETable::operator<(const KtLuaTE& other) const {
  if (getType() != other.getType()) return getType() < other.getType();
  return std::less<const KtLuaTE*>()(this, &other);
}

// Copies.

KtLuaTE* KtLuaTENil::copy() { return new KtLuaTENil; }

KtLuaTE* KtLuaTENumber::copy() { return new KtLuaTENumber(value); }

KtLuaTE* KtLuaTEString::copy() { return new KtLuaTEString(value); }

KtLuaTE* KtLuaTEData::copy() { return new KtLuaTEData(bytes, length); }

KtLuaTE* KtLuaTETable::copy() {
  auto duplicate = std::make_unique<KtLuaTETable>();
  for (const auto& [key, value] : entries) {
    std::unique_ptr<KtLuaTE> newValue(value->copy());
    std::unique_ptr<KtLuaTE> newKey(key->copy());
    duplicate->Set(newKey.release(), newValue.release());
  }
  return duplicate.release();
}

// Data.

KtLuaTEData::KtLuaTEData(const void* source, std::int32_t count) : KtLuaTE(kKtLuaTypeData), length(count) {
  if (count < 0) throw -1;
  // Never an empty block: the address is what tells two data keys apart.
  bytes = std::malloc(count > 0 ? static_cast<std::size_t>(count) : 1);
  if (bytes == nullptr) throw -1;
  if (count > 0) std::memcpy(bytes, source, static_cast<std::size_t>(count));
}

KtLuaTEData::~KtLuaTEData() { std::free(bytes); }

// Tables.

KtLuaTETable::~KtLuaTETable() {
  // The map is not asked to compare any more, so its keys may go before it does.
  for (const auto& [key, value] : entries) {
    delete key;
    delete value;
  }
}

void KtLuaTETable::Set(KtLuaTE* key, KtLuaTE* value) {
  std::unique_ptr<KtLuaTE> ownedKey(key);
  std::unique_ptr<KtLuaTE> ownedValue(value);
  const auto found = entries.find(key);
  if (found != entries.end()) {
    const std::unique_ptr<KtLuaTE> oldKey(found->first);
    const std::unique_ptr<KtLuaTE> oldValue(found->second);
    entries.erase(found);
  }
  entries.emplace(key, value);
  static_cast<void>(ownedKey.release());
  static_cast<void>(ownedValue.release());
}

void KtLuaTETable::Set(const char* key, KtLuaTE* value) {
  std::unique_ptr<KtLuaTE> ownedValue(value);
  auto ownedKey = std::make_unique<KtLuaTEString>(key);
  Set(ownedKey.release(), ownedValue.release());
}

KtLuaTE* KtLuaTETable::elementForKey(KtLuaTE* key) const {
  const auto found = entries.find(key);
  return found == entries.end() ? nullptr : found->second;
}

KtLuaTE* KtLuaTETable::elementForKey(const std::string& key) const {
  KtLuaTEString element(key);
  return elementForKey(&element);
}

KtLuaTE* KtLuaTETable::elementForKey(const char* key) const { return elementForKey(std::string(key)); }

KtLuaTE* KtLuaTETable::elementForKey(int key) const {
  KtLuaTENumber element(key);
  return elementForKey(&element);
}

// Dictionary import.

namespace {

std::unique_ptr<KtLuaTE> makeElementForObject(const platform::Value& object) {
  if (const auto* truth = std::get_if<bool>(&object)) return std::make_unique<KtLuaTENumber>(*truth ? 1.0 : 0.0);
  if (const auto* number = std::get_if<long long>(&object)) {
    return std::make_unique<KtLuaTENumber>(static_cast<double>(*number));
  }
  if (const auto* number = std::get_if<double>(&object)) return std::make_unique<KtLuaTENumber>(*number);
  // A text counts up to its first NUL.
  if (const auto* text = std::get_if<std::string>(&object)) return std::make_unique<KtLuaTEString>(text->c_str());
  return nullptr;
}

std::string describe(const platform::Value& object) {
  if (const auto* truth = std::get_if<bool>(&object)) return *truth ? "1" : "0";
  if (const auto* number = std::get_if<long long>(&object)) return std::to_string(*number);
  if (const auto* number = std::get_if<double>(&object)) return std::to_string(*number);
  if (const auto* text = std::get_if<std::string>(&object)) return *text;
  return "<null>";
}

}  // namespace

void KtLuaTETable::addDictionary(const platform::Dictionary& dictionary) {
  for (const auto& [key, value] : dictionary) {
    auto keyElement = makeElementForObject(key);
    auto valueElement = makeElementForObject(value);
    if (!keyElement || !valueElement) {
      platform::log("Could not convert either key or value to an KtLuaTE element - key: %s, value: %s",
                    describe(key).c_str(), describe(value).c_str());
      platform::failAssertion("0", "addDictionary", "toolkits/iac/source/KtLuaTableMarshalling", 852);
    }
    Set(keyElement.release(), valueElement.release());
  }
}
