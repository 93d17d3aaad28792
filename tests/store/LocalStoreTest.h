// The store as a whole, on its own thread and the machine's clock.
#pragma once

#include <future>
#include <thread>

#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/store/LocalStore.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {

class LocalStoreTest : public StoreTest {
 protected:
  LocalStoreTest() { options.commit.interval = 1h; }
  Result<std::unique_ptr<LocalStore>> tryOpen(const std::optional<JournalEpoch>& epoch = {}) {
    return LocalStore::open(folder, options, clock, epoch);
  }
  void open(const std::optional<JournalEpoch>& epoch = {}) {
    store = std::move(*tryOpen(epoch));
    store->setEndWord([](const JournalTicket& call) -> std::string_view {
      return call.kind() == 1 ? "stopped" : "";
    });
    store->start();
  }
  bool close(std::chrono::seconds within = 60s) { return store->close(clock.monotonic() + within); }
  void reopen() {
    EXPECT_TRUE(close());
    store.reset();
    open();
  }
  std::unique_ptr<RelayBackend::Session> session(int64_t id = 1) {
    return store->relayBackend().open(sessionInfo(id), userInfo());
  }
  void power(int i, const std::string& name = "n") {
    store->logRegisteredEvent(28, name, numbered(i), nullptr);
  }
  // Told when everything before it is committed, or the error that prevents it.
  std::future<std::optional<Error>> flush() {
    auto told = std::make_shared<std::promise<std::optional<Error>>>();
    if (relay == nullptr) relay = session();
    relay->flush([told](std::optional<Error> error) { told->set_value(std::move(error)); });
    return told->get_future();
  }
  std::string file(const std::string& suffix = "") { return folder + "/telemetry.db" + suffix; }
  uintmax_t storeBytes() {
    std::error_code none;
    const uintmax_t log = std::filesystem::file_size(file("-wal"), none);
    return std::filesystem::file_size(file()) + (none ? 0 : log);
  }
  // Makes the rows of a table impossible to write, from outside, until refuse() of none.
  void refuse(const std::string& table) {
    query("DROP TRIGGER IF EXISTS refuse");
    if (!table.empty())
      query("CREATE TRIGGER refuse BEFORE INSERT ON " + table +
            " BEGIN SELECT RAISE(FAIL, 'no'); END");
  }
  static void waitUntil(const std::function<bool()>& condition) {
    while (!condition()) std::this_thread::yield();
  }

  SystemClock clock;
  StoreOptions options;
  std::unique_ptr<LocalStore> store;
  std::unique_ptr<RelayBackend::Session> relay;
};

}  // namespace vx::lnx
