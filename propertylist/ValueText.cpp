#include "propertylist/ValueText.h"

#include <algorithm>
#include <charconv>
#include <cmath>

namespace vx {

namespace {

// Years 0000 and 9999 in the proleptic Gregorian calendar.
constexpr int64_t kFirstSecond = -62167219200;
constexpr int64_t kLastSecond = 253402300799;

char* writeTwoDigits(char* out, int64_t value) {
  *out++ = static_cast<char>('0' + value / 10);
  *out++ = static_cast<char>('0' + value % 10);
  return out;
}

// Days since 1970-01-01 to year, month and day: shifts the year to begin in March, so that the leap
// day is its last, and counts in eras of 400 years.
char* writeDay(char* out, int64_t days) {
  days += 719468 + 146097;  // one era more, so that nothing below is negative
  const int64_t era = days / 146097;
  const int64_t dayOfEra = days % 146097;
  const int64_t yearOfEra =
      (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
  const int64_t dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
  const int64_t shiftedMonth = (5 * dayOfYear + 2) / 153;
  const int64_t day = dayOfYear - (153 * shiftedMonth + 2) / 5 + 1;
  const int64_t month = shiftedMonth < 10 ? shiftedMonth + 3 : shiftedMonth - 9;
  const int64_t year = yearOfEra + (era - 1) * 400 + (month <= 2 ? 1 : 0);
  out = writeTwoDigits(writeTwoDigits(out, year / 100), year % 100);
  *out++ = '-';
  out = writeTwoDigits(out, month);
  *out++ = '-';
  return writeTwoDigits(out, day);
}

// Seconds since 1970, and billionths of the second that began then.
char* writeCivil(char* out, int64_t seconds, int64_t billionths) {
  const int64_t sinceFirst = seconds - kFirstSecond;  // not negative
  const int64_t secondOfDay = sinceFirst % 86400;
  out = writeDay(out, sinceFirst / 86400 + kFirstSecond / 86400);
  *out++ = 'T';
  out = writeTwoDigits(out, secondOfDay / 3600);
  *out++ = ':';
  out = writeTwoDigits(out, secondOfDay / 60 % 60);
  *out++ = ':';
  out = writeTwoDigits(out, secondOfDay % 60);
  if (billionths > 0) {
    *out++ = '.';
    for (int64_t unit = 100000000; billionths > 0; billionths %= unit, unit /= 10)
      *out++ = static_cast<char>('0' + billionths / unit);
  }
  *out++ = 'Z';
  return out;
}

// Billionths in the shortest decimal text of the number: the digits that a person would write, not
// those of the nearest binary fraction.
int64_t billionthsOf(double magnitude) {
  char digits[400];  // the longest: "0.", 323 zeros, 17 digits
  const auto [end, error] =
      std::to_chars(std::begin(digits), std::end(digits), magnitude, std::chars_format::fixed);
  const char* at = error == std::errc() ? std::find(digits, end, '.') : end;
  int64_t billionths = 0;
  for (int i = 0; i < 9; ++i) {
    if (at < end) ++at;
    billionths = billionths * 10 + (at < end ? *at - '0' : 0);
  }
  return billionths;
}

// Most numbers that are reported have a few decimals. Those of at most 15 digits in all are found
// by scaling: a double belongs to one decimal of that length at most, so the one whose quotient is
// the value is the shortest text there is. Null when the value is no such number; a third of the
// time of the general way when it is. The value must not be integral.
char* writeShortDecimal(char* out, double value) {
  const double magnitude = std::abs(value);
  if (!(magnitude >= 1e-3 && magnitude < 1e9)) return nullptr;
  const int64_t unit = magnitude < 1e3 ? 1000000000000 : magnitude < 1e6 ? 1000000000 : 1000000;
  const double product = magnitude * static_cast<double>(unit);
  auto scaled = static_cast<int64_t>(product);
  if (product - static_cast<double>(scaled) >= 0.5) ++scaled;
  if (static_cast<double>(scaled) / static_cast<double>(unit) != magnitude) return nullptr;
  if (value < 0) *out++ = '-';
  out = writeInteger(out, scaled / unit);
  char* const point = out;
  out = writeInteger(out, unit + scaled % unit);  // 1 and the decimals, zeros in front included
  *point = '.';
  while (out[-1] == '0') --out;
  return out;
}

template <typename T>
char* writeAnyFloating(char* out, T value) {
  if (std::abs(value) < T{0x1p63f}) {
    const auto whole = static_cast<int64_t>(value);
    if (static_cast<T>(whole) == value) return writeInteger(out, whole);
  } else if (value > 0 && value < T{0x1p64f}) {
    return writeUnsigned(out, static_cast<uint64_t>(value));
  } else if (std::isnan(value)) {
    return std::copy_n("nan", 3, out);  // whatever its sign
  }
  return std::to_chars(out, out + kMaxScalarText, value).ptr;
}

}  // namespace

char* writeInteger(char* out, int64_t value) {
  return std::to_chars(out, out + kMaxScalarText, value).ptr;
}

char* writeUnsigned(char* out, uint64_t value) {
  return std::to_chars(out, out + kMaxScalarText, value).ptr;
}

char* writeFloating(char* out, float value) { return writeAnyFloating(out, value); }

char* writeFloating(char* out, double value) {
  if (std::trunc(value) != value) {
    if (char* const end = writeShortDecimal(out, value)) return end;
  }
  return writeAnyFloating(out, value);
}

char* writeDate(char* out, double secondsSince1970) {
  const double whole = std::trunc(secondsSince1970);
  if (!(whole > static_cast<double>(kFirstSecond) && whole <= static_cast<double>(kLastSecond)))
    return writeFloating(out, secondsSince1970);
  if (whole == secondsSince1970) return writeCivil(out, static_cast<int64_t>(whole), 0);
  const int64_t billionths = billionthsOf(std::abs(secondsSince1970));
  if (secondsSince1970 > 0 || billionths == 0)
    return writeCivil(out, static_cast<int64_t>(whole), billionths);
  return writeCivil(out, static_cast<int64_t>(whole) - 1, 1000000000 - billionths);
}

char* writeNumber(char* out, const cbor::Head& head) {
  if (head.major() == cbor::kUnsigned) return writeUnsigned(out, head.argument);
  if (head.major() == cbor::kNegative)
    return writeInteger(out, -1 - static_cast<int64_t>(head.argument));
  if (head.major() != cbor::kTag)
    return head.initial == cbor::kDouble ? writeFloating(out, cbor::floatingOf(head))
                                         : writeFloating(out, cbor::singleOf(head));
  const cbor::Head seconds = cbor::head(head.next);
  if (cbor::isFloating(seconds)) return writeDate(out, cbor::floatingOf(seconds));
  // Whole seconds of the years written are exact in a double; of the others the digits must stay.
  if (seconds.argument > uint64_t{1} << 53) return writeNumber(out, seconds);
  const auto count = static_cast<double>(seconds.argument);
  return writeDate(out, seconds.major() == cbor::kNegative ? -1 - count : count);
}

}  // namespace vx
