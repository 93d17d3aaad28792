// A journal in a folder of the test's own, in memory where there is such a file system.
#pragma once

#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "platform/linux/journal/Journal.h"
#include "platform/linux/journal/JournalReader.h"

namespace vx::lnx {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;
using Bytes = std::vector<uint8_t>;

inline constexpr JournalEpoch kEpoch{1, 2, 3};

class JournalFixture : public ::testing::Test {
 protected:
  JournalFixture() {
    root = std::filesystem::exists("/dev/shm") ? "/dev/shm/vxtest-XXXXXX" : "/tmp/vxtest-XXXXXX";
    root = mkdtemp(root.data());
    options.folder = root + "/journal";
    options.epoch = kEpoch;
  }
  ~JournalFixture() override { std::filesystem::remove_all(root); }

  void open() {
    journal.reset();
    complaints.clear();
    auto result = Journal::open(options, &complaints);
    ASSERT_TRUE(result.ok()) << result.status().text();
    journal = std::move(result).value();
  }
  static Payload dictionary(int64_t number, std::size_t bytes = 0) {
    return PayloadBuilder().set("n", number).set("text", std::string(bytes, 't')).build();
  }
  Result<JournalAppended> append(uint8_t kind, const Payload& payload, Bytes head = {}) {
    return journal->append({kind, 1.5, 7, head, payload.validated()});
  }
  void appendDone(uint8_t kind) { EXPECT_TRUE(append(kind, dictionary(kind)).ok()); }
  JournalContents read() {
    auto contents = JournalReader::read(options.folder, kEpoch);
    EXPECT_TRUE(contents.ok()) << contents.status().text();
    return contents.ok() ? std::move(contents).value() : JournalContents{};
  }
  // The kinds of what is read: 1s for a snapshot's, 1d for a done call, 1b before the snapshot.
  std::string readKinds() {
    std::string text;
    for (const JournalContents::Record& record : read().records) {
      text += (text.empty() ? "" : " ") + std::to_string(record.kind);
      text += record.type == EntryType::Snapshot ? "s" : "";
      text += record.done && record.type == EntryType::Call ? "d" : "";
      text += record.beforeSnapshot ? "b" : "";
    }
    return text;
  }
  std::vector<std::string> files() const {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(options.folder))
      names.push_back(entry.path().filename());
    std::ranges::sort(names);
    return names;
  }
  std::string onlySegment() const { return options.folder + "/" + files().at(0); }
  static Bytes bytesOf(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return Bytes((std::istreambuf_iterator<char>(in)), {});
  }

  std::string root;
  JournalOptions options;
  std::vector<std::string> complaints;
  std::unique_ptr<Journal> journal;
};

}  // namespace vx::lnx
