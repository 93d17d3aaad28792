// Validation of bytes that come from outside: Payload::decode and Frame.
#include <algorithm>
#include <array>
#include <cmath>
#include <string>

#include "propertylist/CborReader.h"
#include "propertylist/Payload.h"
#include "propertylist/PayloadBlock.h"
#include "propertylist/Utf8.h"

namespace vx {

namespace {

// Sizes of the items that are valid whatever follows their first byte, if only they are whole; 0
// for the others.
constexpr std::array<uint8_t, 256> kPlainItemBytes = [] {
  std::array<uint8_t, 256> sizes{};
  for (unsigned initial = 0; initial < 256; ++initial) {
    const unsigned major = initial >> 5;
    const unsigned info = initial & 31;
    const bool integer =
        info < 28 && (major == cbor::kUnsigned || (major == cbor::kNegative && info < 27));
    if (integer) sizes[initial] = static_cast<uint8_t>(info < 24 ? 1 : 1 + (1u << (info - 24)));
  }
  sizes[cbor::kFalse] = sizes[cbor::kTrue] = 1;
  return sizes;
}();

// The head of a string whose length its first byte tells.
constexpr uint8_t kEmptyText = cbor::kText << 5;
constexpr bool isShortText(uint8_t initial) {
  return static_cast<uint8_t>(initial - kEmptyText) < 24;
}

// A key of a dictionary that is still open. The print is equal for equal keys and nearly always
// different for different ones.
struct OpenKey {
  uint64_t print;
  const uint8_t* at;
  uint64_t size;
};

bool sameKey(const OpenKey& a, const OpenKey& b) {
  return a.print == b.print && a.size == b.size && std::memcmp(a.at, b.at, a.size) == 0;
}

bool keyOrder(const OpenKey& a, const OpenKey& b) {
  if (a.print != b.print) return a.print < b.print;
  if (a.size != b.size) return a.size < b.size;
  return std::memcmp(a.at, b.at, a.size) < 0;
}

// The keys of all open dictionaries, innermost last. The first few need no allocation; beyond them
// the capacity grows with keys that have really been read.
class KeyStack {
 public:
  std::size_t size() const { return size_; }
  OpenKey* begin() { return keys_; }
  OpenKey* end() { return keys_ + size_; }
  void truncate(std::size_t size) { size_ = size; }
  void push(const OpenKey& key) {
    if (size_ == capacity_) grow();
    keys_[size_++] = key;
  }

 private:
  void grow() {
    std::vector<OpenKey> larger(2 * capacity_);
    std::copy_n(keys_, size_, larger.begin());
    heap_.swap(larger);
    keys_ = heap_.data();
    capacity_ = heap_.size();
  }

  std::array<OpenKey, 48> inline_;  // not initialised: costs nothing until used
  std::vector<OpenKey> heap_;
  OpenKey* keys_ = inline_.data();
  std::size_t size_ = 0;
  std::size_t capacity_ = inline_.size();
};

// Walks one item, without recursion and in one pass. Lives for one call, on the caller's thread.
// Bounds: kMaxNesting levels; keys of open dictionaries, hence fewer than there are bytes.
class Validator {
 public:
  // Of a payload, or of a frame, whose elements are noted as they pass.
  explicit Validator(std::span<const uint8_t> bytes, Frame::Element* elements = nullptr)
      : begin_(bytes.data()),
        at_(begin_),
        end_(begin_ + bytes.size()),
        elements_(elements),
        deepest_(elements != nullptr ? Payload::kMaxNesting : Payload::kMaxNesting - 1) {}

  bool run();
  // Of one value, of a payload, with which the bytes begin: where it ends. Null when it is none.
  const uint8_t* runValue();
  uint64_t rootCount() const { return rootCount_; }
  bool spaceInKeys() const { return space_ != 0; }
  bool nonFinite() const { return nonFinite_; }
  DecodeError takeError() { return std::move(error_); }

 private:
  // Up to this many keys are compared each with each as they come; more are sorted at the end.
  static constexpr uint64_t kPairwise = 16;

