// The property lists in which everything travels: messages, configurations, preferences,
// statistics, events.
//
// A Payload is an immutable, reference-counted dictionary that *is* its CBOR encoding (RFC 8949):
// one allocation holds a small header and the validated bytes. Copying is a reference count;
// reading is by views that copy nothing and stay valid as long as the Payload they came from.
// Thread-safe as immutable objects are.
//
// Kinds stay apart: a boolean is never an integer, a single-precision float never a double.
// Insertion order is the enumeration order; keys are unique strings.
#pragma once

#include <array>
#include <atomic>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <iterator>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace vx {

enum class ValueKind : uint8_t {
  Integer,   // signed 64-bit
  Unsigned,  // unsigned 64-bit above the signed range
  Float,     // single precision (a half-precision number on the wire is widened to this)
  Double,
  Boolean,
  String,  // UTF-8
  Date,    // seconds since 1970-01-01T00:00:00Z (CBOR tag 1), integer or floating, finite
  Array,
  Dictionary,
  Null,  // only inside frames, where it stands for an absent argument; never inside a Payload
};

class ArrayView;
class DictionaryView;

// One value inside validated bytes. A view: valid as long as the bytes are. Cheap to copy.
class Value {
 public:
  ValueKind kind() const;
  bool isNumber() const;  // Integer, Unsigned, Float or Double; not Boolean
  bool isString() const { return kind() == ValueKind::String; }
  bool isArray() const { return kind() == ValueKind::Array; }
  bool isDictionary() const { return kind() == ValueKind::Dictionary; }

  // Numbers (and Boolean as 1 and 0, and Date as its seconds) as another number type. Truncates
  // toward zero and saturates at the ends of the range; as an integer, NaN gives 0. Every other
  // kind gives 0.
  int64_t asInt64() const;
  uint64_t asUInt64() const;
  double asDouble() const;
  float asFloat() const;
  bool asBool() const;                  // a number other than 0, or true
  std::string_view asString() const;    // empty for other kinds
  ArrayView asArray() const;            // empty for other kinds
  DictionaryView asDictionary() const;  // empty for other kinds

  // The value's own CBOR bytes.
  std::span<const uint8_t> encoded() const { return {begin_, end_}; }
  // The one item of bytes that have been validated: what encoded() gave, kept elsewhere.
  static Value ofValidated(std::span<const uint8_t> item) {
    return {item.data(), item.data() + item.size()};
  }
  // The item that bytes from outside begin with, if it is one that a Payload may hold. What follows
  // it is not looked at.
  static std::optional<Value> validate(std::span<const uint8_t> bytes);

  // Text of a value: decimal integers, shortest round-trip floating numbers (3 and 3.0 are both
  // "3"; "nan", "inf", "-inf" for those), booleans as 1 and 0, strings as themselves, dates as
  // "2026-11-21T03:46:00Z" (with a fraction when there is one; outside of the years 0000 to 9999 as
  // their seconds), arrays as (a,b,c), dictionaries as {key=value,key=value}. Equal values have
  // equal text.
  void appendText(std::string& out) const;
  // The same for a value that is no string, array or dictionary: at most kMaxScalarText characters;
  // returns the first place after them.
  static constexpr std::size_t kMaxScalarText = 48;
  char* writeScalarText(char* out) const;
  std::string text() const {
    std::string out;
    appendText(out);
    return out;
  }

 private:
  friend class ArrayView;
  friend class DictionaryView;
  friend class Payload;
  friend class Frame;
  Value(const uint8_t* begin, const uint8_t* end) : begin_(begin), end_(end) {}
  const uint8_t* begin_;
  const uint8_t* end_;
};

class ArrayView {
 public:
  class Iterator {
   public:
    using iterator_category = std::input_iterator_tag;
    using value_type = Value;
    using difference_type = std::ptrdiff_t;
    using pointer = const Value*;
    using reference = Value;
    Value operator*() const;
    Iterator& operator++();
    void operator++(int) { ++*this; }
    bool operator==(const Iterator& other) const { return left_ == other.left_; }

   private:
    friend class ArrayView;
    const uint8_t* at_ = nullptr;
    std::size_t left_ = 0;
  };
  ArrayView() = default;
  std::size_t size() const { return count_; }
  bool empty() const { return count_ == 0; }
  Iterator begin() const;
  Iterator end() const { return {}; }

 private:
  friend class Value;
  const uint8_t* first_ = nullptr;
  std::size_t count_ = 0;
};

struct DictionaryEntry;

class DictionaryView {
 public:
  class Iterator {
   public:
    using iterator_category = std::input_iterator_tag;
    using value_type = DictionaryEntry;
    using difference_type = std::ptrdiff_t;
    using pointer = const DictionaryEntry*;
    using reference = DictionaryEntry;
    DictionaryEntry operator*() const;
    Iterator& operator++();
    void operator++(int) { ++*this; }
    bool operator==(const Iterator& other) const { return left_ == other.left_; }

