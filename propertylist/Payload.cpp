#include "propertylist/Payload.h"

#include <algorithm>
#include <cmath>
#include <limits>

#include "propertylist/CborReader.h"
#include "propertylist/CborWriter.h"
#include "propertylist/PayloadBlock.h"
#include "propertylist/ValueText.h"

namespace vx {

namespace {

constexpr uint8_t kEmptyDictionary[] = {0xA0};
constexpr auto kMaxSigned = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());

// Truncates toward zero and stays inside the range of Integer; NaN is 0.
template <typename Integer>
Integer saturate(double value) {
  using Limits = std::numeric_limits<Integer>;
  if (std::isnan(value)) return 0;
  // The upper end is no double; the next one is a power of two, so nothing lies between them.
  if (value >= std::ldexp(1.0, Limits::digits)) return Limits::max();
  if (value <= static_cast<double>(Limits::min())) return Limits::min();
  return static_cast<Integer>(value);
}

// The head that carries the number: that of the value itself, or of a date's seconds.
cbor::Head numberHead(const uint8_t* at) {
  const cbor::Head head = cbor::head(at);
  return head.major() == cbor::kTag ? cbor::head(head.next) : head;
}

char* writeScalar(char* out, const cbor::Head& head) {
  if (head.initial == cbor::kFalse || head.initial == cbor::kTrue) {
    *out = head.initial == cbor::kTrue ? '1' : '0';
    return out + 1;
  }
  if (head.initial == cbor::kNull) return std::copy_n("null", 4, out);
  return writeNumber(out, head);
}

const uint8_t* appendTextOf(std::string& out, const uint8_t* at);

const uint8_t* appendArrayText(std::string& out, const cbor::Head& head) {
  const uint8_t* at = head.next;
  out += '(';
  for (uint64_t i = 0; i < head.argument; ++i) {
    if (i > 0) out += ',';
    at = appendTextOf(out, at);
  }
  out += ')';
  return at;
}

const uint8_t* appendDictionaryText(std::string& out, const cbor::Head& head) {
  const uint8_t* at = head.next;
  out += '{';
  for (uint64_t i = 0; i < head.argument; ++i) {
    if (i > 0) out += ',';
    at = appendTextOf(out, at);
    out += '=';
    at = appendTextOf(out, at);
  }
  out += '}';
  return at;
}

// Recursion ends with the nesting, which validation bounds.
const uint8_t* appendTextOf(std::string& out, const uint8_t* at) {
  const cbor::Head head = cbor::head(at);
  switch (head.major()) {
    case cbor::kText: {
      const std::string_view text = cbor::text(at);
      out += text;
      return head.next + text.size();
    }
    case cbor::kArray:
      return appendArrayText(out, head);
    case cbor::kMap:
      return appendDictionaryText(out, head);
    default:
      break;
  }
  char text[kMaxScalarText];
  out.append(text, writeScalar(text, head));
  return cbor::skip(at);
}

bool anyKeyHasSpace(const uint8_t* first, uint64_t count) {
  for (; count > 0; --count) {
    const std::string_view key = cbor::text(first);
    uint64_t space = 0;
    forEachWord(bytesOf(key), key.size(), [&](uint64_t word) { space |= hasByte(word, ' '); });
    if (space != 0) return true;
    first = cbor::skip(bytesOf(key) + key.size());
  }
  return false;
}

}  // namespace

// ------------------------------------------------------------------------------------------ Value

ValueKind Value::kind() const {
  constexpr uint8_t kUnsigned64 = 27;  // alone may be above the signed range
  const uint8_t initial = *begin_;
  switch (initial >> 5) {
    case cbor::kUnsigned:
      return initial != kUnsigned64 || cbor::head(begin_).argument <= kMaxSigned
                 ? ValueKind::Integer
                 : ValueKind::Unsigned;
    case cbor::kNegative:
      return ValueKind::Integer;
    case cbor::kText:
      return ValueKind::String;
    case cbor::kArray:
      return ValueKind::Array;
    case cbor::kMap:
      return ValueKind::Dictionary;
    case cbor::kTag:
      return ValueKind::Date;
    default:
      break;
  }
  switch (initial) {
    case cbor::kHalf:
    case cbor::kSingle:
      return ValueKind::Float;
    case cbor::kDouble:
      return ValueKind::Double;
    case cbor::kNull:
      return ValueKind::Null;
    default:
      return ValueKind::Boolean;
  }
}

