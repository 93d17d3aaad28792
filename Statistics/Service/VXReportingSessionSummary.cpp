// What a session leaves behind when it stops: the summary event, and on internal builds the summary
// file.
#include <algorithm>
#include <deque>
#include <string_view>
#include <unordered_map>
#include <vector>

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

// A text that grows without ever being moved: in pieces, each larger than the one before up to
// kLargestPiece.
class LongText {
 public:
  // Where to append next; what is there may move on the next call.
  std::string& tail() {
    if (tail_.size() + kSlack > tail_.capacity()) beginPiece();
    return tail_;
  }
  std::vector<std::string_view> pieces() const {
    std::vector<std::string_view> all(sealed_.begin(), sealed_.end());
    all.push_back(tail_);
    return all;
  }

 private:
  static constexpr std::size_t kFirstPiece = 128;
  static constexpr std::size_t kLargestPiece = 64 << 10;
  static constexpr std::size_t kSlack = 64;  // room for most values

  void beginPiece() {
    const std::size_t next = std::clamp(2 * tail_.capacity(), kFirstPiece, kLargestPiece);
    if (!tail_.empty()) sealed_.push_back(std::move(tail_));
    tail_ = std::string();
    tail_.reserve(next);
  }

  std::deque<std::string> sealed_;
  std::string tail_;
};

// The texts found under each key, joined by ",". Messages of one kind tend to hold the same keys in
// the same order, so the group behind the one used last is tried before the index is asked.
class Grouping {
 public:
  void beginDictionary() {
    next_ = first_;
    atFirst_ = true;
  }
  // Where to append the next value of a key.
  std::string& textFor(std::string_view key) {
    if (next_ >= groups_.size() || groups_[next_].key != key) next_ = indexOf(key);
    if (atFirst_) first_ = next_;
    atFirst_ = false;
    Group& group = groups_[next_++];
    std::string& tail = group.text.tail();
    if (group.any) tail += ',';
    group.any = true;
    return tail;
  }
  Payload build() const {
    std::vector<PayloadBuilder::JoinedText> texts;
    texts.reserve(groups_.size());
    for (const Group& group : groups_) texts.push_back({group.key, group.text.pieces()});
    return PayloadBuilder::joined(texts);
  }

 private:
  struct Group {
    std::string key;
    LongText text;
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
    dictionary(payload, 1);
  }
  void namedElement(const std::string& name, const Payload& payload) {
    separate();
    text_ += "{\n  ";
    appendJsonString(text_, name);
    text_ += ": ";
    dictionary(payload, 2);
    text_ += "\n }";
    writeWhenFull();
  }
  std::optional<Error> finish() {
    text_ += "\n]\n";
    write();
    return failed_ ? failed_ : file_.commit();
  }

 private:
  void separate() {
    text_ += first_ ? "[\n " : ",\n ";
    first_ = false;
  }
  // A large one entry by entry: a summary of millions of values is one dictionary.
  void dictionary(const Payload& payload, int indent) {
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
      appendPrettyJson(text_, value, indent + 1);
      writeWhenFull();
    }
    text_ += newLine + '}';
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
