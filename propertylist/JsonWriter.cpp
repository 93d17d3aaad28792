#include "propertylist/JsonWriter.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>

#include "propertylist/CborReader.h"
#include "propertylist/Utf8.h"
#include "propertylist/ValueText.h"

namespace vx {

namespace {

// A place at the end of a string that is written through a pointer: the string grows in steps ahead
// of what is written and is cut to it at the end.
class Sink {
 public:
  Sink(std::string& out, std::size_t expected) : out_(out), size_(out.size()) { grow(expected); }
  ~Sink() { out_.resize(static_cast<std::size_t>(at_ - out_.data())); }
  Sink(const Sink&) = delete;
  Sink& operator=(const Sink&) = delete;

  // Capacity for `count` characters at the returned place; wrote() says where they end.
  char* reserve(std::size_t count) {
    if (static_cast<std::size_t>(end_ - at_) < count) {
      size_ = static_cast<std::size_t>(at_ - out_.data());
      grow(std::max(count, size_));
    }
    return at_;
  }
  void wrote(char* end) { at_ = end; }
  void put(char c) {
    *reserve(1) = c;
    ++at_;
  }
  void put(std::string_view text) {
    wrote(std::copy(text.begin(), text.end(), reserve(text.size())));
  }

 private:
  void grow(std::size_t more) {
    out_.resize(size_ + more);
    at_ = out_.data() + size_;
    end_ = out_.data() + out_.size();
  }

  std::string& out_;
  std::size_t size_;
  char* at_ = nullptr;
  char* end_ = nullptr;
};

// What follows the backslash for a character: 0 for none needed, 'u' for the four-digit form.
constexpr std::array<char, 256> kEscapes = [] {
  std::array<char, 256> escapes{};
  for (std::size_t c = 0; c < 0x20; ++c) escapes[c] = 'u';
  escapes['\b'] = 'b';
  escapes['\f'] = 'f';
  escapes['\n'] = 'n';
  escapes['\r'] = 'r';
  escapes['\t'] = 't';
  escapes['"'] = '"';
  escapes['\\'] = '\\';
  return escapes;
}();
constexpr std::size_t kMaxEscaped = 6;  // \u001F

char* writeEscaped(char* out, uint8_t c) {
  *out++ = '\\';
  *out++ = kEscapes[c];
  if (kEscapes[c] != 'u') return out;
  *out++ = '0';
  *out++ = '0';
  *out++ = static_cast<char>('0' + (c >> 4));
  *out++ = "0123456789abcdef"[c & 15];
  return out;
}

// In pieces, so that a long text with much to escape claims no six times its size.
void putEscaping(Sink& sink, std::string_view text) {
  constexpr std::size_t kPiece = 1024;
  for (; !text.empty(); text.remove_prefix(std::min(kPiece, text.size()))) {
    const std::string_view piece = text.substr(0, kPiece);
    char* out = sink.reserve(piece.size() * kMaxEscaped);
    for (const char signedChar : piece) {
      const auto c = static_cast<uint8_t>(signedChar);
      if (kEscapes[c] == 0)
        *out++ = signedChar;
      else
        out = writeEscaped(out, c);
    }
    sink.wrote(out);
  }
}

// Copies and looks at once. True when something in it needs escaping.
bool copyText(char* out, std::string_view text) {
  uint64_t special = 0;
  const auto look = [&](uint64_t word) {
    special |= hasByteBelow(word, 0x20) | hasByte(word, '"') | hasByte(word, '\\');
  };
  const uint8_t* const at = bytesOf(text);
  const std::size_t size = text.size();
  if (size < 8) {
    std::copy(text.begin(), text.end(), out);
    forEachWord(at, size, look);
    return special != 0;
  }
  const auto copyWord = [&](std::size_t i) {
    const auto word = loadWord<uint64_t>(at + i);
    std::memcpy(out + i, &word, sizeof word);
    look(word);
  };
  for (std::size_t i = 0; i + 8 < size; i += 8) copyWord(i);
  copyWord(size - 8);
  return special != 0;
}

void putString(Sink& sink, std::string_view text) {
  char* const out = sink.reserve(text.size() + 2);
  if (!copyText(out + 1, text)) {
    *out = '"';
    out[text.size() + 1] = '"';
    sink.wrote(out + text.size() + 2);
    return;
  }
  sink.put('"');  // over what was copied
  putEscaping(sink, text);
  sink.put('"');
}

// Walks encoded items and writes their text. Lives for one call, on the caller's thread. Recursion
// ends with the nesting, which validation bounds.
class Emitter {
 public:
  enum class Layout { Compact, Pretty };

