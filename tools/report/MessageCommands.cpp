// What becomes of a message: it is sent into a session of the service's own code, which has nobody
// outside.
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iostream>
#include <iterator>
#include <optional>
#include <string>

#include "Statistics/Service/VXReportingBlockThrottle.h"
#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/Service/VXReportingSession.h"
#include "Statistics/VXReportingTallyhubBridge.h"
#include "Statistics/VXReportingWattmarkUtility.h"
#include "tools/report/Command.h"
#include "tools/report/DryPlatform.h"
#include "tools/report/JsonMessage.h"

namespace vx::report {

namespace {

constexpr std::size_t kMostFields = 200;  // the message is sent once for each
constexpr const char* kMarker = "\x01the field that is followed\x01";

struct Sending {
  MessageCategory category = 0x08000003;
  MessageType type = 0;
  ServiceType serviceType = 0;
  ReporterID reporter = 1;
  std::optional<std::string> application;
};

// What the service made of it.
struct Fate {
  DryOutcome left;
  std::optional<Payload> summary;
  std::string identifier;
  std::string throttleKey;
  double throttleSeconds = 0;
  std::vector<std::string> throttleLines;
};

Fate send(DryPlatform& dry, const Payload& message, const Sending& how) {
  const auto session = VXReportingSession::initWithID(how.reporter, {});
  session->setServiceType(how.serviceType);
  if (how.application) {
    session->setConfiguration(
        PayloadBuilder().set(kHostApplicationDisplayIDKey, *how.application).build());
  }
  session->start();
  (void)dry.take();
  session->sendMessage(message, how.category, how.type, nullptr);
  VXReportingTallyhubBridge::handleEvent(&message, how.category, how.type, session.get());
  VXReportingWattmarkUtility::handleEvent(&message, how.category, how.type, session.get());
  Fate fate;
  fate.left = dry.take();
  fate.summary = session->createSummaryEventForSession();
  if (const auto nested = session->nestedAggregatedPayloadData(); nested && !nested->empty())
    fate.identifier = (*nested->front().begin()).key;
  fate.throttleKey =
      VXReportingBlockThrottle::buildMessageKey(message, how.reporter, how.category, how.type);
  fate.throttleSeconds = VXReportingBlockThrottle::determineSleepTime(message);
  fate.throttleLines = dry.take().lines;
  return fate;
}

const char* nameOf(ValueKind kind) {
  switch (kind) {
    case ValueKind::Integer:
    case ValueKind::Unsigned:
      return "a whole number";
    case ValueKind::Float:
    case ValueKind::Double:
      return "a floating number";
    case ValueKind::Boolean:
      return "a boolean";
    case ValueKind::String:
      return "a text";
    case ValueKind::Date:
      return "a date";
    case ValueKind::Array:
      return "an array";
    default:
      return "a dictionary";
  }
}

void line(const char* name, const std::string& text) {
  std::printf("  %-9s %s\n", name, printable(text).c_str());
}

// The key under which a dictionary has the marker.
std::optional<std::string> keyOfMarker(const Payload& dictionary) {
  for (const DictionaryEntry& entry : dictionary) {
    if (entry.value.text() == kMarker) return std::string(entry.key);
  }
  return std::nullopt;
}

std::string quoted(const std::string& text) { return "\"" + text + "\""; }

// `followed`: the fate of the same message, with the marker for this field's value.
void explainField(const DictionaryEntry& field, const Fate& fate, const Fate& followed) {
  const std::string key(field.key);
  std::printf("\n%s: %s, %s\n", quoted(printable(key)).c_str(),
              printable(field.value.text()).c_str(), nameOf(field.value.kind()));
  const auto relayed = followed.left.relayed.empty()
                           ? std::nullopt
                           : keyOfMarker(followed.left.relayed.front().payload);
  const Payload only = PayloadBuilder().set(key, field.value).build();
  const std::string normal((*VXReportingSession::normalizePayloadKeys(only).begin()).key);
  line("key", quoted(normal) + (normal != key ? ": blanks become underscores" : ""));
  if (fate.left.relayed.empty())
    line("relayed", "no: the message is not");
  else
    line("relayed", relayed ? "yes" : "no: another field that gets the same key comes later");
  const auto event = keyOfMarker(followed.left.events.front().second);
  line("event", event ? "yes, as " + quoted(*event) + (normal != key ? ": events keep blanks" : "")
                      : "no: the session's own application takes its place");
  const bool anyPower = !followed.left.powerRecords.empty();
  const auto power = anyPower ? keyOfMarker(followed.left.powerRecords.front().second)
                              : std::optional<std::string>();
  line("power log", power      ? "yes, as " + quoted(*power)
                    : anyPower ? "no: the record has no place for it"
                               : "no: the message makes no record");
  const auto text = fate.summary ? fate.summary->find(normal) : std::nullopt;
  if (fate.left.relayed.empty() || relayed)
    line("summary", quoted(normal) + " has " + quoted(text ? std::string(text->asString()) : "") +
                        (field.value.isArray() || field.value.isDictionary() ||
                                 field.value.text().find(',') != std::string::npos
                             ? ": its commas cannot be told from those between values"
                             : ""));
  else
    line("summary", "no: another field has its key");
  const bool compared = followed.throttleKey.find(kMarker) != std::string::npos;
  line("throttle", compared ? "compared: another value is another message"
                            : "not compared: messages that differ in this value are the same");
}

void explainMessage(const Payload& message, const Sending& how, const Fate& fate) {
  std::printf(
      "%s, a message of category 0x%08X and type %u, into a started session of service type %s\n",
      fate.identifier.c_str(), how.category, unsigned{how.type},
      std::string(VXReportingServiceTypeName(how.serviceType)).c_str());
  if (fate.left.relayed.empty()) {
    line("relayed",
         "no: " + (fate.left.lines.empty() ? "there is no relay session" : fate.left.lines.back()));
  } else {
    line("relayed", "as category " + std::to_string(fate.left.relayed.front().category) +
                        " (the lower 16 bits) and type " +
                        std::to_string(fate.left.relayed.front().type));
  }
  const auto& [name, event] = fate.left.events.front();
  const auto application = event.find(kHostApplicationDisplayIDKey);
  line("event", name + " with " + quoted(std::string(kHostApplicationDisplayIDKey)) + ": " +
                    quoted(application ? application->text() : ""));
  if (fate.left.powerRecords.empty())
    line("power log", how.type == 6 ? "no: it has neither of the keys that make a record"
                                    : "no: messages of type 6 alone make records");
  else
    line("power log",
         fate.left.powerRecords.front().first + " " + fate.left.powerRecords.front().second.text());
  char seconds[32];
  std::snprintf(seconds, sizeof seconds, "%g", fate.throttleSeconds);
  line("throttle", "would hold it back " + std::string(seconds) + " s" +
                       (fate.throttleLines.empty() ? "" : ": " + fate.throttleLines.front()) +
                       "; its key is " + fate.throttleKey);
  if (message.encoded().size() > (1 << 20) - 64)
    line("size", std::to_string(message.encoded().size()) + " bytes: too large for a frame");
}

std::string textOf(const std::string& path) {
  if (path == "-") return {std::istreambuf_iterator<char>(std::cin), {}};
  std::ifstream file(path, std::ios::binary);
  std::string text{std::istreambuf_iterator<char>(file), {}};
  if (!file || file.bad()) {
    if (access(path.c_str(), R_OK) != 0)
      throw Failure("cannot read " + path + ": " + std::strerror(errno));
    if (!file.eof()) throw Failure("cannot read " + path);
  }
  return text;
}

template <class Code>
void setCode(const Options& options, const std::string& name, Code& code) {
  const auto given = options.value(name);
  if (!given) return;
  const int64_t value = numberOf(*given);
  if (static_cast<int64_t>(static_cast<Code>(value)) != value) throw UsageError();
  code = static_cast<Code>(value);
}

int explain(const Words& words) {
  const Options options(
      words, {"--category=", "--type=", "--service-type=", "--reporter=", "--application="});
  const std::string path = options.words(1, 1)[0];
  Sending how;
  setCode(options, "--category", how.category);
  setCode(options, "--type", how.type);
  setCode(options, "--service-type", how.serviceType);
  setCode(options, "--reporter", how.reporter);
  how.application = options.value("--application");
  const Payload message = messageOf(textOf(path));
  DryPlatform dry;
  const auto service = VXReportingServiceDelegate::create();  // sessions live on its queue
  const Fate fate = send(dry, message, how);
  explainMessage(message, how, fate);
  std::size_t explained = 0;
  for (const DictionaryEntry& field : message) {
    if (explained++ == kMostFields) {
      std::printf("\n%zu fields more\n", message.size() - kMostFields);
      break;
    }
    const Payload marked = PayloadBuilder(message).set(field.key, kMarker).build();
    explainField(field, fate, send(dry, marked, how));
  }
  return 0;
}

constexpr Command kCommands[] = {
    {"explain",
     "[--category N] [--type N] [--service-type N] [--application NAME] [--reporter ID] FILE|-",
     "what becomes of a message, field by field",
     "Reads a message as a JSON object, and says of each field which key it gets, whether it is\n"
     "relayed, in the event and in the power log, how the summary has it, and what a throttle\n"
     "makes of it. The service's own code says so; no service need run, and none is told.\n\n"
     "  --category N      0x08000003 (Session_Playback) when there is none\n"
     "  --type N          0; messages of type 6 may make power records\n"
     "  --service-type N  of the session; 0\n",
     explain},
};

}  // namespace

std::span<const Command> messageCommands() { return kCommands; }

}  // namespace vx::report
