// Streams JSON text (RFC 8259) of property lists: compact for the store, pretty for files. Constant
// memory beyond the caller's buffer. Dates become text ("2026-11-21T03:46:00Z"), booleans true and
// false, numbers their text as of Value, compact 3.0 apart from 3; keys are not sorted.
#pragma once

#include <cstddef>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "propertylist/Payload.h"

namespace vx {

// Non-finite numbers have no JSON form.
enum class NonFinite {
  AsText,  // "NaN", "Infinity", "-Infinity" as strings: nothing is lost (the store)
  Refuse,  // checkJson names the offending key; append writes null
};

// Compact: no white space.
void appendJson(std::string& out, const Payload& payload, NonFinite nonFinite = NonFinite::AsText);
void appendJson(std::string& out, const Value& value, NonFinite nonFinite = NonFinite::AsText);
// For a payload that begins with all of `beginning`'s entries: what its text has after theirs,
// with the comma that separates them and the closing brace (`,"k":1}`). Otherwise false, and
// nothing is appended.
bool appendJsonTail(std::string& out, const Payload& payload, const Payload& beginning,
                    NonFinite nonFinite = NonFinite::AsText);
// Bytes that are not UTF-8 become U+FFFD.
void appendJsonString(std::string& out, std::string_view text);
// What stands between the quotes of a JSON string. For parts of a long text, one after the other;
// the whole must be UTF-8.
void appendJsonText(std::string& out, std::string_view part);
// Pretty: one blank a level, "key" : value separated as `"key": value`; the first line is not
// indented, the others by `indent` levels at least.
void appendPrettyJson(std::string& out, const Payload& payload, int indent);
void appendPrettyJson(std::string& out, const Value& value, int indent);
// The entries of a pretty dictionary without its braces, each value after its opening: what stands
// before it, which begins with the line break and ends with `"key": `. `indent`: of the entries.
void appendPrettyEntries(std::string& out, std::span<const std::string> openings,
                         std::span<const Value> values, int indent);
// The error that a strict JSON serialisation would report: a non-finite number, named by its key
// path. None when fine.
std::optional<Error> checkJson(const Payload& payload);

}  // namespace vx
