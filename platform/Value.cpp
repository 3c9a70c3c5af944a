#include "platform/Value.h"

#include <malloc.h>

#include <algorithm>
#include <atomic>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdlib>
#include <functional>
#include <limits>

#include <fmt/format.h>

namespace zerith {

namespace {
constexpr std::size_t kIndexThreshold = 16;

std::size_t hashKey(std::string_view key) { return std::hash<std::string_view>{}(key); }
}  // namespace

Date Date::now() {
  using namespace std::chrono;
  return Date{duration<double>(system_clock::now().time_since_epoch()).count()};
}

// ---- Dictionary ------------------------------------------------------------

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  for (const auto& entry : entries) {
    set(entry.first, entry.second);
  }
}

Dictionary::Dictionary(const Dictionary& other, std::size_t capacity) : index_(other.index_) {
  entries_.reserve(std::max(capacity, other.size()));
  entries_.insert(entries_.end(), other.entries_.begin(), other.entries_.end());
}

std::ptrdiff_t Dictionary::indexOf(std::string_view key) const {
  if (!index_) {
    for (std::size_t i = 0; i < entries_.size(); ++i) {
      if (entries_[i].first == key) {
        return static_cast<std::ptrdiff_t>(i);
      }
    }
    return -1;
  }
  const std::size_t h = hashKey(key);
  auto it = std::lower_bound(index_->begin(), index_->end(), std::make_pair(h, std::size_t{0}));
  for (; it != index_->end() && it->first == h; ++it) {
    if (entries_[it->second].first == key) {
      return static_cast<std::ptrdiff_t>(it->second);
    }
  }
  return -1;
}

void Dictionary::rebuildIndex() {
  if (entries_.size() < kIndexThreshold) {
    index_.reset();
    return;
  }
  auto index = std::make_shared<std::vector<std::pair<std::size_t, std::size_t>>>();
  index->reserve(entries_.size());
  for (std::size_t i = 0; i < entries_.size(); ++i) {
    index->emplace_back(hashKey(entries_[i].first), i);
  }
  std::sort(index->begin(), index->end());
  index_ = std::move(index);
}

const Value* Dictionary::find(std::string_view key) const {
  const auto i = indexOf(key);
  return i < 0 ? nullptr : &entries_[static_cast<std::size_t>(i)].second;
}

Value Dictionary::get(std::string_view key) const {
  const Value* v = find(key);
  return v ? *v : Value();
}

void Dictionary::set(std::string key, Value value) {
  const auto i = indexOf(key);
  if (i >= 0) {
    entries_[static_cast<std::size_t>(i)].second = std::move(value);
    return;
  }
  appendNew(std::move(key), std::move(value));
}

void Dictionary::appendNew(std::string key, Value value) {
  entries_.emplace_back(std::move(key), std::move(value));
  if (index_) {
    // Keep the sorted index: insert the new position in order. Copies of
    // this dictionary share the index, so a shared one is copied first; one
    // held by this dictionary alone is updated in place (a record that grows
    // past the threshold would otherwise copy its index for every key).
    if (index_.use_count() != 1) {
      index_ = std::make_shared<std::vector<std::pair<std::size_t, std::size_t>>>(*index_);
    }
    auto entry = std::make_pair(hashKey(entries_.back().first), entries_.size() - 1);
    index_->insert(std::upper_bound(index_->begin(), index_->end(), entry), entry);
  } else if (entries_.size() >= kIndexThreshold) {
    rebuildIndex();
  }
}

bool Dictionary::erase(std::string_view key) {
  const auto i = indexOf(key);
  if (i < 0) {
    return false;
  }
  entries_.erase(entries_.begin() + i);
  rebuildIndex();
  return true;
}

void Dictionary::clear() {
  entries_.clear();
  index_.reset();
}

bool Dictionary::operator==(const Dictionary& other) const {
  if (size() != other.size()) {
    return false;
  }
  // Equality of dictionaries ignores order, as it does for property lists.
  for (const auto& [key, value] : entries_) {
    const Value* theirs = other.find(key);
    if (!theirs || !(*theirs == value)) {
      return false;
    }
  }
  return true;
}

// ---- Value -------------------------------------------------------------------

