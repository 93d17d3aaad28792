// What a session leaves behind when it stops: the summary event, and on internal builds the summary
// file.
#include <deque>
#include <string_view>
#include <unordered_map>

#include "Statistics/Service/VXReportingSession.h"
#include "platform/FileNames.h"
#include "platform/JsonWriter.h"
#include "platform/Log.h"

namespace vx {

namespace {

constexpr std::string_view kSummaryEventKey = "VX_Session_Summary_Event";
constexpr const char* kReportingSubdirectory = "/Audio/Reporting";
constexpr const char* kDateFormat = "%Y%m%d-%H%M%S%z";
constexpr unsigned kDirectoryMode = 0777;
constexpr std::size_t kWriteBytes = 64 << 10;

// The texts found under each key, joined by ",". Messages of one kind tend to hold the same keys in
// the same order, so the group behind the one used last is tried before the index is asked.
class Grouping {
 public:
  void beginDictionary() {
    next_ = first_;
    atFirst_ = true;
  }
  std::string& textFor(std::string_view key) {
    if (next_ >= groups_.size() || groups_[next_].key != key) next_ = indexOf(key);
    if (atFirst_) first_ = next_;
    atFirst_ = false;
    Group& group = groups_[next_++];
    if (group.any) group.text += ',';
    group.any = true;
    return group.text;
  }
  Payload build() const {
    PayloadBuilder event;
    for (const Group& group : groups_) event.set(group.key, group.text);
    return event.build();
  }

 private:
  struct Group {
    std::string key;
    std::string text;
    bool any = false;
  };
  std::size_t indexOf(std::string_view key) {
    const auto found = index_.find(key);
    if (found != index_.end()) return found->second;
    Group& group = groups_.emplace_back();
    group.key = key;
    index_.emplace(group.key, groups_.size() - 1);  // a deque never moves its elements
    return groups_.size() - 1;
  }

  std::deque<Group> groups_;
  std::unordered_map<std::string_view, std::size_t> index_;
  std::size_t next_ = 0;
  std::size_t first_ = 0;
  bool atFirst_ = false;
};

// Writes one array element after the other, in pieces of 64 KiB: a session of a million messages
// never has its text in memory.
class ArrayFileWriter {
 public:
  explicit ArrayFileWriter(AtomicFile& file) : file_(file) {}
  void element(const Payload& payload) {
    separate();
    appendPrettyJson(text_, payload, 1);
    writeWhenFull();
  }
  void namedElement(const std::string& name, const Payload& payload) {
    separate();
    text_ += "{\n    ";
    appendJsonString(text_, name);
    text_ += ": ";
    appendPrettyJson(text_, payload, 2);
    text_ += "\n  }";
    writeWhenFull();
  }
  std::optional<Error> finish() {
    text_ += "\n]\n";
    write();
    return failed_ ? failed_ : file_.commit();
  }

 private:
  void separate() {
    text_ += first_ ? "[\n  " : ",\n  ";
    first_ = false;
  }
  void writeWhenFull() {
    if (text_.size() >= kWriteBytes) write();
  }
  void write() {
    if (!failed_) failed_ = file_.write(text_);
    text_.clear();
  }

  AtomicFile& file_;
  std::string text_;
  std::optional<Error> failed_;
  bool first_ = true;
};

}  // namespace

std::optional<Payload> VXReportingSession::createSummaryEventForSession() const {
  if (aggregatedPayloadData_.size() == 0) return std::nullopt;
  Grouping groups;
  // A payload that holds this key too appends to the service type: nothing prevents it.
  groups.textFor(kSummaryEventKey) += std::to_string(serviceType());
  aggregatedPayloadData_.forEach([&](const Payload& payload) {
    groups.beginDictionary();
    for (const auto& [key, value] : payload) value.appendText(groups.textFor(key));
  });
  return groups.build();
}

void VXReportingSession::writeSummaryJson() {
  if (!VXReportingIsInternalBuild()) return;
  if (!nestedAggregatedPayloadData_.isPresent() || nestedAggregatedPayloadData_.size() == 0) return;
  const Payload information = userInfo_->snapshot();
  nestedAggregatedPayloadData_.insertAtFront(information);

  std::optional<Error> unserialisable;
  auto check = [&](const Payload& payload) {
    if (!unserialisable) unserialisable = checkJson(payload);
  };
  nestedAggregatedPayloadData_.forEach(
      check, [&](const VXReportingNestedEntry& entry) { check(entry.payload); });
  if (unserialisable) {
    VX_LOG(sessionLogScope(), Error, "dataWithJSONObject: %s",
           unserialisable->description().c_str());
  }

  DiagnosticFiles& files = platform().diagnosticFiles;
  const std::string date = platform().clock.formatLocal(platform().clock.now(), kDateFormat);
  const std::string directory = files.logsDirectory() + kReportingSubdirectory;
  if (const std::optional<Error> error = files.createDirectory(directory, kDirectoryMode)) {
    VX_LOG(sessionLogScope(), Error, "can't create logging directory at %s: %s", directory.c_str(),
           error->description().c_str());
  }
  if (unserialisable) return;  // there is no text to write, and nothing more is said

  // An identifier comes from a client: whatever it holds, it stays one component of the name.
  const std::optional<Value> application = information.find(kHostApplicationDisplayIDKey);
  const std::string name = date + "-sonik-" +
                           encodeFileNameComponent(application ? application->text() : "unknown") +
                           "-" + std::string(VXReportingServiceTypeName(serviceType())) + ".json";
  std::optional<Error> error;
  if (const std::unique_ptr<AtomicFile> file = files.createAtomically(directory, name, error)) {
    ArrayFileWriter writer(*file);
    nestedAggregatedPayloadData_.forEach(
        [&](const Payload& header) { writer.element(header); },
        [&](const VXReportingNestedEntry& entry) {
          writer.namedElement(identifierText(static_cast<MessageKind>(entry.kind), entry.count),
                              entry.payload);
        });
    error = writer.finish();
  }
  if (error)
    VX_LOG(sessionLogScope(), Error, "jsonOutput writeToURL: %s", error->description().c_str());
}

}  // namespace vx
