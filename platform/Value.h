#pragma once

// The one value type for every property-list shaped thing in zerithd: session
// info, user info, payloads, storebags, profiles, records and wire messages.
//
// A Value is immutable and cheap to copy (copies share one node, as a "copy"
// of an immutable collection does). Mutation goes through the explicit
// builders `Dictionary` and `Array`, which are ordinary value-semantic
// containers; wrapping one in a Value freezes it. "nil" is the empty Value.
//
// Dictionaries keep insertion order, so enumeration order is deterministic.

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>

// Marks an accessor whose result points into `*this`: clang then reports a
// pointer or reference kept past the life of a temporary it came from
// (`for (auto& e : *parse(text).dict())`) as -Wdangling. g++ has no such check.
#if defined(__clang__)
#define ZERITH_LIFETIMEBOUND [[clang::lifetimebound]]
#else
#define ZERITH_LIFETIMEBOUND
#endif
#include <vector>

namespace zerith {

class Value;

using Data = std::vector<std::uint8_t>;

// A point in time, seconds since 1970-01-01 UTC with a fraction.
struct Date {
  double secondsSince1970 = 0;
  static Date now();
  bool operator==(const Date&) const = default;
  auto operator<=>(const Date&) const = default;
};

using Array = std::vector<Value>;

// Insertion-ordered string-keyed dictionary; the mutable builder for
// dictionary Values. Lookups scan linearly up to a small size and use a hash
// index beyond it.
class Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);
  // A copy of `other` with room for `capacity` entries, for a builder that
  // will add to the copy and knows how much.
  Dictionary(const Dictionary& other, std::size_t capacity);

  // nullptr when absent.
  const Value* find(std::string_view key) const ZERITH_LIFETIMEBOUND;
  // nil when absent.
  Value get(std::string_view key) const;
  bool contains(std::string_view key) const { return find(key) != nullptr; }

  // Replaces an existing entry in place (keeping its position) or appends.
  void set(std::string key, Value value);
  // Appends an entry whose key the caller knows is not in the dictionary
  // (a reader that tracks its keys itself), without looking for it first.
  void appendNew(std::string key, Value value);
  bool erase(std::string_view key);
  void clear();
  // Room for `count` entries without growing again (a builder that knows its
  // final size).
  void reserve(std::size_t count);

  // Defined below Value: until Value is complete, clang cannot instantiate
  // the entries' members.
  std::size_t size() const;
  bool empty() const;
  std::vector<Entry>::const_iterator begin() const;
  std::vector<Entry>::const_iterator end() const;
  const std::vector<Entry>& entries() const { return entries_; }

  bool operator==(const Dictionary& other) const;

 private:
  std::ptrdiff_t indexOf(std::string_view key) const;
  void rebuildIndex();

  std::vector<Entry> entries_;
  // Built once the dictionary outgrows a linear scan.
  std::shared_ptr<std::vector<std::pair<std::size_t, std::size_t>>> index_;  // (hash, position), sorted
};

class Value {
 public:
  enum class Type { Nil, Bool, Int, UInt, Real, String, Data, Date, Array, Dict };

  Value() = default;
  Value(std::nullptr_t) {}
  Value(bool v);
  Value(int v) : Value(static_cast<long long>(v)) {}
  Value(long v) : Value(static_cast<long long>(v)) {}
  Value(long long v);
  Value(unsigned v) : Value(static_cast<unsigned long long>(v)) {}
  Value(unsigned long v);
  Value(unsigned long long v);
  Value(double v);
  Value(const char* v);
  Value(std::string v);
  Value(std::string_view v) : Value(std::string(v)) {}
  Value(zerith::Data v);
  Value(zerith::Date v);
  Value(zerith::Array v);
  Value(zerith::Dictionary v);