   private:
    friend class DictionaryView;
    void readEntry();
    std::string_view key_;
    const uint8_t* value_ = nullptr;
    const uint8_t* next_ = nullptr;  // after the value
    std::size_t left_ = 0;
  };
  DictionaryView() = default;
  std::size_t size() const { return count_; }
  bool empty() const { return count_ == 0; }
  Iterator begin() const;
  Iterator end() const { return {}; }
  std::optional<Value> find(std::string_view key) const;  // linear

 private:
  friend class Value;
  friend class Payload;
  const uint8_t* first_ = nullptr;
  std::size_t count_ = 0;
};

struct DictionaryEntry {
  std::string_view key;
  Value value;
};

// Why bytes were refused. `text` names the fault for people ("duplicate key \"a\"", "nesting deeper
// than 32"); offset is the byte at which it was found.
struct DecodeError {
  std::string text;
  std::size_t offset = 0;
};

class Payload {
 public:
  static constexpr int kMaxNesting = 32;
  static constexpr std::size_t kMaxBytes = 0x1FFFFFFF;  // of the encoding

  // What is known of validated bytes, so that nobody has to look for it again.
  struct Traits {
    bool spaceInKeys = false;       // of this dictionary
    bool mayHoldNonFinite = false;  // anywhere inside; a value replaced since may have been it
  };
  // A dictionary's validated bytes; none for the empty dictionary. A view.
  struct Validated {
    std::span<const uint8_t> bytes;
    Traits traits;
  };

  Payload() = default;  // the empty dictionary; allocates nothing
  Payload(const Payload& other) noexcept : block_(other.block_) { retain(); }
  Payload(Payload&& other) noexcept : block_(std::exchange(other.block_, nullptr)) {}
  Payload& operator=(Payload other) noexcept {
    std::swap(block_, other.block_);
    return *this;
  }
  ~Payload() { release(); }

  // Validates bytes that come from outside: exactly one definite-length dictionary of the kinds
  // above, UTF-8 strings, unique keys, nesting at most kMaxNesting, nothing after it. No
  // allocation before a length is believed.
  static std::optional<Payload> decode(std::span<const uint8_t> bytes,
                                       DecodeError* error = nullptr);
  // Copies a dictionary that has been validated already (a dictionary argument of a decoded frame,
  // a nested one).
  static Payload copyOf(const Value& dictionary);
  // This dictionary with one entry set, as PayloadBuilder::set would: one copy where the key is
  // new.
  Payload withEntry(std::string_view key, const Value& value) const;

  std::size_t size() const;
  bool empty() const { return size() == 0; }
  DictionaryView view() const;
  auto begin() const { return view().begin(); }
  auto end() const { return view().end(); }
  std::optional<Value> find(std::string_view key) const { return view().find(key); }
  bool contains(std::string_view key) const { return find(key).has_value(); }

  // True when a key of this dictionary (not of nested ones) holds a space. Known since validation:
  // costs a flag test.
  bool hasSpaceInKeys() const;
  // False only when every number in it is finite: costs a flag test.
  bool mayHoldNonFinite() const;
  // The CBOR encoding. The empty dictionary encodes as one byte.
  std::span<const uint8_t> encoded() const;
  Validated validated() const;
  std::string text() const;  // as Value::text
  // The same for all copies of one object, as long as one of them lives; null for the empty
  // dictionary.
  const void* identity() const { return block_; }
  // Same object, not merely equal content.
  bool isSameObject(const Payload& other) const { return block_ == other.block_; }
  // Equal encodings (so also equal order of entries).
  bool operator==(const Payload& other) const;

 private:
  friend class PayloadBuilder;
  friend class Frame;
  friend class PlacedPayload;
  struct Block;
  explicit Payload(Block* adopted) : block_(adopted) {}
  void retain() const noexcept;
  void release() noexcept;
  Block* block_ = nullptr;
};

struct PayloadDate {
  double secondsSince1970 = 0;
};

class ArrayBuilder;

// Builds a Payload. set() under a key that is there already replaces the value and keeps the
// entry's place. Any number of entries costs amortised constant time each.
//
// What is put in always makes a valid Payload: bytes that are not UTF-8 become U+FFFD, a date that
// is not finite becomes 1970, a Null value changes nothing. Nesting is the caller's affair: one
// deeper than Payload::kMaxNesting can be built and written, but no peer will accept it.
// std::length_error beyond 512 MiB.
class PayloadBuilder {
 public:
  PayloadBuilder() = default;
  explicit PayloadBuilder(const Payload& from) { merge(from); }

