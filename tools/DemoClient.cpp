// vx-demo-client ROLE [SECONDS]: acts out one audio client of a phone for a while: media,
// telephony, setup (which is there to be killed in mid-session), or early, which reports before
// anybody has started a session. vx-demo-haptics is another one in C, demo-alarms in Python.
#include <poll.h>
#include <sys/prctl.h>

#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string>
#include <thread>

#include "client/ReportingClient.h"

namespace {

using vx::PayloadBuilder;
using vx::ReportingClient;
using SteadyClock = std::chrono::steady_clock;

constexpr uint32_t kSessionSetup = 0x08000005;
constexpr uint32_t kSessionPlayback = 0x08000003;
constexpr uint32_t kRouteChange = 0x40000007;
constexpr uint32_t kHalPerformance = 0x2000000A;
constexpr uint16_t kGeneric = 0;
constexpr uint16_t kStart = 1;
constexpr uint16_t kStop = 2;

// A client and what it counted.
class Actor {
 public:
  Actor(std::string role, double seconds)
      : role_(std::move(role)),
        end_(SteadyClock::now() + std::chrono::duration_cast<SteadyClock::duration>(
                                      std::chrono::duration<double>(seconds))) {}

  bool connect() {
    const vx::ClientStatus status = client_.connect();
    if (!status.ok()) std::fprintf(stderr, "%s: %s\n", role_.c_str(), status.text.c_str());
    return status.ok();
  }
  ReportingClient& client() { return client_; }
  bool goesOn() const { return client_.isConnected() && SteadyClock::now() < end_; }

  void begin(int64_t reporter, uint16_t serviceType, const std::string& application) {
    check(client_.createReportingSession(reporter).status);
    check(client_.setServiceType(serviceType, reporter).status);
    check(client_
              .setConfiguration(
                  PayloadBuilder().set("HostApplicationDisplayID", application).build(), reporter)
              .status);
    check(client_.startReportingSession(
        reporter, [this](const auto& ended) { sessionsEnded_ += ended.ok() ? 1 : 0; }));
  }
  void end(int64_t reporter) { check(client_.stopReportingSession(reporter).status); }

  void send(const PayloadBuilder& message, uint32_t category, uint16_t type,
            const std::vector<int64_t>& reporters) {
    ++sent_;
    check(client_.sendMessageAsync(message.build(), category, type, reporters, counted()));
  }
  void sendToAll(const PayloadBuilder& message, uint32_t category, uint16_t type) {
    ++sent_;
    check(client_.sendMessageAsync(message.build(), category, type, counted()));
  }
  // Serves the connection for a while.
  void pass(std::chrono::milliseconds time) {
    const auto until = SteadyClock::now() + time;
    for (;;) {
      client_.process();
      const auto left =
          std::chrono::ceil<std::chrono::milliseconds>(until - SteadyClock::now()).count();
      if (left <= 0 || !client_.isConnected()) return;
      pollfd ready{client_.fd(), static_cast<short>(POLLIN | (client_.wantsWrite() ? POLLOUT : 0)),
                   0};
      poll(&ready, 1, static_cast<int>(left));
    }
  }
  int finish() {
    check(client_.goodbye());
    std::printf(
        "%-10s sent %d messages: %d taken, %d refused while reporting was off; %d sessions ended "
        "in order\n",
        role_.c_str(), sent_, taken_, refused_, sessionsEnded_);
    return failed_ || sent_ != taken_ + refused_ ? 1 : 0;
  }

 private:
  ReportingClient::Callback<ReportingClient::Done> counted() {
    return [this](const auto& result) {
      if (result.ok())
        ++taken_;
      else if (result.status.code == vx::ClientStatus::Code::ReportingError)
        ++refused_;
      else
        check(result.status);
    };
  }
  void check(const vx::ClientStatus& status) {
    if (status.ok()) return;
    // The daemon closes after a goodbye: the end that was asked for.
    if (status.code == vx::ClientStatus::Code::Disconnected &&
        status.text.find("closed") != std::string::npos)
      return;
    std::fprintf(stderr, "%s: %s\n", role_.c_str(), status.text.c_str());
    failed_ = true;
  }