bool Value::isNumber() const {
  const cbor::Head head = cbor::head(begin_);
  return head.major() <= cbor::kNegative || cbor::isFloating(head);
}

int64_t Value::asInt64() const {
  if (*begin_ < 24) return *begin_;
  const cbor::Head head = numberHead(begin_);
  if (head.major() == cbor::kUnsigned)
    return static_cast<int64_t>(std::min(head.argument, kMaxSigned));
  if (head.major() == cbor::kNegative) return -1 - static_cast<int64_t>(head.argument);
  if (cbor::isFloating(head)) return saturate<int64_t>(cbor::floatingOf(head));
  return head.initial == cbor::kTrue ? 1 : 0;
}

uint64_t Value::asUInt64() const {
  const cbor::Head head = numberHead(begin_);
  if (head.major() == cbor::kUnsigned) return head.argument;
  if (cbor::isFloating(head)) return saturate<uint64_t>(cbor::floatingOf(head));
  return head.initial == cbor::kTrue ? 1 : 0;
}

double Value::asDouble() const {
  const cbor::Head head = numberHead(begin_);
  if (head.major() == cbor::kUnsigned) return static_cast<double>(head.argument);
  if (cbor::isFloating(head)) return cbor::floatingOf(head);
  return static_cast<double>(asInt64());
}

float Value::asFloat() const {
  const double value = asDouble();
  constexpr double kLargest = std::numeric_limits<float>::max();
  if (std::isfinite(value) && std::abs(value) > kLargest)
    return static_cast<float>(std::copysign(kLargest, value));
  return static_cast<float>(value);
}

bool Value::asBool() const {
  const cbor::Head head = cbor::head(begin_);
  if (head.major() == cbor::kUnsigned) return head.argument != 0;
  if (cbor::isFloating(head)) return cbor::floatingOf(head) != 0;
  return head.major() == cbor::kNegative || head.initial == cbor::kTrue;
}

std::string_view Value::asString() const {
  return isString() ? cbor::text(begin_) : std::string_view();
}

ArrayView Value::asArray() const {
  ArrayView view;
  const cbor::Head head = cbor::head(begin_);
  if (head.major() == cbor::kArray) {
    view.first_ = head.next;
    view.count_ = head.argument;
  }
  return view;
}

DictionaryView Value::asDictionary() const {
  DictionaryView view;
  const cbor::Head head = cbor::head(begin_);
  if (head.major() == cbor::kMap) {
    view.first_ = head.next;
    view.count_ = head.argument;
  }
  return view;
}

void Value::appendText(std::string& out) const { appendTextOf(out, begin_); }

static_assert(Value::kMaxScalarText == kMaxScalarText);
char* Value::writeScalarText(char* out) const { return writeScalar(out, cbor::head(begin_)); }

// ------------------------------------------------------------------------------------------ views

Value ArrayView::Iterator::operator*() const { return Value(at_, cbor::skip(at_)); }

ArrayView::Iterator& ArrayView::Iterator::operator++() {
  at_ = cbor::skip(at_);
  --left_;
  return *this;
}

ArrayView::Iterator ArrayView::begin() const {
  Iterator iterator;
  iterator.at_ = first_;
  iterator.left_ = count_;
  return iterator;
}

DictionaryEntry DictionaryView::Iterator::operator*() const { return {key_, Value(value_, next_)}; }

// The entry that begins at next_.
void DictionaryView::Iterator::readEntry() {
  if (left_ == 0) return;
  key_ = cbor::text(next_);
  value_ = bytesOf(key_) + key_.size();
  next_ = cbor::skip(value_);
}

DictionaryView::Iterator& DictionaryView::Iterator::operator++() {
  --left_;
  readEntry();
  return *this;
}

DictionaryView::Iterator DictionaryView::begin() const {
  Iterator iterator;
  iterator.next_ = first_;
  iterator.left_ = count_;
  iterator.readEntry();
  return iterator;
}

