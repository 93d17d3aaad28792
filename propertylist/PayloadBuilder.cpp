#include <algorithm>
#include <bit>
#include <cmath>

#include "base/SeededHash.h"
#include "propertylist/CborReader.h"
#include "propertylist/CborWriter.h"
#include "propertylist/Payload.h"
#include "propertylist/PayloadBlock.h"
#include "propertylist/Utf8.h"

namespace vx {

namespace {

// Up to this many entries are searched one by one, by their hashes.
constexpr std::size_t kMaxLinear = 16;
constexpr std::size_t kFirstBody = 256;
// Fewer dead bytes than this are not worth a copy.
constexpr std::size_t kMinDead = 4096;

uint32_t hashOf(std::string_view key) { return static_cast<uint32_t>(seededHash(key)); }

bool isNull(const Value& value) { return *value.encoded().data() == cbor::kNull; }

std::size_t headSize(uint64_t argument) {
  if (argument < 24) return 1;
  if (argument <= 0xFF) return 2;
  return argument <= 0xFFFF ? 3 : argument <= 0xFFFFFFFF ? 5 : 9;
}

template <class T>
void makeSpace(std::vector<T>& items, std::size_t more) {
  if (items.capacity() - items.size() < more)
    items.reserve(std::max(items.size() + more, 2 * items.capacity()));
}

uint32_t offset(std::size_t value) { return static_cast<uint32_t>(value); }

}  // namespace

// --------------------------------------------------------------------------------- PayloadBuilder

PayloadBuilder& PayloadBuilder::set(std::string_view key, std::string_view value) {
  return put(key, [&](CborWriter& out) { out.string(value); });
}
PayloadBuilder& PayloadBuilder::set(std::string_view key, float value) {
  nonFinite_ = nonFinite_ || !std::isfinite(value);
  return put(key, [&](CborWriter& out) { out.singleFloat(value); });
}
PayloadBuilder& PayloadBuilder::set(std::string_view key, double value) {
  nonFinite_ = nonFinite_ || !std::isfinite(value);
  return put(key, [&](CborWriter& out) { out.doubleFloat(value); });
}
PayloadBuilder& PayloadBuilder::set(std::string_view key, PayloadDate value) {
  return put(key, [&](CborWriter& out) { out.date(value.secondsSince1970); });
}
PayloadBuilder& PayloadBuilder::set(std::string_view key, const Value& value) {
  if (isNull(value)) return *this;
  const std::span<const uint8_t> item = value.encoded();
  nonFinite_ = nonFinite_ || cbor::anyNonFinite(item.data(), item.data() + item.size());
  return put(key, [&](CborWriter& out) { out.encoded(item); });
}
PayloadBuilder& PayloadBuilder::set(std::string_view key, const Payload& dictionary) {
  nonFinite_ = nonFinite_ || dictionary.mayHoldNonFinite();
  return put(key, [&](CborWriter& out) { out.encoded(dictionary.encoded()); });
}
PayloadBuilder& PayloadBuilder::set(std::string_view key, const ArrayBuilder& array) {
  const std::vector<uint8_t>& items = array.body_;
  nonFinite_ = nonFinite_ || cbor::anyNonFinite(items.data(), items.data() + items.size());
  return put(key, [&](CborWriter& out) {
    out.array(array.count_);
    out.encoded(array.body_);
  });
}
PayloadBuilder& PayloadBuilder::setBoolean(std::string_view key, bool value) {
  return put(key, [&](CborWriter& out) { out.boolean(value); });
}
PayloadBuilder& PayloadBuilder::setInteger(std::string_view key, int64_t value) {
  return put(key, [&](CborWriter& out) { out.integer(value); });
}
PayloadBuilder& PayloadBuilder::setUnsigned(std::string_view key, uint64_t value) {
  return put(key, [&](CborWriter& out) { out.unsignedInteger(value); });
}

PayloadBuilder& PayloadBuilder::merge(const Payload& from) {
  makeSpace(body_, from.encoded().size());
  makeSpace(entries_, from.size());
  if (const std::size_t most = entries_.size() + from.size(); wantsIndex(most)) growIndex(most);
  for (const auto& [key, value] : from) set(key, value);
  return *this;
}

std::size_t PayloadBuilder::encodedSizeWith(const Payload& from) {
  std::size_t count = entries_.size();
  std::size_t bytes = body_.size() - deadBytes_;
  for (const auto& [key, value] : from) {
    bytes += value.encoded().size();
    if (const Entry* const old = find(key, hashOf(key))) {
      bytes -= old->valueEnd - old->value;
    } else {
      bytes += headSize(key.size()) + key.size();
      ++count;
    }
  }
  return headSize(count) + bytes;
}

std::size_t PayloadBuilder::memoryBytes() const {
  return body_.capacity() + entries_.capacity() * sizeof(Entry) +
         slots_.capacity() * sizeof(slots_[0]);
}

Payload PayloadBuilder::build() const {
  if (entries_.empty()) return Payload();
  const std::size_t size = headSize(entries_.size()) + body_.size() - deadBytes_;
  Payload::Block* block = Payload::Block::allocate(size, {spaceInKeys_, nonFinite_});
  uint8_t* out = block->bytes();
  std::vector<uint8_t> head;
  CborWriter(head).dictionary(entries_.size());
  out = std::copy(head.begin(), head.end(), out);
  if (inOrder_) {
    std::copy(body_.begin(), body_.end(), out);
    return Payload(block);
  }
  const uint8_t* const body = body_.data();
  for (const Entry& entry : entries_) {
    const std::string_view key = keyOf(entry);
    out = std::copy(body + entry.key, bytesOf(key) + key.size(), out);
    out = std::copy(body + entry.value, body + entry.valueEnd, out);
  }
  return Payload(block);
}

Payload PayloadBuilder::joined(std::span<const JoinedText> texts) {
  if (texts.empty()) return Payload();
  std::vector<uint8_t> heads;  // all that is not a piece: heads and keys, one after the other
  std::vector<std::size_t> headEnds;
  CborWriter writer(heads);
  writer.dictionary(texts.size());
  std::size_t size = 0;
  bool space = false;
  for (const JoinedText& text : texts) {
    std::size_t length = 0;
    for (const std::string_view piece : text.pieces) length += piece.size();
    writer.string(text.key);
    writer.stringHead(length);
    headEnds.push_back(heads.size());
    size += length;
    space = space || text.key.find(' ') != std::string_view::npos;
  }
  Payload::Block* block = Payload::Block::allocate(heads.size() + size, {space, false});
  uint8_t* out = block->bytes();
  std::size_t begin = 0;
  for (std::size_t i = 0; i < texts.size(); ++i) {
    out = std::copy(heads.data() + begin, heads.data() + headEnds[i], out);
    begin = headEnds[i];
    for (const std::string_view piece : texts[i].pieces)
      out = std::copy(piece.begin(), piece.end(), out);
  }
  return Payload(block);
}

// Appends key and value, then decides what they are: a new entry, or a value for an old one.
template <typename Write>
PayloadBuilder& PayloadBuilder::put(std::string_view key, Write write) {
  if (!isUtf8(key)) return put(wellFormedUtf8(key), write);
  const uint32_t hash = hashOf(key);
  Entry* const old = find(key, hash);
  if (body_.capacity() == 0) body_.reserve(kFirstBody);
  const std::size_t start = body_.size();
  CborWriter out(body_);
  if (old == nullptr) out.string(key);
  const std::size_t value = body_.size();
  write(out);
  if (body_.size() > Payload::Block::kMaxSize - 9) {
    body_.resize(start);
    throw std::length_error("a property list is limited to 512 MiB");
  }
  if (old == nullptr)
    add(key, {offset(start), offset(value), offset(body_.size()), hash});
  else
    replace(*old, value);
  return *this;
}

std::string_view PayloadBuilder::keyOf(const Entry& entry) const {
  return cbor::text(body_.data() + entry.key);
}

PayloadBuilder::Entry* PayloadBuilder::find(std::string_view key, uint32_t hash) {
  if (slots_.empty()) {
    for (Entry& entry : entries_)
      if (entry.hash == hash && keyOf(entry) == key) return &entry;
    return nullptr;
  }
  const std::size_t mask = slots_.size() - 1;
  for (std::size_t slot = hash & mask; slots_[slot] != 0; slot = (slot + 1) & mask) {
    Entry& entry = entries_[slots_[slot] - 1];
    if (entry.hash == hash && keyOf(entry) == key) return &entry;
  }
  return nullptr;
}

void PayloadBuilder::add(std::string_view key, const Entry& entry) {
  if (entries_.capacity() == 0) entries_.reserve(kMaxLinear);
  entries_.push_back(entry);
  spaceInKeys_ = spaceInKeys_ || key.find(' ') != std::string_view::npos;
  if (wantsIndex(entries_.size()))
    growIndex(entries_.size());
  else if (!slots_.empty())
    index(entries_.size() - 1);
}

// The new value lies at `value`, after everything else.
void PayloadBuilder::replace(Entry& entry, std::size_t value) {
  const std::size_t oldSize = entry.valueEnd - entry.value;
  const std::size_t newSize = body_.size() - value;
  if (oldSize == newSize) {
    std::memcpy(body_.data() + entry.value, body_.data() + value, newSize);
    body_.resize(value);
    return;
  }
  if (entry.valueEnd == value) {  // nothing lies between them
    std::memmove(body_.data() + entry.value, body_.data() + value, newSize);
    entry.valueEnd = offset(entry.value + newSize);
    body_.resize(entry.valueEnd);
    return;
  }
  entry.value = offset(value);
  entry.valueEnd = offset(body_.size());
  inOrder_ = false;
  deadBytes_ += oldSize;
  if (deadBytes_ > kMinDead && deadBytes_ > body_.size() / 2) compact();
}

bool PayloadBuilder::wantsIndex(std::size_t entries) const {
  return entries > kMaxLinear && 2 * entries > slots_.size();
}

void PayloadBuilder::index(std::size_t entry) {
  const std::size_t mask = slots_.size() - 1;
  std::size_t slot = entries_[entry].hash & mask;
  while (slots_[slot] != 0) slot = (slot + 1) & mask;
  slots_[slot] = offset(entry + 1);
}

void PayloadBuilder::growIndex(std::size_t entries) {
  slots_.assign(std::max(4 * kMaxLinear, std::bit_ceil(2 * entries)), 0);
  for (std::size_t i = 0; i < entries_.size(); ++i) index(i);
}

void PayloadBuilder::compact() {
  std::vector<uint8_t> body;
  body.reserve(body_.size());
  for (Entry& entry : entries_) {
    const std::string_view key = keyOf(entry);
    const uint8_t* const from = body_.data();
    const std::size_t start = body.size();
    body.insert(body.end(), from + entry.key, bytesOf(key) + key.size());
    const std::size_t value = body.size();
    body.insert(body.end(), from + entry.value, from + entry.valueEnd);
    entry = {offset(start), offset(value), offset(body.size()), entry.hash};
  }
  body_.swap(body);
  deadBytes_ = 0;
  inOrder_ = true;
}

// ----------------------------------------------------------------------------------- ArrayBuilder

ArrayBuilder& ArrayBuilder::add(std::string_view value) {
  ++count_;
  CborWriter(body_).string(value);
  return *this;
}
ArrayBuilder& ArrayBuilder::add(float value) {
  ++count_;
  CborWriter(body_).singleFloat(value);
  return *this;
}
ArrayBuilder& ArrayBuilder::add(double value) {
  ++count_;
  CborWriter(body_).doubleFloat(value);
  return *this;
}
ArrayBuilder& ArrayBuilder::add(PayloadDate value) {
  ++count_;
  CborWriter(body_).date(value.secondsSince1970);
  return *this;
}
ArrayBuilder& ArrayBuilder::add(const Value& value) {
  if (isNull(value)) return *this;
  ++count_;
  CborWriter(body_).encoded(value.encoded());
  return *this;
}
ArrayBuilder& ArrayBuilder::add(const Payload& dictionary) {
  ++count_;
  CborWriter(body_).encoded(dictionary.encoded());
  return *this;
}
ArrayBuilder& ArrayBuilder::add(const ArrayBuilder& array) {
  if (&array == this) return add(ArrayBuilder(array));
  ++count_;
  CborWriter out(body_);
  out.array(array.count_);
  out.encoded(array.body_);
  return *this;
}
ArrayBuilder& ArrayBuilder::addBoolean(bool value) {
  ++count_;
  CborWriter(body_).boolean(value);
  return *this;
}
ArrayBuilder& ArrayBuilder::addInteger(int64_t value) {
  ++count_;
  CborWriter(body_).integer(value);
  return *this;
}
ArrayBuilder& ArrayBuilder::addUnsigned(uint64_t value) {
  ++count_;
  CborWriter(body_).unsignedInteger(value);
  return *this;
}

}  // namespace vx
