// The JSON text of a session's summary file.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Statistics/Service/VXReportingRowReader.h"
#include "Statistics/VXReportingUtility.h"
#include "base/Error.h"
#include "platform/DiagnosticFiles.h"

namespace vx {

// Writes a pretty-printed array, one element after the other, in pieces of 64 KiB: the text of a
// session of a million messages is never in memory as a whole. Lives for one stop of a session, on
// the service queue.
class VXReportingSummaryFile {
 public:
  // "<date>-sonik-<application>-<service type>.json". Whatever the application's identifier holds,
  // it stays one component of the name: it comes from a client.
  static std::string name(const std::string& date, const std::optional<Value>& application,
                          ServiceType serviceType);

  explicit VXReportingSummaryFile(AtomicFile& file) : file_(file) {}
  void element(const Payload& payload);
  // A dictionary of one entry, under the message's identifier.
  void message(const VXReportingRow& row);
  // Puts the file in its place, or tells of the first write that failed.
  std::optional<Error> finish();

 private:
  // What the messages of a shape have in common.
  struct ShapeText {
    std::string opening;
    std::vector<std::string> entries;
  };
  static void appendOpening(std::string& text, const VXReportingRow& row);
  const ShapeText& textOf(const VXReportingRow& row);
  void separate();
  void dictionary(const Payload& payload, int indent);
  void string(std::string_view text);
  void writeWhenFull();
  void write();

  AtomicFile& file_;
  std::string text_;
  std::vector<ShapeText> shapes_;
  std::optional<Error> failed_;
  bool first_ = true;
};

}  // namespace vx