std::optional<Value> DictionaryView::find(std::string_view key) const {
  const uint8_t* at = first_;
  for (std::size_t left = count_; left > 0; --left) {
    const std::string_view found = cbor::text(at);
    const uint8_t* value = bytesOf(found) + found.size();
    at = cbor::skip(value);
    if (found == key) return Value(value, at);
  }
  return std::nullopt;
}

// ---------------------------------------------------------------------------------------- Payload

Payload Payload::copyOf(const Value& dictionary) {
  const cbor::Head head = cbor::head(dictionary.begin_);
  if (head.major() != cbor::kMap || head.argument == 0) return Payload();
  const std::span<const uint8_t> bytes = dictionary.encoded();
  Block* block =
      Block::allocate(bytes.size(), {anyKeyHasSpace(head.next, head.argument),
                                     cbor::anyNonFinite(dictionary.begin_, dictionary.end_)});
  std::memcpy(block->bytes(), bytes.data(), bytes.size());
  return Payload(block);
}

Payload Payload::withEntry(std::string_view key, const Value& value) const {
  if (empty() || contains(key)) return PayloadBuilder(*this).set(key, value).build();
  const std::span<const uint8_t> old = encoded();
  const cbor::Head head = cbor::head(old.data());
  const std::span<const uint8_t> body =
      old.subspan(static_cast<std::size_t>(head.next - old.data()));
  std::vector<uint8_t> edges;  // the new head, then the new key
  edges.reserve(18 + key.size());
  CborWriter writer(edges);
  writer.dictionary(head.argument + 1);
  const std::size_t headSize = edges.size();
  writer.string(key);
  const std::span<const uint8_t> item = value.encoded();
  Block* block =
      Block::allocate(edges.size() + body.size() + item.size(),
                      {hasSpaceInKeys() || key.find(' ') != std::string_view::npos,
                       mayHoldNonFinite() || cbor::anyNonFinite(value.begin_, value.end_)});
  uint8_t* out = std::copy_n(edges.data(), headSize, block->bytes());
  out = std::copy(body.begin(), body.end(), out);
  out = std::copy(edges.begin() + static_cast<std::ptrdiff_t>(headSize), edges.end(), out);
  std::copy(item.begin(), item.end(), out);
  return Payload(block);
}

std::size_t Payload::size() const {
  return block_ == nullptr ? 0 : cbor::head(block_->bytes()).argument;
}

DictionaryView Payload::view() const {
  DictionaryView view;
  if (block_ != nullptr) {
    const cbor::Head head = cbor::head(block_->bytes());
    view.first_ = head.next;
    view.count_ = head.argument;
  }
  return view;
}

bool Payload::hasSpaceInKeys() const { return block_ != nullptr && block_->spaceInKeys(); }
bool Payload::mayHoldNonFinite() const { return block_ != nullptr && block_->mayHoldNonFinite(); }

std::span<const uint8_t> Payload::encoded() const {
  if (block_ == nullptr) return kEmptyDictionary;
  return {block_->bytes(), block_->size()};
}

Payload::Validated Payload::validated() const {
  if (block_ == nullptr) return {};
  return {encoded(), {block_->spaceInKeys(), block_->mayHoldNonFinite()}};
}

std::string Payload::text() const {
  std::string out;
  appendTextOf(out, encoded().data());
  return out;
}

bool Payload::operator==(const Payload& other) const {
  return block_ == other.block_ || std::ranges::equal(encoded(), other.encoded());
}

void Payload::retain() const noexcept {
  if (block_ != nullptr) block_->references.fetch_add(1, std::memory_order_relaxed);
}

void Payload::release() noexcept {
  if (block_ == nullptr) return;
  // The only owner needs no read-modify-write.
  if (block_->references.load(std::memory_order_acquire) == 1 ||
      block_->references.fetch_sub(1, std::memory_order_acq_rel) == 1) {
    if (block_->isPlaced()) [[unlikely]]
      Block::placedReleased.load(std::memory_order_acquire)(block_);
    else
      ::operator delete(block_);
  }
}

}  // namespace vx
