// Whatever an older store's file holds: opening it makes a store that can be written and read, or
// says that it is not one; what can be read of it goes into a fresh one.
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <string>

#include "platform/linux/store/Salvage.h"
#include "platform/linux/store/StoreFile.h"
#include "platform/linux/store/StoreViews.h"

static void readAll(sqlite3* database, const std::string& sql) {
  vx::lnx::Statement read(database, sql);
  if (read.code() == SQLITE_ERROR) __builtin_trap();  // a table or column is missing
  for (int rows = 0; rows < 1000 && read.row(); ++rows) {
  }
  if (read.code() == SQLITE_ERROR) __builtin_trap();  // a row fails the whole query
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const std::string path = [] {
    std::string folder = "/dev/shm/vxfuzz-XXXXXX";
    if (mkdtemp(folder.data()) == nullptr) std::abort();
    return folder + "/telemetry.db";
  }();
  for (const char* suffix : {"", "-wal", "-shm"}) unlink((path + suffix).c_str());
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
  vx::lnx::OpenedStore opened = vx::lnx::openStoreDatabase(path, {1});
  if (opened.status.ok()) {
    readAll(opened.database.get(), "PRAGMA quick_check");
    for (const vx::lnx::StoreView& view : vx::lnx::storeViews())
      readAll(opened.database.get(), std::string("SELECT * FROM ") + view.name);
  }
  opened.database.reset();
  const vx::lnx::OpenedStore fresh = vx::lnx::openStoreDatabase(":memory:", {2});
  (void)vx::lnx::takeOverRows(path, fresh.database.get());
  if (!fresh.status.ok() || !vx::lnx::quickCheck(fresh.database.get()).status.ok())
    __builtin_trap();
  return 0;
}