  const std::string role_;
  const SteadyClock::time_point end_;
  ReportingClient client_;
  int sent_ = 0;
  int taken_ = 0;
  int refused_ = 0;
  int sessionsEnded_ = 0;
  bool failed_ = false;
};

void playMedia(Actor& actor) {
  actor.begin(1001, 7, "com.example.music");
  actor.begin(1002, 8, "com.example.clips");
  actor.send(PayloadBuilder()
                 .set("sample rate", 48000)
                 .set("channels", 2)
                 .set("spatial", true)
                 .set("codec", "aac"),
             kSessionSetup, kStart, {1001});
  for (int i = 0; actor.goesOn(); ++i) {
    actor.send(PayloadBuilder()
                   .set("frames_rendered", 48000 * i)
                   .set("gain", 0.5 + 0.4 * std::sin(i / 5.0))
                   .set("buffer_underruns", i / 10)
                   .set("muted", false),
               kSessionPlayback, kGeneric, {1001});
    if (i % 8 == 3) {
      actor.send(PayloadBuilder()
                     .set("from", i % 16 == 3 ? "Speaker" : "Headphones")
                     .set("reason", "plugged"),
                 kRouteChange, kGeneric, {1001, 1002});
    }
    actor.pass(std::chrono::milliseconds(120));
  }
  actor.end(1001);
  actor.end(1002);
}

void makeCalls(Actor& actor) {
  actor.begin(2001, 2, "com.example.phone");
  actor.send(PayloadBuilder()
                 .set("mode", "VoiceChat")
                 .set("sample rate", 16000)
                 .set("echo_cancelled", true),
             kSessionSetup, kStart, {2001});
  for (int i = 0; actor.goesOn(); ++i) {
    actor.send(PayloadBuilder()
                   .set("uplink_level", -20.0 - i % 7)
                   .set("packets_lost", i / 6)
                   .set("jitter_ms", 3 + i % 4),
               kHalPerformance, kGeneric, {2001});
    if (i % 10 == 5) {  // everybody who has a session started learns of it
      actor.sendToAll(PayloadBuilder().set("event", "volume").set("Volume", 0.1 * (i % 10)),
                      0x0800000B, kGeneric);
    }
    actor.pass(std::chrono::milliseconds(200));
  }
  actor.send(PayloadBuilder().set("ended_by", "remote"), kSessionSetup, kStop, {2001});
  actor.end(2001);
}

// Holds a started session until it is killed.
void setUp(Actor& actor) {
  actor.begin(5001, 6, "com.example.setup");
  actor.send(PayloadBuilder().set("route", "Dock").set("tuned", true), kSessionSetup, kStart,
             {5001});
  while (actor.goesOn()) actor.pass(std::chrono::milliseconds(100));
}

// A message that no session is there to take.
void reportEarly(Actor& actor) {
  actor.sendToAll(PayloadBuilder().set("boot_sound", true).set("volume", 0.3), kSessionPlayback,
                  kStart);
  actor.pass(std::chrono::milliseconds(50));
}

const std::map<std::string, void (*)(Actor&)> kRoles = {
    {"media", playMedia}, {"telephony", makeCalls}, {"setup", setUp}, {"early", reportEarly}};

}  // namespace

int main(int argc, char** argv) {
  const auto role = kRoles.find(argc > 1 ? argv[1] : "");
  if (role == kRoles.end()) {
    std::fprintf(stderr, "usage: vx-demo-client media|telephony|setup|early [SECONDS]\n");
    return 2;
  }
  prctl(PR_SET_NAME, ("demo-" + role->first).c_str());  // the name the service knows it by
  Actor actor(role->first, argc > 2 ? std::atof(argv[2]) : 8.0);
  if (!actor.connect()) return 1;
  role->second(actor);
  return actor.finish();
}
