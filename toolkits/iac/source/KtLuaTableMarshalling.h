// The values that messages carry: trees of nil, number, string, raw data and table elements, as Lua has them.
//
// An element belongs to at most one table, once, as a key or as a value; whoever holds the root of a tree owns the
// tree. A table never holds a null key or value: a missing value is a KtLuaTENil. A tree is used by one thread at a
// time.
#pragma once

#include <cstddef>
#include <cstdint>
#include <istream>
#include <map>
#include <ostream>
#include <string>
#include <string_view>
#include <utility>

#include "Dictionary.h"
#include "Exception.h"

// The kinds' numbers: the tags of the byte encoding, and the order of keys of different kinds in a table.
inline constexpr std::int32_t kKtLuaTypeNil = 1;
inline constexpr std::int32_t kKtLuaTypeNumber = 2;
inline constexpr std::int32_t kKtLuaTypeString = 3;
inline constexpr std::int32_t kKtLuaTypeData = 4;
inline constexpr std::int32_t kKtLuaTypeTable = 5;

// No element is longer than this, and so no length or count that says otherwise is believed.
inline constexpr std::int64_t kKtLuaLargestElement = std::int64_t{64} << 20;
// How deep tables may nest when they are decoded; a table in no other table is at depth 1.
inline constexpr int kKtLuaDeepestNesting = 200;

// Raised when the bytes run out inside an element. Its name and its reason are "Stream Error".
class KtStreamError : public platform::Exception {
 public:
  explicit KtStreamError(std::int64_t missing) : Exception("Stream Error", "Stream Error"), _missing(missing) {}
  // How many bytes are missing at the least before the element can be whole.
  std::int64_t missing() const { return _missing; }
  void add(std::int64_t more) { _missing += more; }

 private:
  std::int64_t _missing;
};

// Raised for bytes that can never be an element, whatever follows. The reason says why.
class KtMalformedElement : public platform::Exception {
 public:
  explicit KtMalformedElement(std::string reason) : Exception("Malformed Element", std::move(reason)) {}
};

class KtElementReader;

class KtLuaTE {
 public:
  KtLuaTE(const KtLuaTE&) = delete;
  KtLuaTE& operator=(const KtLuaTE&) = delete;

  // The order of keys: by kind; numbers by value, strings bytewise, data and tables by address. A NaN compares false.
  virtual bool operator<(const KtLuaTE& other) const;
  virtual ~KtLuaTE();
  // Writes the element's encoding. A string is written up to its first NUL. Never fails.
  virtual void writeToStream(std::ostream& out) const;
  // A string's value; "" for every other kind.
  virtual operator std::string() const;
  // A number's value; 0.0 for every other kind.
  virtual operator double();
  // The same content once more, owned by the caller. Throws the integer -1 when there is no memory for a data element.
  virtual KtLuaTE* copy() = 0;

  // Reads one element, owned by the caller; null for an unknown tag, of which only the 4 bytes are consumed. Throws
  // KtStreamError or KtMalformedElement; what was read of the element is given up then. Allocates at most what the
  // stream has bytes for.
  static KtLuaTE* createFromStream(std::istream& in);

  std::int32_t getType() const { return type; }

  // A thread keeps the memory of some elements that it destroyed for those that it makes next.
  static void* operator new(std::size_t size);
  static void operator delete(void* memory, std::size_t size) noexcept;

 protected:
  explicit KtLuaTE(std::int32_t kind) : type(kind) {}

 private:
  std::int32_t type;
};

struct ltalte {
  bool operator()(const KtLuaTE* a, const KtLuaTE* b) const { return *a < *b; }
};

// Gives a table its own memory from where its elements have theirs.
template <typename T>
struct KtLuaAllocator {
  using value_type = T;
  KtLuaAllocator() = default;
  template <typename Other>
  explicit(false) KtLuaAllocator(const KtLuaAllocator<Other>& /*other*/) {}
  T* allocate(std::size_t count) { return static_cast<T*>(KtLuaTE::operator new(count * sizeof(T))); }
  void deallocate(T* memory, std::size_t count) noexcept { KtLuaTE::operator delete(memory, count * sizeof(T)); }
  bool operator==(const KtLuaAllocator&) const = default;
};

