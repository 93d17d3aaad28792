#include "Statistics/Service/VXReportingSummaryFile.h"

#include <algorithm>

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

void VXReportingSummaryFile::namedElement(const std::string& name, const Payload& payload) {
  separate();
  text_ += "{\n  ";
  appendJsonString(text_, name);
  text_ += ": ";
  dictionary(payload, 2);
  text_ += "\n }";
  writeWhenFull();
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
