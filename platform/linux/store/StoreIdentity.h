// Whether what is written still lies at the store's path.
#pragma once

#include <sqlite3.h>
#include <sys/stat.h>

#include <cstdint>
#include <string>

namespace vx::lnx {

// What can happen to a store's files under the service.
enum class StoreLoss : uint8_t {
  None,
  FileGone,     // deleted, or another one is in its place
  FileShorter,  // it or its log has lost its end
  LogGone,      // the log alone was deleted
};
const char* textOf(StoreLoss loss);

// Owned by the store's writer and confined to its thread. Two calls of stat(2) a look: cheap beside
// a commit.
class StoreIdentity {
 public:
  StoreIdentity(std::string path, sqlite3* database);
  // After what the writer itself did: its log may have become shorter, and the file if it was made
  // so.
  enum class Shrunk : uint8_t { No, Yes };
  void remember(Shrunk shrunk);
  // Before a commit.
  StoreLoss look() const;
  // As of the last look of remember().
  uint64_t fileBytes() const { return static_cast<uint64_t>(file_.bytes); }
  uint64_t logBytes() const { return static_cast<uint64_t>(log_.bytes); }
  // Right after one, whose checkpoint may have made the files shorter.
  StoreLoss lookForOthers() const;

 private:
  struct File {
    explicit File(const std::string& path);
    bool known = false;  // false: there is none, or it cannot be told
    bool gone = false;
    dev_t device = 0;
    ino_t number = 0;
    off_t bytes = 0;
    bool isOther(const File& now) const {
      return known && (now.gone || (now.known && (device != now.device || number != now.number)));
    }
  };
  StoreLoss compare(const File& file, const File& log) const;

  const std::string path_;
  const std::string logPath_;
  sqlite3* const database_;
  File file_;
  File log_;
};

}  // namespace vx::lnx