class KtLuaTENil final : public KtLuaTE {
 public:
  KtLuaTENil() : KtLuaTE(kKtLuaTypeNil) {}
  explicit KtLuaTENil(std::istream& in);
  bool operator<(const KtLuaTE& other) const override;
  void writeToStream(std::ostream& out) const override;
  KtLuaTE* copy() override;
};

class KtLuaTENumber final : public KtLuaTE {
 public:
  explicit KtLuaTENumber(double number) : KtLuaTE(kKtLuaTypeNumber), value(number) {}
  explicit KtLuaTENumber(std::istream& in);
  bool operator<(const KtLuaTE& other) const override;
  void writeToStream(std::ostream& out) const override;
  operator double() override { return value; }
  KtLuaTE* copy() override;

 private:
  double value;
};

class KtLuaTEString final : public KtLuaTE {
 public:
  explicit KtLuaTEString(const std::string& text) : KtLuaTE(kKtLuaTypeString), value(text) {}
  explicit KtLuaTEString(std::string&& text) : KtLuaTE(kKtLuaTypeString), value(std::move(text)) {}
  explicit KtLuaTEString(const char* text) : KtLuaTE(kKtLuaTypeString), value(text) {}
  explicit KtLuaTEString(std::istream& in);
  bool operator<(const KtLuaTE& other) const override;
  void writeToStream(std::ostream& out) const override;
  operator std::string() const override { return value; }
  KtLuaTE* copy() override;

 private:
  std::string value;
};

class KtLuaTEData final : public KtLuaTE {
 public:
  // Copies the bytes. Throws the integer -1 for a negative count, and when there is no memory for them.
  KtLuaTEData(const void* source, std::int32_t count);
  explicit KtLuaTEData(std::string_view block) : KtLuaTEData(block.data(), static_cast<std::int32_t>(block.size())) {}
  explicit KtLuaTEData(std::istream& in);
  ~KtLuaTEData() override;
  bool operator<(const KtLuaTE& other) const override;
  void writeToStream(std::ostream& out) const override;
  KtLuaTE* copy() override;

  // Owned by the element; lives as long as it does.
  const void* getBytes() const { return bytes; }
  std::int32_t getLength() const { return length; }

 private:
  void* bytes = nullptr;
  std::int32_t length = 0;
};

class KtLuaTETable final : public KtLuaTE {
 public:
  using Entries = std::map<KtLuaTE*, KtLuaTE*, ltalte, KtLuaAllocator<std::pair<KtLuaTE* const, KtLuaTE*>>>;

  KtLuaTETable() : KtLuaTE(kKtLuaTypeTable) {}
  explicit KtLuaTETable(std::istream& in);
  ~KtLuaTETable() override;
  bool operator<(const KtLuaTE& other) const override;
  void writeToStream(std::ostream& out) const override;
  KtLuaTE* copy() override;

  // Stores the pair and takes both over, also when it throws. An entry with an equal key goes, its key and value with
  // it. Neither may be in a table already.
  void Set(KtLuaTE* key, KtLuaTE* value);
  void Set(const char* key, KtLuaTE* value);

  // The value under an equal key, still the table's, or null.
  KtLuaTE* elementForKey(KtLuaTE* key) const;
  KtLuaTE* elementForKey(const std::string& key) const;
  KtLuaTE* elementForKey(const char* key) const;
  KtLuaTE* elementForKey(int key) const;

  // Sets every entry of a dictionary of numbers, truth values (1 and 0) and texts. Anything else in it, as a key or as
  // a value, is logged and stops the program.
  void addDictionary(const platform::Dictionary& dictionary);

  // In order of the keys.
  const Entries& getEntries() const { return entries; }

 private:
  friend class KtElementReader;  // fills it

  Entries entries;
};
