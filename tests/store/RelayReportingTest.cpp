#include "platform/linux/RelayReporting.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

class FakeBackend final : public RelayBackend {
 public:
  explicit FakeBackend(std::string_view name) : name_(name) {}
  std::string_view name() const override { return name_; }
  std::unique_ptr<Session> open(const VyrSessionInfo&, const Payload&) override {
    struct FakeSession final : Session {
      explicit FakeSession(FakeBackend& owner) : backend(owner) {}
      std::optional<Error> send(uint16_t category, uint16_t type, const Payload&) override {
        backend.calls.push_back("send " + std::to_string(category) + " " + std::to_string(type));
        return backend.refusal;
      }
      void flush(Function<void(std::optional<Error>)> handler) override {
        backend.flushes.push_back(std::move(handler));
      }
      FakeBackend& backend;
    };
    calls.emplace_back("open");
    return std::make_unique<FakeSession>(*this);
  }
  std::optional<Error> sendOne(const VyrSessionInfo&, const Payload&, uint16_t, uint16_t type,
                               const Payload&) override {
    calls.push_back("one " + std::to_string(type));
    return refusal;
  }
  std::vector<std::string> calls;
  std::optional<Error> refusal;
  std::vector<Function<void(std::optional<Error>)>> flushes;

 private:
  const std::string_view name_;
};

class RelayReportingTest : public StoreTest {
 protected:
  void use(std::vector<RelayBackend*> backends) {
    relay.emplace(std::move(backends),
                  [this](Function<void()> job) { jobs.push_back(std::move(job)); });
    session = relay->initWithSessionInfo(sessionInfo(42), userInfo(), {});
  }
  bool sendOne() {
    return relay->sendOneMessageWithSessionInfo({}, Payload(), 1, 2, Payload(), error);
  }
  FakeBackend a{"a"};
  FakeBackend b{"b"};
  std::vector<Function<void()>> jobs;
  std::optional<RelayReporting> relay;
  std::shared_ptr<VyrReportingSession> session;
  std::optional<Error> error;
};

TEST_F(RelayReportingTest, EveryBackEndGetsEverythingAndTheFirstErrorIsTold) {
  use({&a, &b});
  EXPECT_EQ(session->description(), "<VyrReportingSession 42>");
  EXPECT_TRUE(session->sendMessageWithCategory(5, 6, Payload(), error));
  EXPECT_TRUE(sendOne());
  EXPECT_THAT(a.calls, ElementsAre("open", "send 5 6", "one 2"));
  EXPECT_THAT(b.calls, ElementsAre("open", "send 5 6", "one 2"));
  a.refusal = Error{"a", 1, "no"};
  b.refusal = Error{"b", 2, "no"};
  EXPECT_FALSE(session->sendMessageWithCategory(5, 6, Payload(), error));
  EXPECT_EQ(error->domain, "a");
  a.refusal.reset();
  EXPECT_FALSE(sendOne());
  EXPECT_EQ(error->domain, "b");
  EXPECT_EQ(a.calls.size() + b.calls.size(), 10u);
}

TEST_F(RelayReportingTest, FlushIsDoneWhenAllAre) {
  use({&a, &b});
  int told = 0;
  session->flushMessagesWithCompletion([&](std::optional<Error> failure) {
    ++told;
    error = std::move(failure);
  });
  b.flushes.at(0)(Error{"b", 2, "no"});
  EXPECT_EQ(told, 0);
  a.flushes.at(0)(std::nullopt);
  EXPECT_EQ(told, 1);
  EXPECT_EQ(error->domain, "b");
  session->flushMessagesWithCompletion(nullptr);
  for (FakeBackend* each : {&a, &b}) each->flushes.at(1)(std::nullopt);
}

TEST_F(RelayReportingTest, ConfigurationAnswersTheBackEndsInForceLaterAndWithoutAnyNothingIsTaken) {
  std::vector<VyrReportingSession::BackendList> answers;
  for (const std::vector<RelayBackend*>& backends :
       {std::vector<RelayBackend*>{&b, &a}, std::vector<RelayBackend*>{}}) {
    use(backends);
    session->startConfigurationWithCompletionHandler([&](const auto& names) {
      answers.push_back(names.value_or(VyrReportingSession::BackendList{"none"}));
    });
  }
  EXPECT_THAT(answers, IsEmpty());
  for (const auto& job : jobs) job();
  EXPECT_THAT(answers, ElementsAre(ElementsAre("b", "a"), ElementsAre("none")));
  EXPECT_FALSE(session->sendMessageWithCategory(5, 6, Payload(), error));
  EXPECT_THAT(std::exchange(error, {})->reason, HasSubstr("no relay back end"));
  EXPECT_FALSE(sendOne());
  EXPECT_TRUE(error);
  bool flushed = false;
  session->flushMessagesWithCompletion([&](const std::optional<Error>&) { flushed = true; });
  EXPECT_TRUE(flushed);
}

}  // namespace
}  // namespace vx::lnx