  Emitter(Sink& sink, NonFinite nonFinite, Layout layout, std::size_t indent)
      : sink_(sink), nonFinite_(nonFinite), layout_(layout), indent_(indent) {}

  // Returns the first byte after the item.
  const uint8_t* item(const uint8_t* at) {
    const cbor::Head head = cbor::head(at);
    switch (head.major()) {
      case cbor::kText:
        return text(head);
      case cbor::kArray:
        return container(head, '[', ']');
      case cbor::kMap:
        return container(head, '{', '}');
      case cbor::kTag:
        return date(head);
      case cbor::kSimple:
        return simple(head);
      default:
        sink_.wrote(writeNumber(sink_.reserve(kMaxScalarText), head));
        return head.next;
    }
  }

  // Elements or entries [from, to) of a container, the first of which is at `at`.
  const uint8_t* elements(const uint8_t* at, uint64_t from, uint64_t to, bool named) {
    for (uint64_t i = from; i < to; ++i) {
      if (i > 0) sink_.put(',');
      newLine();
      if (named) {
        at = text(cbor::head(at));
        sink_.put(layout_ == Layout::Pretty ? std::string_view(": ") : std::string_view(":"));
      }
      at = item(at);
    }
    return at;
  }

 private:
  const uint8_t* text(const cbor::Head& head) {
    putString(sink_, {reinterpret_cast<const char*>(head.next), head.argument});
    return head.next + head.argument;
  }

  const uint8_t* container(const cbor::Head& head, char opening, char closing) {
    sink_.put(opening);
    ++indent_;
    const uint8_t* at = elements(head.next, 0, head.argument, head.major() == cbor::kMap);
    --indent_;
    if (head.argument > 0) newLine();
    sink_.put(closing);
    return at;
  }

  const uint8_t* date(const cbor::Head& head) {
    char* out = sink_.reserve(kMaxScalarText + 2);
    *out++ = '"';
    out = writeNumber(out, head);
    *out++ = '"';
    sink_.wrote(out);
    return cbor::head(head.next).next;
  }

  const uint8_t* simple(const cbor::Head& head) {
    if (cbor::isFloating(head))
      floating(head);
    else if (head.initial == cbor::kNull)
      sink_.put("null");
    else
      sink_.put(head.initial == cbor::kTrue ? std::string_view("true") : std::string_view("false"));
    return head.next;
  }

  void floating(const cbor::Head& head) {
    const double value = cbor::floatingOf(head);
    if (std::isfinite(value))
      finite(head);
    else if (nonFinite_ == NonFinite::Refuse)
      sink_.put("null");
    else
      sink_.put(std::isnan(value) ? "\"NaN\"" : value > 0 ? "\"Infinity\"" : "\"-Infinity\"");
  }

  // Where other programs read it, 3.0 is not 3; people are shown the text of the value.
  void finite(const cbor::Head& head) {
    char* const begin = sink_.reserve(kMaxScalarText + 2);
    char* end = writeNumber(begin, head);
    const auto isDigit = [](char c) { return c >= '0' && c <= '9'; };
    if (layout_ == Layout::Compact && std::all_of(begin + (*begin == '-' ? 1 : 0), end, isDigit))
      end = std::copy_n(".0", 2, end);
    sink_.wrote(end);
  }

  void newLine() {
    if (layout_ == Layout::Compact) return;
    char* const out = sink_.reserve(1 + indent_);
    *out = '\n';
    sink_.wrote(std::fill_n(out + 1, indent_, ' '));
  }

  Sink& sink_;
  const NonFinite nonFinite_;
  const Layout layout_;
  std::size_t indent_;
};

void appendCompact(std::string& out, std::span<const uint8_t> item, NonFinite nonFinite) {
  Sink sink(out, 2 * item.size() + 64);
  Emitter(sink, nonFinite, Emitter::Layout::Compact, 0).item(item.data());
}

// Finds the first number that JSON cannot hold. The path is made only then, on the way back.
class FiniteCheck {
 public:
  bool failed() const { return failed_; }
  const std::string& path() const { return path_; }

  const uint8_t* item(const uint8_t* at) {
    const cbor::Head head = cbor::head(at);
    switch (head.major()) {
      case cbor::kText:
        return head.next + head.argument;
      case cbor::kArray:
        return array(head);
      case cbor::kMap:
        return dictionary(head);
      case cbor::kTag:
        return cbor::head(head.next).next;
      default:
        break;
    }
    failed_ = cbor::isFloating(head) && !std::isfinite(cbor::floatingOf(head));
    return head.next;
  }

