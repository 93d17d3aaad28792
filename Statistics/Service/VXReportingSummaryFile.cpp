#include "Statistics/Service/VXReportingSummaryFile.h"

#include <algorithm>
#include <charconv>

#include "propertylist/FileNames.h"
#include "propertylist/JsonWriter.h"

namespace vx {

namespace {

constexpr std::size_t kWriteBytes = 64 << 10;

}  // namespace

std::string VXReportingSummaryFile::name(const std::string& date,
                                         const std::optional<Value>& application,
                                         ServiceType serviceType) {
  return date + "-sonik-" + encodeFileNameComponent(application ? application->text() : "unknown") +
         "-" + std::string(VXReportingServiceTypeName(serviceType)) + ".json";
}

void VXReportingSummaryFile::element(const Payload& payload) {
  separate();
  dictionary(payload, 1);
}

void VXReportingSummaryFile::message(const VXReportingRow& row) {
  separate();
  std::size_t bytes = 0;
  for (const Value& value : row.values) bytes += value.encoded().size();
  if (row.shape == VXReportingRows::kNoShape || bytes >= kWriteBytes) {
    appendOpening(text_, row);
    text_ += std::to_string(row.count) + "\": ";
    dictionary(row.payload(), 2);
    text_ += "\n }";
    return writeWhenFull();
  }
  const ShapeText& shape = textOf(row);
  text_ += shape.opening;
  char count[Value::kMaxScalarText];
  text_.append(count, std::to_chars(count, std::end(count), row.count).ptr);
  text_ += "\": {";
  appendPrettyEntries(text_, shape.entries, row.values, 3);
  text_ += row.values.empty() ? "}\n }" : "\n  }\n }";
  writeWhenFull();
}

// Up to the count.
void VXReportingSummaryFile::appendOpening(std::string& text, const VXReportingRow& row) {
  text += "{\n  ";
  appendJsonString(text, messageKindName(row.kind.value_or(0), '_') + "_");
  text.pop_back();  // the closing quote
}

const VXReportingSummaryFile::ShapeText& VXReportingSummaryFile::textOf(const VXReportingRow& row) {
  if (row.shape >= shapes_.size()) shapes_.resize(row.shape + std::size_t{1});
  ShapeText& shape = shapes_[row.shape];
  if (!shape.opening.empty()) return shape;
  appendOpening(shape.opening, row);
  for (const std::string_view key : row.keys) {
    std::string& entry = shape.entries.emplace_back(shape.entries.empty() ? "\n   " : ",\n   ");
    appendJsonString(entry, key);
    entry += ": ";
  }
  return shape;
}

std::optional<Error> VXReportingSummaryFile::finish() {
  text_ += "\n]\n";
  write();
  return failed_ ? failed_ : file_.commit();
}

void VXReportingSummaryFile::separate() {
  text_ += first_ ? "[\n " : ",\n ";
  first_ = false;
}

// A large one entry by entry: a summary of millions of values is one dictionary.
void VXReportingSummaryFile::dictionary(const Payload& payload, int indent) {
  if (payload.encoded().size() < kWriteBytes) {
    appendPrettyJson(text_, payload, indent);
    return writeWhenFull();
  }
  const std::string newLine = "\n" + std::string(static_cast<std::size_t>(indent), ' ');
  const char* before = "{";
  for (const auto& [key, value] : payload) {
    text_ += before + newLine + ' ';
    before = ",";
    appendJsonString(text_, key);
    text_ += ": ";
    if (value.isString())
      string(value.asString());
    else
      appendPrettyJson(text_, value, indent + 1);
    writeWhenFull();
  }
  text_ += newLine + '}';
}

void VXReportingSummaryFile::string(std::string_view text) {
  text_ += '"';
  for (; !text.empty(); text.remove_prefix(std::min(text.size(), kWriteBytes))) {
    appendJsonText(text_, text.substr(0, kWriteBytes));
    writeWhenFull();
  }
  text_ += '"';
}

void VXReportingSummaryFile::writeWhenFull() {
  if (text_.size() >= kWriteBytes) write();
}

void VXReportingSummaryFile::write() {
  if (!failed_) failed_ = file_.take(text_);
  text_.clear();
}

}  // namespace vx
