#include <cmath>

#include "Statistics/VXReportingTallyhubBridge.h"
#include "Statistics/VXReportingWattmarkUtility.h"
#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

TEST_F(SessionTest, NumbersPerKindAcrossRestartsAndStates) {
  const auto s = make();
  EXPECT_EQ(s->messageIdForCategory(kSetup, 1), "Session_Setup_Start_1");
  s->sendMessage(message, kSetup, 1, nullptr);  // into the initial arrays
  EXPECT_EQ(s->nestedAggregatedPayloadData()->size(), 1u);
  s->start();
  EXPECT_TRUE(s->nestedAggregatedPayloadData()->empty());
  s->sendMessage(message, kSetup, 1, nullptr);
  s->sendMessage(message, 3, 4, nullptr);
  EXPECT_THAT(texts(s->nestedAggregatedPayloadData()),
              ElementsAre("{Session_Setup_Start_3={a=1}}", "{Playback_Error_1={a=1}}"));
  s->start();  // already
  EXPECT_EQ(s->aggregatedPayloadData()->size(), 2u);
  s->stop();
  EXPECT_EQ(s->aggregatedPayloadData(), std::nullopt);
  s->sendMessage(message, kSetup, 1, nullptr);  // numbered, kept nowhere
  EXPECT_EQ(s->nestedAggregatedPayloadData(), std::nullopt);
  EXPECT_EQ(s->messageIdForCategory(kSetup, 1), "Session_Setup_Start_5");
  // 6 and 7 are both named Undefined: one kind.
  EXPECT_EQ(s->messageIdForCategory(0, 6), "Undefined_Undefined_1");
  EXPECT_EQ(s->messageIdForCategory(12, 7), "Undefined_Undefined_2");
}

TEST_F(SessionTest, KeysAreNormalisedAndTheLaterOfTwoStays) {
  const Payload odd = dictionary("a b", 1, "c", dictionary("d e", 2), "a_b", 3, " f g ", "h i");
  const std::string normal = "{a_b=3,c={d e=2},_f_g_=h i}";
  EXPECT_EQ(VXReportingSession::normalizePayloadKeys(odd).text(), normal);
  const auto s = startedSession();
  s->sendMessage(odd, 3, 1, nullptr);
  run();
  EXPECT_EQ(p.vyr.sent.at(0).payload.text(), normal);
  EXPECT_THAT(texts(s->aggregatedPayloadData()), ElementsAre(normal));
  EXPECT_THAT(texts(s->nestedAggregatedPayloadData()),
              ElementsAre("{Playback_Start_1=" + normal + "}"));
}

TEST_F(SessionTest, RelaySessionCarriesWhatTheSetUpTook) {
  const auto s = make(7);
  s->start();
  s->setServiceType(3);  // too late for the names
  // In time: the set-up holds the dictionary itself.
  s->setConfiguration(dictionary("HostApplicationDisplayID", "app", "b", 1));
  s->updateDefaults(dictionary("b", 2));
  s->setConfiguration(std::nullopt);
  run();
  const auto& relay = *p.vyr.sessions.back();
  EXPECT_EQ(relay.userInfo.text(),
            "{clientName=com.quorvel.sonik,serviceName=longformaudio_session,"
            "HostApplicationDisplayID=app,b=2}");
  EXPECT_EQ(relay.info[4].second, VyrSessionInfoValue(s->vyrReportingAgentToken()));
  EXPECT_EQ(s->vyrReportingSession(), p.vyr.sessions.back());
  s->stop();
  run();
  EXPECT_EQ(s->vyrReportingSession(), nullptr);
  EXPECT_EQ(p.queues.blockingScopes, 1);
  EXPECT_THAT(p.queues.made.back(),
              Pair("com.quorvel.sonik.session.vyrreporting", QualityOfService::Utility));
  make(8);
  EXPECT_EQ(p.log.registrations.size(), 3u) << "one for all sessions";
  EXPECT_EQ(p.log.registrations.back(),
            "vxrr 1987605106 com.quorvel.sonik reporting_session_verbose 31");
}

TEST_F(SessionTest, WhoeverHoldsTooMuchIsLeftOutOfTheAggregateAndOfNothingElse) {
  const auto s = make();
  s->start();
  auto& memory = p.aggregates;
  const auto send = [&](AggregateMemory::Payer payer, bool full, int64_t n) {
    memory.payer = payer;
    memory.full = full;
    s->sendMessage(dictionary(payer == 7 ? "n" : "other", n), 1, 1, nullptr);
  };
  send(7, false, 1);
  send(8, false, 2);
  for (int i = 0; i < 3; ++i) send(8, true, 3);
  send(7, false, 4);
  run();
  EXPECT_EQ(s->aggregatedPayloadData()->size(), 3u);
  EXPECT_EQ(s->messageIdForCategory(1, 1), messageIdentifier(messageKind(1, 1), 7));
  EXPECT_EQ(p.vyr.sent.size(), 6u);
  EXPECT_GT(memory.charged[7], memory.charged[8]);
  EXPECT_GT(memory.charged[8], 0);
  const std::pair<int64_t, uint64_t> begin{s->reporterID(), 0};
  EXPECT_EQ(memory.told, std::vector{begin});
  s->stop();
  run();
  EXPECT_EQ(memory.told, (std::vector{begin, {begin.first, 3}}));
  EXPECT_EQ(memory.charged[7], 0);
  EXPECT_EQ(memory.charged[8], 0);
}