  PayloadBuilder& set(std::string_view key, std::string_view value);
  PayloadBuilder& set(std::string_view key, const char* value) {
    return set(key, std::string_view(value));
  }
  PayloadBuilder& set(std::string_view key, const std::string& value) {
    return set(key, std::string_view(value));
  }
  PayloadBuilder& set(std::string_view key, std::same_as<bool> auto value) {
    return setBoolean(key, value);
  }
  template <std::integral T>
    requires(!std::same_as<T, bool>)
  PayloadBuilder& set(std::string_view key, T value) {
    if constexpr (std::unsigned_integral<T>)
      return setUnsigned(key, value);
    else
      return setInteger(key, value);
  }
  PayloadBuilder& set(std::string_view key, float value);
  PayloadBuilder& set(std::string_view key, double value);
  PayloadBuilder& set(std::string_view key, PayloadDate value);
  PayloadBuilder& set(std::string_view key, const Value& value);
  PayloadBuilder& set(std::string_view key, const Payload& dictionary);
  PayloadBuilder& set(std::string_view key, const ArrayBuilder& array);
  // Adds every entry of `from`, replacing values under keys that are there already. Costs what is
  // added, not what is there. What memory it wants it asks for first: std::bad_alloc leaves it
  // whole.
  PayloadBuilder& merge(const Payload& from);

  std::size_t size() const { return entries_.size(); }
  // Bytes of what build() would make after merge(from).
  std::size_t encodedSizeWith(const Payload& from);
  // That it keeps itself.
  std::size_t memoryBytes() const;
  Payload build() const;
  // For a dictionary of long texts that would be put together first and then copied: each is given
  // in pieces, which must be UTF-8 as a whole. The keys must be UTF-8 and unique.
  struct JoinedText {
    std::string_view key;
    std::vector<std::string_view> pieces;
  };
  static Payload joined(std::span<const JoinedText> texts);

 private:
  // Where an entry lies in body_. The value follows its key, unless a replaced value of another
  // size moved it to the end.
  struct Entry {
    uint32_t key = 0;
    uint32_t value = 0;
    uint32_t valueEnd = 0;
    uint32_t hash = 0;
  };

  PayloadBuilder& setBoolean(std::string_view key, bool value);
  PayloadBuilder& setInteger(std::string_view key, int64_t value);
  PayloadBuilder& setUnsigned(std::string_view key, uint64_t value);
  template <typename Write>
  PayloadBuilder& put(std::string_view key, Write write);
  std::string_view keyOf(const Entry& entry) const;
  Entry* find(std::string_view key, uint32_t hash);
  void add(std::string_view key, const Entry& entry);
  void replace(Entry& entry, std::size_t value);
  bool wantsIndex(std::size_t entries) const;
  void index(std::size_t entry);
  void growIndex(std::size_t entries);
  void compact();

  // Keys and values one after the other, encoded. A value that was replaced may stay as dead bytes
  // until there are as many of them as living ones.
  std::vector<uint8_t> body_;
  std::vector<Entry> entries_;  // in insertion order
  std::vector<uint32_t>
      slots_;  // open addressing: number of an entry + 1; empty while they are few
  std::size_t deadBytes_ = 0;
  bool inOrder_ = true;  // body_ is the dictionary's encoding as it stands
  bool spaceInKeys_ = false;
  bool nonFinite_ = false;
};

class ArrayBuilder {
 public:
  ArrayBuilder& add(std::string_view value);
  ArrayBuilder& add(const char* value) { return add(std::string_view(value)); }
  ArrayBuilder& add(std::same_as<bool> auto value) { return addBoolean(value); }
  template <std::integral T>
    requires(!std::same_as<T, bool>)
  ArrayBuilder& add(T value) {
    if constexpr (std::unsigned_integral<T>)
      return addUnsigned(value);
    else
      return addInteger(value);
  }
  ArrayBuilder& add(float value);
  ArrayBuilder& add(double value);
  ArrayBuilder& add(PayloadDate value);
  ArrayBuilder& add(const Value& value);
  ArrayBuilder& add(const Payload& dictionary);
  ArrayBuilder& add(const ArrayBuilder& array);
  std::size_t size() const { return count_; }

 private:
  friend class PayloadBuilder;
  ArrayBuilder& addBoolean(bool value);
  ArrayBuilder& addInteger(int64_t value);
  ArrayBuilder& addUnsigned(uint64_t value);
  std::vector<uint8_t> body_;
  std::size_t count_ = 0;
};

// One frame of the socket protocol: exactly one definite-length CBOR array. Null may stand as a
// direct element of the array (an absent argument), nowhere deeper. A view: valid as long as the
// bytes it was decoded from.
class Frame {
 public:
  static constexpr std::size_t kMaxElements = 8;  // that can be read; there may be more
  struct Element {
    const uint8_t* begin;
    const uint8_t* end;
    bool spaceInKeys;  // of a dictionary
    bool nonFinite;    // some number inside is
  };
  Frame() {}  // empty; the elements are not initialised, they are set as they are decoded
  static std::optional<Frame> decode(std::span<const uint8_t> bytes, DecodeError* error = nullptr);
  std::size_t size() const { return size_; }
  bool empty() const { return size_ == 0; }
  // Both: i < size() and i < kMaxElements.
  Value operator[](std::size_t i) const { return {elements_[i].begin, elements_[i].end}; }
  // A copy of an element that is a dictionary; validation has noted what else is to be known of it.
  Payload payload(std::size_t i) const;
  // The bytes such a copy is made of.
  Payload::Validated validated(std::size_t i) const;

 private:
  std::array<Element, kMaxElements> elements_;
  std::size_t size_ = 0;
};

}  // namespace vx
