#include <poll.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cstring>
#include <deque>

#include "platform/linux/ipc/SocketListener.h"
#include "tests/ipc/IpcTest.h"

namespace vx::lnx {
namespace {

const std::string kWelcome = "0 1 {inter";
const std::string kTooMany = "3 null 6";

class ListenerTest : public IpcTest, public ServiceListenerDelegate {
 protected:
  // From opening to the end of the service, with the script in between.
  template <class Script>
  void serve(const Script& script) {
    listener_ = std::make_unique<SocketListener>(loop_, executor_, clock_, options);
    const Status opened = listener_->open(folder + "/run");
    ASSERT_TRUE(opened.ok()) << opened.text();
    const std::shared_ptr<ServiceListenerDelegate> delegate(this, [](auto*) {});
    listener_->setDelegate(delegate);
    const auto queue = executor_.makeSerial("stop", QualityOfService::UserInteractive);
    listener_->setHooks({.congested = [this](uid_t) { return congested; },
                         .listening =
                             [&] {
                               script();
                               queue->async([this] { loop_.stop(); });
                             },
                         .stopping = [] {}});
    listener_->resume();
  }
  // One more client, and how it is greeted.
  std::string dial() {
    connect();
    return heard(clients.back());
  }
  void connect() {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path().c_str(), sizeof address.sun_path - 1);
    EXPECT_EQ(::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    clients.emplace_back(std::move(socket)).write(frame(0, 1));
  }
  std::string heard(SocketEnd& client) {
    run();
    const std::vector<std::string> said = client.texts();
    return said.empty() ? client.ended() ? "end" : "" : said[0].substr(0, 10);
  }
  std::string path() const { return folder + "/run/service.socket"; }

  // ServiceListenerDelegate
  bool listener(ServiceListener&, const std::shared_ptr<ClientConnection>& connection) override {
    if (refusing) return false;
    connection->setExportedInterface(testInterface());
    connection->setExportedObject(object);
    connection->resume();
    return true;
  }

  // At most two of them at a time.
  void fillUp() {
    serve([&] {
      for (int round = 0; round < 3; ++round) {
        while (clients.size() < 2) EXPECT_EQ(dial(), kWelcome);
        EXPECT_EQ(dial(), kTooMany);
        EXPECT_TRUE(clients.back().ended());
        clients.pop_back();
        clients.front().write(frame(4));
        EXPECT_EQ(heard(clients.front()), "end");
        clients.pop_front();
      }
      refusing = true;
      EXPECT_EQ(dial(), "end") << "turned down by the delegate";
      refusing = false;
      EXPECT_EQ(dial(), kWelcome) << "its place is free";
    });
  }

  bool refusing = false;
  std::deque<SocketEnd> clients;
  std::unique_ptr<SocketListener> listener_;
};

TEST_F(ListenerTest, AnybodyMayConnectAndNothingIsLeftBehind) {
  write("run/service.socket", "left behind");
  write("run/service.lock", "1234567890123");  // more than a pid has
  SocketListener second(loop_, executor_, clock_, options);
  const std::string refusals[][2] = {
      {"/run", "another vxreportingd (pid " + std::to_string(getpid()) + ") serves "},
      {"/none/run", "No such file or directory (set RUNTIME_DIRECTORY"},
      {"/" + std::string(100, 'x'), "longer than the 107 bytes"}};
  const mode_t mask = umask(077);
  serve([&] {
    struct stat info {};
    ASSERT_EQ(stat(path().c_str(), &info), 0);
    EXPECT_EQ(info.st_mode, S_IFSOCK | 0666U);
    ASSERT_EQ(stat((folder + "/run/service.lock").c_str(), &info), 0);
    EXPECT_EQ(info.st_mode, S_IFREG | 0600U) << "nobody else can hold it";
    for (const auto& [place, why] : refusals)
      EXPECT_THAT(second.open(folder + place).text(), HasSubstr(why));
    EXPECT_EQ(dial(), kWelcome) << "the first one serves on";
  });
  umask(mask);
  EXPECT_EQ(heard(clients[0]), "4");
  EXPECT_TRUE(clients[0].ended());
  EXPECT_FALSE(std::filesystem::exists(path()));
  if (chown((folder + "/run/service.lock").c_str(), 1, 0) == 0) {
    EXPECT_THAT(second.open(folder + "/run").text(), HasSubstr("service.lock belongs to user 1"));
  }
}

TEST_F(ListenerTest, ConnectionsOfOneUserAreLimited) {
  options.maxConnectionsPerUser = 2;
  fillUp();
}
TEST_F(ListenerTest, ConnectionsInAllAreLimited) {
  options.maxConnections = 2;
  fillUp();
}

TEST_F(ListenerTest, WithoutADescriptorToSpareAcceptingWaits) {
#ifdef __SANITIZE_ADDRESS__
  GTEST_SKIP() << "the checks of this build need descriptors themselves";
#endif
  serve([&] {
    connect();
    rlimit before{};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
    const rlimit none{3, before.rlim_max};
    setrlimit(RLIMIT_NOFILE, &none);
    run();
    setrlimit(RLIMIT_NOFILE, &before);
    EXPECT_LE(listener_->counters().descriptorExhaustions, 2U);
    std::string greeting;
    runUntil([&] { return !(greeting = heard(clients[0])).empty(); });
    EXPECT_EQ(greeting, kWelcome);
  });
}

TEST_F(ListenerTest, AClientThatReadsNothingIsCut) {
  options.stalledClientTimeout = std::chrono::milliseconds(30);
  object->list.assign(500000, 1);
  serve([&] {
    EXPECT_EQ(dial(), kWelcome);
    EXPECT_EQ(dial(), kWelcome);
    clients[0].write(frame(1, 1, kList));
    pollfd hungUp{clients[0].fd(), 0, 0};
    runUntil([&] { return poll(&hungUp, 1, 0) == 1; });
    clients[1].write(frame(1, 1, kEcho, 1));
    EXPECT_EQ(heard(clients[1]), "2 1 1") << "the other one notices nothing";
  });
}

TEST_F(ListenerTest, ReadingGoesOnWhenTheCongestionEndsOrTheServiceStops) {
  serve([&] {
    congested = true;
    EXPECT_EQ(dial(), "");
    congested = false;
    listener_->congestionEnded();
    EXPECT_EQ(heard(clients[0]), kWelcome);
    accounts_.setResumedHandler([this] { listener_->congestionEnded(); });
    const UserIndex user = accounts_.enter(getuid()).value();
    const std::size_t tooMuch = MemoryLimits().maxUserWaitingBytes + 1;
    accounts_.add(user, MemoryKind::Waiting, tooMuch);
    clients[0].write(frame(1, 3, kEcho, 3));
    EXPECT_EQ(heard(clients[0]), "");
    accounts_.remove(user, MemoryKind::Waiting, tooMuch);
    EXPECT_EQ(heard(clients[0]), "2 3 1");
    congested = true;
    clients[0].write(frame(1, 1, kEcho, 1) + frame(1, 2, kHold, 2));
    EXPECT_EQ(heard(clients[0]), "");
    congested = false;
  });
  EXPECT_EQ(heard(clients[0]), "2 1 1");
  object->kept.clear();
}

}  // namespace
}  // namespace vx::lnx
