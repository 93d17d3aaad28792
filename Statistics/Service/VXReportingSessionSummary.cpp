// What a session leaves behind when it stops: the summary event, and on internal builds the summary
// file.
#include <algorithm>
#include <deque>
#include <memory>
#include <stdexcept>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "Statistics/Service/VXReportingSession.h"
#include "platform/Log.h"
#include "propertylist/FileNames.h"
#include "propertylist/JsonWriter.h"

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
  // Room for `count` characters behind what is there; wrote() says where they end.
  char* room(std::size_t count) {
    if (count > static_cast<std::size_t>(end_ - at_)) beginPiece(count);
    return at_;
  }
  void wrote(char* end) { at_ = end; }
  std::vector<std::string_view> pieces() const {
    std::vector<std::string_view> all;
    all.reserve(pieces_.size());
    for (const Piece& piece : pieces_) all.emplace_back(piece.text.get(), piece.size);
    if (!all.empty())
      all.back() = {all.back().data(), static_cast<std::size_t>(at_ - all.back().data())};
    return all;
  }

 private:
  static constexpr std::size_t kFirstPiece = 128;
  static constexpr std::size_t kLargestPiece = 64 << 10;
  struct Piece {
    std::unique_ptr<char[]> text;
    std::size_t size;  // room; of all but the last, what is used of it
  };

  void beginPiece(std::size_t count) {
    std::size_t next = kFirstPiece;
    if (!pieces_.empty()) {
      Piece& last = pieces_.back();
      next = std::min(2 * last.size, kLargestPiece);
      last.size = static_cast<std::size_t>(at_ - last.text.get());
    }
    next = std::max(next, count);
    pieces_.push_back({std::unique_ptr<char[]>(new char[next]), next});
    at_ = pieces_.back().text.get();
    end_ = at_ + next;
  }

  std::vector<Piece> pieces_;
  char* at_ = nullptr;
  char* end_ = nullptr;
};

// The texts found under each key, joined by ",". Messages of one kind tend to hold the same keys in
// the same order, so the group behind the one used last is tried before the index is asked.
class Grouping {
 public:
  void beginDictionary() {
    next_ = first_;
    atFirst_ = true;
  }
  void add(std::string_view key, const Value& value) {
    if (next_ >= groups_.size() || groups_[next_].key != key) next_ = indexOf(key);
    if (atFirst_) first_ = next_;
    atFirst_ = false;
    Group& group = groups_[next_++];
    switch (value.kind()) {
      case ValueKind::String:
        return append(group, value.asString());
      case ValueKind::Array:
      case ValueKind::Dictionary:
        return append(group, value.text());
      default:
        break;
    }
    char* out = begin(group, Value::kMaxScalarText);
    group.text.wrote(value.writeScalarText(out));
  }
  void add(std::string_view key, std::string_view text) { append(groups_[indexOf(key)], text); }
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
  // Where a value of at most `count` characters goes, behind the comma that parts it from the one
  // before.
  static char* begin(Group& group, std::size_t count) {
    char* out = group.text.room(count + 1);
    if (group.any) *out++ = ',';
    group.any = true;
    return out;
  }
  static void append(Group& group, std::string_view text) {
    char* const out = begin(group, text.size());
    group.text.wrote(std::copy(text.begin(), text.end(), out));
  }
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
      if (value.isString())
        string(value.asString());
      else
        appendPrettyJson(text_, value, indent + 1);
      writeWhenFull();
    }
    text_ += newLine + '}';
  }
  void string(std::string_view text) {
    text_ += '"';
    for (; !text.empty(); text.remove_prefix(std::min(text.size(), kWriteBytes))) {
      appendJsonText(text_, text.substr(0, kWriteBytes));
      writeWhenFull();
    }
    text_ += '"';
  }
  void writeWhenFull() {
    if (text_.size() >= kWriteBytes) write();
  }
  void write() {
    if (!failed_) failed_ = file_.take(text_);
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
  groups.add(kSummaryEventKey, std::to_string(serviceType()));
  aggregatedPayloadData_.forEach([&](const Payload& payload) {
    groups.beginDictionary();
    for (const auto& [key, value] : payload) groups.add(key, value);
  });
  try {
    return groups.build();
  } catch (const std::length_error& tooLarge) {
    VX_LOG(sessionLogScope(), Error, "no summary event for reporter %lli: %s",
           static_cast<long long>(reporterID_), tooLarge.what());
    return std::nullopt;
  }
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