  struct Level {
    uint64_t left;  // elements or entries still to come
    uint64_t count;
    std::size_t firstKey;
    uint64_t prints;  // a bit for each key's; a key that finds its own is compared with the others
    bool dictionary;
  };

  std::size_t bytesLeft() const { return static_cast<std::size_t>(end_ - at_); }
  bool fail(const uint8_t* at, std::string text) {
    error_ = {std::move(text), static_cast<std::size_t>(at - begin_)};
    return false;
  }
  bool failDuplicate(const OpenKey& key);
  bool failSimple(const cbor::Head& head, const uint8_t* at);

  bool runLevels();
  void endElement(uint64_t next);
  bool readHead(cbor::Head& head);
  bool open(const cbor::Head& head, const uint8_t* at);
  bool close(const Level& level);
  bool readKey(Level& level);
  bool readText(const cbor::Head& head, const uint8_t* at);
  bool readValue();
  bool readOtherValue();
  bool readDate(const cbor::Head& tag, const uint8_t* at);

  const uint8_t* begin_;
  const uint8_t* at_;
  const uint8_t* end_;
  Frame::Element* elements_;  // kMaxElements of them; null for a payload
  // A frame's array does not count, so that every valid payload fits into a frame.
  int deepest_;     // index of a level
  int depth_ = -1;  // index of the open level
  uint64_t rootCount_ = 0;
  uint64_t space_ = 0;
  bool nonFinite_ = false;
  std::array<Level, Payload::kMaxNesting + 1> levels_;
  KeyStack keys_;
  DecodeError error_;
};

bool Validator::run() {
  if (static_cast<std::size_t>(end_ - begin_) > Payload::kMaxBytes)
    return fail(begin_, "too large");
  cbor::Head head;
  if (!readHead(head)) return false;
  if (elements_ == nullptr && head.major() != cbor::kMap) return fail(begin_, "not a dictionary");
  if (elements_ != nullptr && head.major() != cbor::kArray) return fail(begin_, "not an array");
  rootCount_ = head.argument;
  if (!open(head, begin_) || !runLevels()) return false;
  if (elements_ != nullptr) endElement(rootCount_);
  return at_ == end_ || fail(at_, "bytes after the end");
}

const uint8_t* Validator::runValue() {
  --deepest_;
  return readValue() && runLevels() ? at_ : nullptr;
}

// What is open, to its end.
bool Validator::runLevels() {
  while (depth_ >= 0) {
    Level& level = levels_[static_cast<std::size_t>(depth_)];
    if (level.left == 0) {
      if (level.dictionary && !close(level)) return false;
      --depth_;
      continue;
    }
    if (depth_ == 0 && elements_ != nullptr) endElement(level.count - level.left);
    --level.left;
    if (level.dictionary && !readKey(level)) return false;
    if (!readValue()) return false;
  }
  return true;
}

// The frame's element before number `next` ends here, and that one begins.
inline void Validator::endElement(uint64_t next) {
  if (next > 0 && next <= Frame::kMaxElements) {
    Frame::Element& element = elements_[next - 1];
    element.end = at_;
    element.spaceInKeys = space_ != 0;
    element.nonFinite = nonFinite_;
  }
  if (next < Frame::kMaxElements) elements_[next].begin = at_;
  space_ = 0;
  nonFinite_ = false;
}

inline bool Validator::readHead(cbor::Head& head) {
  if (at_ == end_) return fail(at_, "ends too early");
  const uint8_t* const start = at_;
  const uint8_t initial = *at_++;
  const uint8_t info = initial & 31;
  if (info < 24) {
    head = {initial, info, at_};
    return true;
  }
  if (info > 27)
    return fail(start, info < 31         ? "reserved head"
                       : initial == 0xFF ? "break without an indefinite length"
                                         : "indefinite length");
  const std::size_t size = std::size_t{1} << (info - 24);
  if (bytesLeft() < size) return fail(start, "ends too early");
  head = {initial, cbor::bigEndian(at_, info), at_ + size};
  at_ += size;
  return true;
}

// An entry needs two bytes at least, an element one: a count beyond that is refused before anything
// is made of it.
inline bool Validator::open(const cbor::Head& head, const uint8_t* at) {
  const bool dictionary = head.major() == cbor::kMap;
  if (head.argument > bytesLeft() / (dictionary ? 2 : 1))
    return fail(at, "count larger than the bytes left");
  if (depth_ == deepest_)
    return fail(at, "nesting deeper than " + std::to_string(Payload::kMaxNesting));
  ++depth_;
  levels_[static_cast<std::size_t>(depth_)] = {head.argument, head.argument, keys_.size(), 0,
                                               dictionary};
  return true;
}

bool Validator::close(const Level& level) {
  if (level.count > kPairwise) {
    OpenKey* const first = keys_.begin() + level.firstKey;
    std::sort(first, keys_.end(), keyOrder);
    const OpenKey* const twin = std::adjacent_find(first, keys_.end(), sameKey);
    if (twin != keys_.end()) return failDuplicate(twin[0].at > twin[1].at ? twin[0] : twin[1]);
  }
  keys_.truncate(level.firstKey);
  return true;
}

inline bool Validator::readKey(Level& level) {
  const uint8_t* const start = at_;
  uint64_t size;
  if (at_ != end_ && isShortText(*at_)) {
    size = *at_++ - kEmptyText;
  } else {
    cbor::Head head;
    if (!readHead(head)) return false;
    if (head.major() != cbor::kText) return fail(start, "key is not a string");
    size = head.argument;
  }
  if (size > bytesLeft()) return fail(start, "ends too early");
  const uint8_t* const text = at_;
  uint64_t high = 0;
  uint64_t space = 0;
  uint64_t print = size;
  forEachWord(text, size, [&](uint64_t word) {
    high |= word;
    space |= hasByte(word, ' ');
    print = std::rotl(print, 23) ^ word;
  });
  if ((high & kHighBits) != 0 && !isUtf8Slowly(text, text + size))
    return fail(start, "invalid UTF-8");
  if (depth_ == (elements_ != nullptr ? 1 : 0)) space_ |= space;
  const OpenKey key{print, text, size};
  at_ = text + size;
  if (level.count <= kPairwise) {
    const uint64_t bit = uint64_t{1} << (print * 0x9E3779B97F4A7C15u >> 58);
    if ((level.prints & bit) != 0) {
      for (const OpenKey* other = keys_.begin() + level.firstKey; other != keys_.end(); ++other)
        if (sameKey(*other, key)) return failDuplicate(key);
    }
    level.prints |= bit;
  }
  keys_.push(key);
  return true;
}

inline bool Validator::readText(const cbor::Head& head, const uint8_t* at) {
  if (head.argument > bytesLeft()) return fail(at, "ends too early");
  if (!isUtf8({reinterpret_cast<const char*>(at_), head.argument}))
    return fail(at, "invalid UTF-8");
  at_ += head.argument;
  return true;
}

// Most values are numbers and short texts.
[[gnu::always_inline]] inline bool Validator::readValue() {
  if (at_ == end_) return fail(at_, "ends too early");
  const uint8_t initial = *at_;
  const std::size_t left = bytesLeft();
  if (const std::size_t size = kPlainItemBytes[initial]; size != 0 && size <= left) {
    at_ += size;
    return true;
  }
  if (initial == cbor::kDouble && left > sizeof(double)) {
    nonFinite_ = nonFinite_ || !std::isfinite(std::bit_cast<double>(cbor::bigEndian(at_ + 1, 27)));
    at_ += 1 + sizeof(double);
    return true;
  }
  if (isShortText(initial)) {
    const std::size_t size = initial - kEmptyText;
    if (size >= left || !isUtf8({reinterpret_cast<const char*>(at_ + 1), size}))
      return readOtherValue();
    at_ += 1 + size;
    return true;
  }
  return readOtherValue();
}

bool Validator::readOtherValue() {
  const uint8_t* const start = at_;
  cbor::Head head;
  if (!readHead(head)) return false;
  switch (head.major()) {
    case cbor::kUnsigned:
      return true;
    case cbor::kNegative:
      return head.argument >> 63 == 0 || fail(start, "integer below the signed 64-bit range");
    case cbor::kBytes:
      return fail(start, "byte string");
    case cbor::kText:
      return readText(head, start);
    case cbor::kArray:
    case cbor::kMap:
      return open(head, start);
    case cbor::kTag:
      return readDate(head, start);
    default:
      break;
  }
  if (cbor::isFloating(head)) {
    nonFinite_ = nonFinite_ || !std::isfinite(cbor::floatingOf(head));
    return true;
  }
  if (head.initial == cbor::kFalse || head.initial == cbor::kTrue) return true;
  return failSimple(head, start);
}

bool Validator::readDate(const cbor::Head& tag, const uint8_t* at) {
  if (tag.argument != 1) return fail(at, "tag " + std::to_string(tag.argument));
  cbor::Head head;
  if (!readHead(head)) return false;
  if (head.major() == cbor::kUnsigned) return true;
  if (head.major() == cbor::kNegative)
    return head.argument >> 63 == 0 || fail(at, "integer below the signed 64-bit range");
  if (!cbor::isFloating(head)) return fail(at, "date is not a number");
  return std::isfinite(cbor::floatingOf(head)) || fail(at, "date is not finite");
}

bool Validator::failSimple(const cbor::Head& head, const uint8_t* at) {
  if (head.initial == cbor::kNull) {
    if (elements_ != nullptr && depth_ == 0) return true;
    return fail(at, "null");
  }
  if (head.initial == 0xF7) return fail(at, "undefined");
  return fail(at, "simple value " + std::to_string(head.argument));
}

bool Validator::failDuplicate(const OpenKey& key) {
  constexpr std::size_t kMaxNamed = 64;
  std::string_view name(reinterpret_cast<const char*>(key.at), key.size);
  std::string shown(name.substr(0, kMaxNamed));
  if (name.size() > kMaxNamed) {
    while (!isUtf8(shown)) shown.pop_back();
    shown += "...";
  }
  return fail(key.at, "duplicate key \"" + shown + "\"");
}

}  // namespace

std::optional<Payload> Payload::decode(std::span<const uint8_t> bytes, DecodeError* error) {
  Validator validator(bytes);
  if (!validator.run()) {
    if (error != nullptr) *error = validator.takeError();
    return std::nullopt;
  }
  if (validator.rootCount() == 0) return Payload();
  Block* block = Block::allocate(bytes.size(), {validator.spaceInKeys(), validator.nonFinite()});
  std::memcpy(block->bytes(), bytes.data(), bytes.size());
  return Payload(block);
}

std::optional<Frame> Frame::decode(std::span<const uint8_t> bytes, DecodeError* error) {
  std::optional<Frame> frame(std::in_place);
  Validator validator(bytes, frame->elements_.data());
  if (!validator.run()) {
    if (error != nullptr) *error = validator.takeError();
    return std::nullopt;
  }
  frame->size_ = validator.rootCount();
  return frame;
}

std::optional<Value> Value::validate(std::span<const uint8_t> bytes) {
  const uint8_t* const end = Validator(bytes).runValue();
  if (end == nullptr) return std::nullopt;
  return Value(bytes.data(), end);
}

Payload::Validated Frame::validated(std::size_t i) const {
  const Element& element = elements_[i];
  if (cbor::head(element.begin).argument == 0) return {};  // however long its head
  return {{element.begin, element.end}, {element.spaceInKeys, element.nonFinite}};
}

Payload Frame::payload(std::size_t i) const {
  const Payload::Validated from = validated(i);
  if (from.bytes.empty()) return Payload();
  Payload::Block* block = Payload::Block::allocate(from.bytes.size(), from.traits);
  std::memcpy(block->bytes(), from.bytes.data(), from.bytes.size());
  return Payload(block);
}

}  // namespace vx