  Type type() const;
  bool isNil() const { return !node_; }
  bool isBool() const { return type() == Type::Bool; }
  bool isNumber() const;  // Int, UInt or Real (a boolean is not a number)
  bool isString() const { return type() == Type::String; }
  bool isData() const { return type() == Type::Data; }
  bool isDate() const { return type() == Type::Date; }
  bool isArray() const { return type() == Type::Array; }
  bool isDict() const { return type() == Type::Dict; }

  // Typed access; nullptr when the value is of another type.
  // Clang reports a pointer kept past a temporary Value's life.
  const std::string* string() const ZERITH_LIFETIMEBOUND;
  const zerith::Data* data() const ZERITH_LIFETIMEBOUND;
  const zerith::Array* array() const ZERITH_LIFETIMEBOUND;
  const zerith::Dictionary* dict() const ZERITH_LIFETIMEBOUND;
  std::optional<zerith::Date> date() const;

  // Number conversions in the manner of a boxed number: booleans count as
  // 0/1, reals truncate, strings parse a leading integer, anything else is 0.
  std::int64_t intValue() const;
  std::uint64_t unsignedValue() const;
  double doubleValue() const;
  bool boolValue() const;

  // Convenience: the entry of a dictionary (nil when not a dictionary or
  // absent), the element of an array (nil when out of range or not an array).
  Value operator[](std::string_view key) const;
  Value at(std::size_t index) const;
  // Number of entries or elements; 0 for scalars.
  std::size_t count() const;

  // Copies of the containers, as builders for a modified copy.
  zerith::Dictionary dictCopy() const;
  zerith::Array arrayCopy() const;

  bool operator==(const Value& other) const;

  // "a dictionary", "an integer", "nil": for messages about a value of the
  // wrong kind.
  const char* kindName() const;

  // The text of a scalar as settings are read: a string as it is, a boolean
  // as "1" or "0", numbers in decimal; nullopt for anything else.
  std::optional<std::string> scalarText() const;

  // A readable one-line rendering for log messages.
  std::string description() const;

  // Identity of the shared node (two copies of one Value share it).
  const void* identity() const { return node_.get(); }

  // Bytes the allocator really handed out for this value's own blocks (its
  // node plus a string's, data's or container's buffer), as reported by
  // malloc_usable_size; children of containers are not included. 0 for nil.
  std::size_t allocationSize() const;

  // Calls `f` once with what the value holds, by const reference (bool,
  // std::int64_t, std::uint64_t, double, std::string, Data, Date, Array or
  // Dictionary), or with nullptr for nil: one inline dispatch, for walks
  // over a whole tree that would otherwise ask type() and then the typed
  // accessor of every node.
  template <typename F>
  decltype(auto) visit(F&& f) const;

 private:
  using Storage = std::variant<bool, std::int64_t, std::uint64_t, double, std::string, zerith::Data,
                               zerith::Date, zerith::Array, zerith::Dictionary>;
  // A node in one allocation: the storage beside its reference counts.
  template <typename... Args>
  static std::shared_ptr<const Storage> makeNode(Args&&... args);
  // Shared nodes of booleans and of integers in [kSharedIntegerMin, kSharedIntegerMax].
  static constexpr std::int64_t kSharedIntegerMin = -1;
  static constexpr std::int64_t kSharedIntegerMax = 255;
  static std::shared_ptr<const Storage> sharedNode(bool v);
  static std::shared_ptr<const Storage> sharedNode(std::int64_t v);
  std::shared_ptr<const Storage> node_;
};

template <typename F>
decltype(auto) Value::visit(F&& f) const {
  if (!node_) {
    return f(nullptr);
  }
  return std::visit(f, *node_);
}

inline std::size_t Dictionary::size() const { return entries_.size(); }
inline bool Dictionary::empty() const { return entries_.empty(); }
inline void Dictionary::reserve(std::size_t count) { entries_.reserve(count); }
inline std::vector<Dictionary::Entry>::const_iterator Dictionary::begin() const { return entries_.begin(); }
inline std::vector<Dictionary::Entry>::const_iterator Dictionary::end() const { return entries_.end(); }

}  // namespace zerith
