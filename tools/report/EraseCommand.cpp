// Removes what a person asks to have removed.
#include <dirent.h>
#include <sqlite3.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <string>

#include "platform/linux/store/Database.h"
#include "platform/linux/store/Erasure.h"
#include "platform/linux/store/StoreFile.h"
#include "platform/linux/store/StoreSchema.h"
#include "tools/report/Command.h"
#include "tools/report/InspectClient.h"
#include "tools/report/StoreReader.h"

namespace vx::report {

namespace {

std::string folderFrom(const char* variable, const char* fallback) {
  const char* const listed = std::getenv(variable);
  const std::string folder = listed != nullptr ? listed : "";
  const std::string first = folder.substr(0, folder.find(':'));
  return first.empty() ? fallback : first;
}

lnx::ErasureSelection selectionOf(const Options& options) {
  lnx::ErasureSelection which;
  which.application = options.value("--application");
  if (const auto user = options.value("--user")) {
    const int64_t number = numberOf(*user);
    if (number < 0 || number > int64_t{UINT32_MAX}) throw UsageError();
    which.user = static_cast<uint32_t>(number);
  }
  if (const auto before = options.value("--before")) which.before = timeOf(*before);
  if ((which.application ? 1 : 0) + (which.user ? 1 : 0) + (which.before ? 1 : 0) != 1)
    throw UsageError();
  return which;
}

bool isEmptyFolder(const std::string& path) {
  struct Closer {
    void operator()(DIR* open) const { closedir(open); }
  };
  const std::unique_ptr<DIR, Closer> open(opendir(path.c_str()));
  if (open == nullptr) return true;
  while (const dirent* file = readdir(open.get())) {
    const std::string name = file->d_name;
    if (name != "." && name != "..") return false;
  }
  return true;
}

lnx::Erased eraseThrough(InspectClient& client, const lnx::ErasureSelection& which) {
  client.waitForEver();
  const Payload answer = client.call(wire::InspectOperation::Erase, 1, [&](CborWriter& items) {
    items.dictionary(1);
    if (which.application) {
      items.string("application");
      items.string(*which.application);
    } else if (which.user) {
      items.string("user");
      items.unsignedInteger(*which.user);
    } else {
      items.string("before");
      items.date(*which.before);
    }
  });
  if (const auto error = answer.find("error"))
    throw Failure("not erased: " + printable(error->asString()));
  const auto number = [&](const char* key) {
    const auto value = answer.find(key);
    return value ? value->asInt64() : 0;
  };
  return {number("messages"), number("events"), number("power_records"), number("sessions"),
          number("files")};
}

// Nobody serves: as the service would do it.
lnx::Erased eraseDirectly(const lnx::ErasureSelection& which) {
  const std::string state = folderFrom("STATE_DIRECTORY", "/var/lib/vxreporting");
  const std::string path = state + "/telemetry.db";
  if (access(path.c_str(), R_OK | W_OK) != 0)
    throw Failure("cannot write the store " + path + "; be root, or set STATE_DIRECTORY");
  const lnx::StoreLock lock = lnx::lockStore(state);
  if (!lock.fd) {
    throw Failure(lock.heldByAnother
                      ? "the service has the store, but cannot be asked: " + lock.status.text()
                      : lock.status.text());
  }
  // What would come back into the store with the next start.
  for (const std::string& journal :
       {state + "/journal", folderFrom("RUNTIME_DIRECTORY", "/run/vxreporting") + "/journal"}) {
    if (!isEmptyFolder(journal)) {
      throw Failure(journal +
                    " holds what the service has accepted and not stored; start it, and "
                    "erase while it runs");
    }
  }
  sqlite3* opened = nullptr;
  const int code = sqlite3_open_v2(path.c_str(), &opened, SQLITE_OPEN_READWRITE, nullptr);
  const lnx::Database database(opened);
  sqlite3_busy_timeout(opened, 5000);
  Statement version(opened, "PRAGMA user_version");
  if (code != SQLITE_OK || !version.row())
    throw Failure("cannot read the store " + path + ": " + sqlite3_errmsg(opened));
  if (version.integer(0) != lnx::kStoreSchemaVersion)
    throw Failure(path + " is of another version of the service; erase with that one's vxreport");
  version.reset();
  const std::string summaries =
      folderFrom("LOGS_DIRECTORY", "/var/log/vxreporting") + "/Audio/Reporting";
  Result<lnx::Erased> erased =
      lnx::eraseFromStore(opened, which, summaries, static_cast<double>(std::time(nullptr)));
  if (!erased.ok()) throw Failure("not erased: " + erased.status().text());
  return *erased;
}

int erase(const Words& words) {
  const Options options(words, {"--application=", "--user=", "--before="});
  (void)options.words(0, 0);
  const lnx::ErasureSelection which = selectionOf(options);
  std::optional<InspectClient> client = InspectClient::ifThere();
  const lnx::Erased erased = client ? eraseThrough(*client, which) : eraseDirectly(which);
  std::printf(
      "erased: %lld messages, %lld events, %lld power records, %lld sessions, %lld summary "
      "files\n",
      static_cast<long long>(erased.messages), static_cast<long long>(erased.events),
      static_cast<long long>(erased.powerRecords), static_cast<long long>(erased.sessions),
      static_cast<long long>(erased.files));
  return 0;
}

constexpr Command kCommands[] = {
    {"erase", "--application ID|--user UID|--before TIME", "removes what somebody wants removed",
     "From the store and the summary files, for good; the ledger says that it was done. Through\n"
     "the service while it runs, which root alone may ask, else directly. What open sessions hold\n"
     "is written when they end: erase again then.\n\n"
     "  --application ID  of that HostApplicationDisplayID\n"
     "  --user UID        of that user's clients\n"
     "  --before TIME     older than a date and time in UTC (2026-11-22, 2026-11-22T10:30), or\n"
     "                    than so long ago (90m, 24h, 7d)\n" VX_INSPECT_HELP,
     erase},
};

}  // namespace

std::span<const Command> eraseCommands() { return kCommands; }

}  // namespace vx::report