TEST_F(SessionTest, UserInformationIsBoundedAndOnTheAccountOfWhoeverMadeTheSession) {
  auto& charged = p.aggregates.charged;
  p.aggregates.payer = 7;
  auto s = make();
  p.aggregates.payer = 8;
  const auto large = [](std::size_t kib) {
    return dictionary("large", std::string(kib << 10, 'x'));
  };
  EXPECT_TRUE(s->setConfiguration(dictionary("HostApplicationDisplayID", "app")));
  EXPECT_TRUE(s->setConfiguration(large(600)));
  EXPECT_FALSE(s->setConfiguration(large(1024)));
  EXPECT_FALSE(s->setConfiguration(dictionary("more", std::string(500 << 10, 'x'))));
  EXPECT_TRUE(s->setConfiguration(large(1000))) << "in the place of the one before";
  EXPECT_EQ(s->userInfo()->snapshot().size(), 2u);
  EXPECT_EQ(s->userInfo()->application().text(), "{HostApplicationDisplayID=app}");
  EXPECT_GT(charged[7], 2000 << 10);
  EXPECT_EQ(charged[8], 0);
  s.reset();
  EXPECT_EQ(charged[7], 0);
}

TEST_F(SessionTest, EventsNeedNeitherAMessageNorASession) {
  VXReportingWattmarkUtility::handleEvent(nullptr, 1, 6, nullptr);
  VXReportingTallyhubBridge::handleEvent(nullptr, 0x10000009, 0xFFFF, nullptr);
  EXPECT_EQ((*p.services.events.back().builder)().text(), "{HostApplicationDisplayID=Unknown}");
}

TEST_F(SessionTest, DelayedSinglesGoOutInTheirOrderWhenSomebodyIsInAHurryAndOnce) {
  const auto single = [&](const auto& number, uint32_t delay) {
    p.services.random = delay;
    VXReportingSession::sendSingleMessage(dictionary("n", number), 1, 1, 4, std::nullopt, nullptr);
  };
  const auto sent = [&] {
    std::string numbers;
    for (const auto& one : p.vyr.oneOffs) numbers += one.payload.find("n")->text() + " ";
    return numbers;
  };
  VXReportingDelayedMessages& delayed = VXReportingProcessState::current().delayedMessages();
  for (int i = 0; i < 3; ++i) {  // what went out takes no space
    single(std::string(VXReportingDelayedMessages::kMostBytes / 2, 'x'), 1);
    p.queues.advance(1s);
  }
  p.vyr.oneOffs.clear();
  // Those that are too many do not wait.
  for (std::size_t i = 0; i < VXReportingDelayedMessages::kMostMessages; ++i) single(0, 20);
  run();
  EXPECT_EQ(sent(), "");
  EXPECT_EQ(p.queues.waiting(), 1u) << "one wake-up for all";
  p.queues.advance(1s);
  for (int i = 0; i < 3; ++i) single(1, 59);
  run();
  EXPECT_EQ(p.vyr.oneOffs.size(), 3u);
  EXPECT_EQ(delayed.size(), VXReportingDelayedMessages::kMostMessages);
  p.queues.advance(59s);
  EXPECT_EQ(p.vyr.oneOffs.back().payload.find("n")->asInt64(), 1);
  p.vyr.oneOffs.clear();
  single(1, 30);
  single(2, 10);
  single(3, 30);
  p.queues.advance(10s);
  EXPECT_EQ(sent(), "2 ");
  single(4, 5);
  delayed.sendAllFromNow();
  EXPECT_EQ(sent(), "2 4 1 3 ");
  p.queues.advance(60s);
  EXPECT_EQ(p.vyr.oneOffs.size(), 4u);
  single(5, 50);  // of work that was still queued
  run();
  EXPECT_EQ(sent(), "2 4 1 3 5 ");
  EXPECT_EQ(delayed.size(), 0u);
}

TEST_F(SessionTest, FailuresOfTheSummaryAreLoggedAndTheStopGoesOn) {
  p.services.internalBuild = true;
  const Payload bad = dictionary("bad", std::nan(""));
  const Payload large = dictionary("a", std::string(70000, 'x'));
  p.services.directoryError = Error{"posix", 13, "denied"};  // the file is tried all the same
  for (const auto& [header, sent, fails] :
       {std::tuple(bad, message, "dataWithJSONObject: "),
        {message, bad, "dataWithJSONObject: "},
        {message, large, "jsonOutput writeToURL: full (posix, code 28)"}}) {
    const auto s = startedSession();
    s->setConfiguration(header);
    s->sendMessage(sent, 3, 1, nullptr);
    p.services.writeError = Error{"posix", 28, "full"};  // of the first piece
    mark();
    s->stop();
    EXPECT_THAT(gained({" error "}),
                UnorderedElementsAre(HasSubstr(fails), HasSubstr("denied (posix, code 13)")));
    EXPECT_FALSE(s->started());
  }
  EXPECT_THAT(p.services.files, IsEmpty());
  EXPECT_GT(p.threading.freedBytes, 0u);
}

}  // namespace
}  // namespace vx