namespace {
// What the allocator really hands out for one node block (the reference
// counts and the storage together); every node block has the same size, so
// the first one measured stands for all. 0 until a node was made.
std::atomic<std::size_t> nodeBlockUsableSize{0};

// Allocates a node's one block: the reference counts and the storage
// together, as make_shared does, and notes what the allocator handed out for
// such a block the first time (a block's start is not reachable from the
// stored value, so allocationSize could not ask for it later).
template <typename T>
struct NodeAllocator {
  using value_type = T;
  NodeAllocator() = default;
  template <typename U>
  NodeAllocator(const NodeAllocator<U>&) noexcept {}
  T* allocate(std::size_t n) {
    T* block = std::allocator<T>().allocate(n);
    static const bool measured = [block] {
      nodeBlockUsableSize.store(malloc_usable_size(block), std::memory_order_relaxed);
      return true;
    }();
    (void)measured;
    return block;
  }
  void deallocate(T* block, std::size_t n) noexcept { std::allocator<T>().deallocate(block, n); }
  template <typename U>
  bool operator==(const NodeAllocator<U>&) const noexcept {
    return true;
  }
};
}  // namespace

template <typename... Args>
std::shared_ptr<const Value::Storage> Value::makeNode(Args&&... args) {
  return std::allocate_shared<const Storage>(NodeAllocator<Storage>(), std::forward<Args>(args)...);
}

// Booleans and small integers (method and status codes, counts, flags) are
// in most records and messages: their nodes are made once and shared, as
// copies of one value share theirs. Never destroyed, so that a value held
// by a static outlives nothing it needs.
std::shared_ptr<const Value::Storage> Value::sharedNode(bool v) {
  static const auto* const nodes = new std::shared_ptr<const Storage>[2] {
    makeNode(std::in_place_type<bool>, false), makeNode(std::in_place_type<bool>, true)
  };
  return nodes[v ? 1 : 0];
}

std::shared_ptr<const Value::Storage> Value::sharedNode(std::int64_t v) {
  static const auto* const nodes = [] {
    auto* made = new std::shared_ptr<const Storage>[kSharedIntegerMax - kSharedIntegerMin + 1];
    for (std::int64_t i = kSharedIntegerMin; i <= kSharedIntegerMax; ++i) {
      made[i - kSharedIntegerMin] = makeNode(std::in_place_type<std::int64_t>, i);
    }
    return made;
  }();
  return nodes[v - kSharedIntegerMin];
}

Value::Value(bool v) : node_(sharedNode(v)) {}
Value::Value(long long v)
    : node_(v >= kSharedIntegerMin && v <= kSharedIntegerMax ? sharedNode(static_cast<std::int64_t>(v))
                                                             : makeNode(std::in_place_type<std::int64_t>, v)) {}
Value::Value(unsigned long v) : Value(static_cast<unsigned long long>(v)) {}
Value::Value(unsigned long long v) {
  // Unsigned values that fit a signed integer are plain integers, so that a
  // number compares equal whichever way it was built.
  if (v <= static_cast<unsigned long long>(kSharedIntegerMax)) {
    node_ = sharedNode(static_cast<std::int64_t>(v));
  } else if (v <= static_cast<unsigned long long>(std::numeric_limits<std::int64_t>::max())) {
    node_ = makeNode(std::in_place_type<std::int64_t>, static_cast<std::int64_t>(v));
  } else {
    node_ = makeNode(std::in_place_type<std::uint64_t>, v);
  }
}
Value::Value(double v) : node_(makeNode(std::in_place_type<double>, v)) {}
Value::Value(const char* v) {
  if (v) {
    node_ = makeNode(std::in_place_type<std::string>, v);
  }
}
Value::Value(std::string v) : node_(makeNode(std::in_place_type<std::string>, std::move(v))) {}
Value::Value(zerith::Data v) : node_(makeNode(std::in_place_type<zerith::Data>, std::move(v))) {}
Value::Value(zerith::Date v) : node_(makeNode(std::in_place_type<zerith::Date>, v)) {}
Value::Value(zerith::Array v) : node_(makeNode(std::in_place_type<zerith::Array>, std::move(v))) {}
Value::Value(zerith::Dictionary v) : node_(makeNode(std::in_place_type<zerith::Dictionary>, std::move(v))) {}

