#include <gmock/gmock.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <atomic>
#include <cstring>
#include <deque>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/ipc/SocketListener.h"
#include "tests/ipc/TestInterface.h"
#include "tests/linux/FolderTest.h"
#include "tests/wire/SocketEnd.h"

namespace vx::lnx {
namespace {

// A listener that serves on a thread of its own, in a folder of its own.
class ListenerTest : public FolderTest, public ServiceListenerDelegate {
 protected:
  ~ListenerTest() override { stop(); }

  void serve() {
    machine = std::make_unique<Machine>(options);
    const Status opened = machine->listener.open(folder + "/run");
    ASSERT_TRUE(opened.ok()) << opened.text();
    listening_ = {};
    delegate_ = std::shared_ptr<ServiceListenerDelegate>(this, [](auto*) {});
    machine->listener.setDelegate(delegate_);
    machine->listener.setHooks({.congested =
                                    [this] {
                                      if (!congested) return false;
                                      askedInVain = true;
                                      askedInVain.notify_all();
                                      return true;
                                    },
                                .listening = [this] { listening_.set_value(); },
                                .stopping = [] {}});
    thread_ = std::thread([this] { machine->listener.resume(); });
    listening_.get_future().wait();
  }
  void stop() {
    if (thread_.joinable()) {
      machine->loop.stop();
      thread_.join();
    }
    if (machine) machine->executor.stop(Monotonic::max());
    machine.reset();
  }
  std::string path() const { return folder + "/run/service.socket"; }
  std::unique_ptr<SocketEnd> dial() {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path().c_str(), sizeof address.sun_path - 1);
    EXPECT_EQ(::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    auto client = std::make_unique<SocketEnd>(std::move(socket));
    (void)client->writeSome(frame(0, 1));  // one that is turned away may be gone already
    return client;
  }
  // What the service says next; empty at the end of the stream.
  static std::string next(SocketEnd& client) {
    for (;;) {
      const std::vector<std::string> said = client.texts();
      if (!said.empty()) return said[0].substr(0, 10);
      if (client.ended()) return "";
      client.await();
    }
  }
  // One more client, and how it is greeted.
  std::string greeting() { return next(*clients.emplace_back(dial())); }
  // The oldest client says goodbye and is gone.
  void leave() {
    clients.front()->write(frame(4));
    EXPECT_EQ(next(*clients.front()), "");
    clients.pop_front();
  }

  // ServiceListenerDelegate
  bool listener(ServiceListener&, const std::shared_ptr<ClientConnection>& connection) override {
    if (refusing) return false;
    connection->setExportedInterface(testInterface());
    connection->setExportedObject(object);
    connection->resume();
    return true;
  }

  struct Machine {
    explicit Machine(const ListenerOptions& options) : listener(loop, executor, clock, options) {}
    SystemClock clock;
    Executor executor;
    EventLoop loop{executor, clock};
    SocketListener listener;
  };
  ListenerOptions options;
  std::atomic<bool> congested{false};
  std::atomic<bool> askedInVain{false};
  std::atomic<bool> refusing{false};
  std::shared_ptr<TestObject> object = std::make_shared<TestObject>();
  std::deque<std::unique_ptr<SocketEnd>> clients;
  std::unique_ptr<Machine> machine;

 private:
  std::shared_ptr<ServiceListenerDelegate> delegate_;
  std::promise<void> listening_;
  std::thread thread_;
};

const std::string kWelcome = "0 1 {inter";
const std::string kTooMany = "3 null 6";

TEST_F(ListenerTest, AnybodyMayConnectAndNothingIsLeftBehind) {
  write("run/service.socket", "left behind");
  const mode_t mask = umask(077);
  serve();
  umask(mask);
  struct stat info {};
  ASSERT_EQ(stat(path().c_str(), &info), 0);
  EXPECT_EQ(info.st_mode, S_IFSOCK | 0666U);
  Machine second(options);
  const std::string refusals[][2] = {
      {"/run", "another vxreportingd (pid " + std::to_string(getpid()) + ") serves "},
      {"/none/run", "No such file or directory (set RUNTIME_DIRECTORY"},
      {"/" + std::string(100, 'x'), "longer than the 107 bytes"}};
  for (const auto& [place, why] : refusals)
    EXPECT_THAT(second.listener.open(folder + place).text(), HasSubstr(why));
  second.executor.stop(Monotonic::max());
  EXPECT_EQ(greeting(), kWelcome) << "the first one serves on";
  stop();
  EXPECT_EQ(next(*clients[0]), "4");
  EXPECT_EQ(next(*clients[0]), "");
  EXPECT_FALSE(std::filesystem::exists(path()));
}

TEST_F(ListenerTest, ConnectionsAreLimitedPerUserAndInAll) {
  for (uint32_t ListenerOptions::*limit :
       {&ListenerOptions::maxConnectionsPerUser, &ListenerOptions::maxConnections}) {
    options = {};
    options.*limit = 2;
    serve();
    for (int round = 0; round < 3; ++round) {
      while (clients.size() < 2) EXPECT_EQ(greeting(), kWelcome);
      EXPECT_EQ(greeting(), kTooMany);
      EXPECT_EQ(next(*clients.back()), "");
      clients.pop_back();
      leave();
    }
    refusing = true;
    EXPECT_EQ(greeting(), "") << "turned down by the delegate";
    refusing = false;
    clients.pop_back();
    EXPECT_EQ(greeting(), kWelcome) << "its place is free";
    stop();
    clients.clear();
  }
}

TEST_F(ListenerTest, AClientThatReadsNothingIsCut) {
  options.stalledClientTimeout = std::chrono::milliseconds(30);
  options.maxUnreadReplyBytes = 1000;
  object->list.assign(500000, 1);
  serve();
  EXPECT_EQ(greeting(), kWelcome);
  EXPECT_EQ(greeting(), kWelcome);
  clients[0]->write(frame(1, 1, kList));
  pollfd hungUp{clients[0]->fd(), 0, 0};
  EXPECT_EQ(poll(&hungUp, 1, 20000), 1);
  clients[1]->write(frame(1, 1, kEcho, 1));
  EXPECT_EQ(next(*clients[1]), "2 1 1") << "the other one notices nothing";
}

TEST_F(ListenerTest, ReadingGoesOnWhenTheCongestionEndsOrTheServiceStops) {
  serve();
  for (const bool stopping : {false, true}) {
    congested = true;
    askedInVain = false;
    if (stopping)
      clients[0]->write(frame(1, 1, kEcho, 1) + frame(1, 2, kHold, 2));
    else
      clients.push_back(dial());
    askedInVain.wait(false);
    if (stopping) machine->loop.stop();
    congested = false;
    machine->listener.congestionEnded();
    if (stopping) stop();
    EXPECT_EQ(next(*clients[0]), stopping ? "2 1 1" : kWelcome);
  }
  object->kept.clear();
}

}  // namespace
}  // namespace vx::lnx