 private:
  const uint8_t* array(const cbor::Head& head) {
    const uint8_t* at = head.next;
    for (uint64_t i = 0; i < head.argument && !failed_; ++i) {
      at = item(at);
      if (failed_) path_.insert(0, "[" + std::to_string(i) + "]");
    }
    return at;
  }

  const uint8_t* dictionary(const cbor::Head& head) {
    const uint8_t* at = head.next;
    for (uint64_t i = 0; i < head.argument && !failed_; ++i) {
      const std::string_view key = cbor::text(at);
      at = item(bytesOf(key) + key.size());
      if (failed_) path_.insert(0, "." + std::string(key));
    }
    return at;
  }

  bool failed_ = false;
  std::string path_;
};

}  // namespace

void appendJson(std::string& out, const Payload& payload, NonFinite nonFinite) {
  appendCompact(out, payload.encoded(), nonFinite);
}

void appendJson(std::string& out, const Value& value, NonFinite nonFinite) {
  appendCompact(out, value.encoded(), nonFinite);
}

bool appendJsonTail(std::string& out, const Payload& payload, const Payload& beginning,
                    NonFinite nonFinite) {
  const cbor::Head whole = cbor::head(payload.encoded().data());
  const cbor::Head part = cbor::head(beginning.encoded().data());
  const auto entries = [](const Payload& p, const cbor::Head& head) {
    return p.encoded().subspan(static_cast<std::size_t>(head.next - p.encoded().data()));
  };
  const std::span<const uint8_t> wholeBytes = entries(payload, whole);
  const std::span<const uint8_t> partBytes = entries(beginning, part);
  if (wholeBytes.size() < partBytes.size() ||
      !std::equal(partBytes.begin(), partBytes.end(), wholeBytes.begin()))
    return false;
  Sink sink(out, 2 * (wholeBytes.size() - partBytes.size()) + 64);
  Emitter(sink, nonFinite, Emitter::Layout::Compact, 0)
      .elements(wholeBytes.data() + partBytes.size(), part.argument, whole.argument, true);
  sink.put('}');
  return true;
}

void appendJsonString(std::string& out, std::string_view text) {
  if (!isUtf8(text)) return appendJsonString(out, wellFormedUtf8(text));
  Sink sink(out, text.size() + 2);
  putString(sink, text);
}

void appendJsonText(std::string& out, std::string_view part) {
  Sink sink(out, part.size());
  char* const at = sink.reserve(part.size());
  if (copyText(at, part))
    putEscaping(sink, part);
  else
    sink.wrote(at + part.size());
}

void appendPrettyJson(std::string& out, const Payload& payload, int indent) {
  Sink sink(out, 3 * payload.encoded().size() + 64);
  Emitter(sink, NonFinite::Refuse, Emitter::Layout::Pretty,
          static_cast<std::size_t>(std::max(indent, 0)))
      .item(payload.encoded().data());
}

void appendPrettyJson(std::string& out, const Value& value, int indent) {
  Sink sink(out, value.encoded().size() + 64);
  Emitter(sink, NonFinite::Refuse, Emitter::Layout::Pretty,
          static_cast<std::size_t>(std::max(indent, 0)))
      .item(value.encoded().data());
}

void appendPrettyEntries(std::string& out, std::span<const std::string> openings,
                         std::span<const Value> values, int indent) {
  std::size_t expected = 64;
  for (const std::string& opening : openings) expected += opening.size() + 8;
  for (const Value& value : values) expected += 3 * value.encoded().size();
  Sink sink(out, expected);
  Emitter emitter(sink, NonFinite::Refuse, Emitter::Layout::Pretty,
                  static_cast<std::size_t>(std::max(indent, 0)));
  for (std::size_t i = 0; i < values.size(); ++i) {
    sink.put(openings[i]);
    emitter.item(values[i].encoded().data());
  }
}

std::optional<Error> checkJson(const Payload& payload) {
  if (!payload.mayHoldNonFinite()) return std::nullopt;
  FiniteCheck check;
  check.item(payload.encoded().data());
  if (!check.failed()) return std::nullopt;
  return Error{kGenericErrorDomain, 1,
               "Invalid number value (not finite) at " + check.path().substr(1)};
}

}  // namespace vx