Value::Type Value::type() const {
  if (!node_) {
    return Type::Nil;
  }
  switch (node_->index()) {
    case 0: return Type::Bool;
    case 1: return Type::Int;
    case 2: return Type::UInt;
    case 3: return Type::Real;
    case 4: return Type::String;
    case 5: return Type::Data;
    case 6: return Type::Date;
    case 7: return Type::Array;
    default: return Type::Dict;
  }
}

bool Value::isNumber() const {
  const Type t = type();
  return t == Type::Int || t == Type::UInt || t == Type::Real;
}

const std::string* Value::string() const { return node_ ? std::get_if<std::string>(node_.get()) : nullptr; }
const zerith::Data* Value::data() const { return node_ ? std::get_if<zerith::Data>(node_.get()) : nullptr; }
const zerith::Array* Value::array() const { return node_ ? std::get_if<zerith::Array>(node_.get()) : nullptr; }
const zerith::Dictionary* Value::dict() const {
  return node_ ? std::get_if<zerith::Dictionary>(node_.get()) : nullptr;
}
std::optional<zerith::Date> Value::date() const {
  if (const auto* d = node_ ? std::get_if<zerith::Date>(node_.get()) : nullptr) {
    return *d;
  }
  return std::nullopt;
}

namespace {
std::int64_t parseLeadingInteger(const std::string& s) {
  // Like a string's integer value: skip white space, optional sign, digits.
  const char* p = s.c_str();
  while (*p == ' ' || *p == '\t' || *p == '\n') {
    ++p;
  }
  return std::strtoll(p, nullptr, 10);
}

std::int64_t saturatingTruncate(double d) {
  if (std::isnan(d)) {
    return 0;
  }
  if (d >= 9.2233720368547758e18) {
    return std::numeric_limits<std::int64_t>::max();
  }
  if (d <= -9.2233720368547758e18) {
    return std::numeric_limits<std::int64_t>::min();
  }
  return static_cast<std::int64_t>(d);
}
}  // namespace

std::int64_t Value::intValue() const {
  switch (type()) {
    case Type::Bool: return std::get<bool>(*node_) ? 1 : 0;
    case Type::Int: return std::get<std::int64_t>(*node_);
    case Type::UInt: return static_cast<std::int64_t>(std::get<std::uint64_t>(*node_));
    case Type::Real: return saturatingTruncate(std::get<double>(*node_));
    case Type::String: return parseLeadingInteger(std::get<std::string>(*node_));
    default: return 0;
  }
}

std::uint64_t Value::unsignedValue() const {
  if (type() == Type::UInt) {
    return std::get<std::uint64_t>(*node_);
  }
  return static_cast<std::uint64_t>(intValue());
}

double Value::doubleValue() const {
  switch (type()) {
    case Type::Bool: return std::get<bool>(*node_) ? 1.0 : 0.0;
    case Type::Int: return static_cast<double>(std::get<std::int64_t>(*node_));
    case Type::UInt: return static_cast<double>(std::get<std::uint64_t>(*node_));
    case Type::Real: return std::get<double>(*node_);
    case Type::String: return std::strtod(std::get<std::string>(*node_).c_str(), nullptr);
    case Type::Date: return std::get<zerith::Date>(*node_).secondsSince1970;
    default: return 0;
  }
}

bool Value::boolValue() const {
  switch (type()) {
    case Type::Bool: return std::get<bool>(*node_);
    case Type::Int:
    case Type::UInt: return intValue() != 0;
    case Type::Real: return std::get<double>(*node_) != 0.0;
    case Type::String: {
      // A string is true when it starts with Y, y, T, t or a non-zero digit.
      const std::string& s = std::get<std::string>(*node_);
      const auto pos = s.find_first_not_of(" \t\n+-0");
      if (pos == std::string::npos) {
        return false;
      }
      const char c = s[pos];
      return c == 'Y' || c == 'y' || c == 'T' || c == 't' || (c >= '1' && c <= '9');
    }
    default: return false;
  }
}

Value Value::operator[](std::string_view key) const {
  if (const auto* d = dict()) {
    return d->get(key);
  }
  return {};
}

Value Value::at(std::size_t index) const {
  if (const auto* a = array(); a && index < a->size()) {
    return (*a)[index];
  }
  return {};
}

std::size_t Value::count() const {
  if (const auto* d = dict()) {
    return d->size();
  }
  if (const auto* a = array()) {
    return a->size();
  }
  return 0;
}

zerith::Dictionary Value::dictCopy() const {
  if (const auto* d = dict()) {
    return *d;
  }
  return {};
}

zerith::Array Value::arrayCopy() const {
  if (const auto* a = array()) {
    return *a;
  }
  return {};
}

bool Value::operator==(const Value& other) const {
  if (node_ == other.node_) {
    return true;
  }
  if (!node_ || !other.node_) {
    return false;
  }
  // Numbers compare by value across their representations.
  if (isNumber() && other.isNumber()) {
    if (type() == Type::Real || other.type() == Type::Real) {
      return doubleValue() == other.doubleValue();
    }
    return type() == other.type() && unsignedValue() == other.unsignedValue();
  }
  return *node_ == *other.node_;
}

namespace {
void describe(const Value& v, std::string& out) {
  switch (v.type()) {
    case Value::Type::Nil: out += "(null)"; break;
    case Value::Type::Bool: out += v.boolValue() ? "1" : "0"; break;
    case Value::Type::Int: out += fmt::format("{}", v.intValue()); break;
    case Value::Type::UInt: out += fmt::format("{}", v.unsignedValue()); break;
    case Value::Type::Real: out += fmt::format("{}", v.doubleValue()); break;
    case Value::Type::String: out += *v.string(); break;
    case Value::Type::Data: out += fmt::format("<{} bytes>", v.data()->size()); break;
    case Value::Type::Date: out += fmt::format("{:.6f}", v.date()->secondsSince1970); break;
    case Value::Type::Array: {
      out += "(";
      bool first = true;
      for (const auto& e : *v.array()) {
        out += first ? "" : ", ";
        first = false;
        describe(e, out);
      }
      out += ")";
      break;
    }
    case Value::Type::Dict: {
      out += "{";
      bool first = true;
      for (const auto& [k, e] : *v.dict()) {
        out += first ? "" : "; ";
        first = false;
        out += k;
        out += " = ";
        describe(e, out);
      }
      out += "}";
      break;
    }
  }
}

template <typename Container>
std::size_t bufferSize(const Container& c) {
  return c.capacity() == 0 ? 0 : malloc_usable_size(const_cast<void*>(static_cast<const void*>(c.data())));
}
}  // namespace

std::optional<std::string> Value::scalarText() const {
  switch (type()) {
    case Type::String: return *string();
    case Type::Bool: return boolValue() ? "1" : "0";
    case Type::Int: return fmt::format("{}", intValue());
    case Type::UInt: return fmt::format("{}", unsignedValue());
    case Type::Real: return fmt::format("{}", doubleValue());
    default: return std::nullopt;
  }
}

const char* Value::kindName() const {
  switch (type()) {
    case Type::Nil: return "nil";
    case Type::Bool: return "a boolean";
    case Type::Int:
    case Type::UInt: return "an integer";
    case Type::Real: return "a real";
    case Type::String: return "a string";
    case Type::Data: return "data";
    case Type::Date: return "a date";
    case Type::Array: return "an array";
    case Type::Dict: return "a dictionary";
  }
  return "a value";
}

std::string Value::description() const {
  std::string out;
  describe(*this, out);
  return out;
}

std::size_t Value::allocationSize() const {
  if (!node_) {
    return 0;
  }
  std::size_t size = nodeBlockUsableSize.load(std::memory_order_relaxed);
  if (const auto* s = string(); s && s->capacity() > std::string().capacity()) {
    size += malloc_usable_size(const_cast<char*>(s->data()));
  } else if (const auto* d = data()) {
    size += bufferSize(*d);
  } else if (const auto* a = array()) {
    size += bufferSize(*a);
  } else if (const auto* dict = this->dict()) {
    size += bufferSize(dict->entries());
  }
  return size;
}

}  // namespace zerith
