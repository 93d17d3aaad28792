#include "Statistics/Service/VXReportingServiceProtocol.h"

#include <array>
#include <utility>

namespace vx {

namespace {

constexpr std::array kReporter = {ArgumentKind::Int64};
constexpr std::array kTypeAndReporter = {ArgumentKind::UInt16, ArgumentKind::Int64};
constexpr std::array kConfigurationAndReporter = {ArgumentKind::OptionalDictionary,
                                                  ArgumentKind::Int64};
constexpr std::array kMessage = {ArgumentKind::Dictionary, ArgumentKind::UInt32,
                                 ArgumentKind::UInt16, ArgumentKind::OptionalInt64Array};

VXReportingServiceProtocol& service(ExportedObject& object) {
  return static_cast<VXReportingServiceProtocol&>(object);
}

// Sessions that a message may go to while it counts as one of many.
constexpr std::size_t kFewSessions = 8;

bool always(const CallArguments&) { return true; }
bool goesToMany(const CallArguments& arguments) {
  return arguments.numbersIn(3).value_or(kFewSessions + 1) > kFewSessions;
}

auto booleanReply(Reply reply) {
  return [reply = std::move(reply)](bool value) { reply(value); };
}

// An operation that takes a reporter identifier and answers with a boolean.
template <auto operation>
void invokeOnReporter(ExportedObject& object, CallArguments& arguments, Reply reply) {
  (service(object).*operation)(arguments.int64(0), booleanReply(std::move(reply)));
}

constexpr std::array<OperationDescription, 11> kOperations = {{
    {.name = "createReportingSession",
     .arguments = kReporter,
     .reply = ReplyKind::Boolean,
     .resource = ResourceEffect::Acquire,
     .invoke = &invokeOnReporter<&VXReportingServiceProtocol::createReportingSession>,
     .holds = true},
    {.name = "setServiceType",
     .arguments = kTypeAndReporter,
     .reply = ReplyKind::Boolean,
     .invoke =
         [](ExportedObject& object, CallArguments& arguments, Reply reply) {
           service(object).setServiceType(arguments.uint16(0), arguments.int64(1),
                                          booleanReply(std::move(reply)));
         }},
    {.name = "getServiceNameForReporterID",
     .arguments = kReporter,
     .reply = ReplyKind::UInt16,
     .recorded = false,
     .invoke =
         [](ExportedObject& object, CallArguments& arguments, Reply reply) {
           service(object).getServiceNameForReporterID(
               arguments.int64(0), [reply = std::move(reply)](ServiceType type) { reply(type); });
         }},
    {.name = "setConfiguration",
     .arguments = kConfigurationAndReporter,
     .reply = ReplyKind::Boolean,
     .invoke =
         [](ExportedObject& object, CallArguments& arguments, Reply reply) {
           service(object).setConfiguration(arguments.optionalDictionary(0), arguments.int64(1),
                                            booleanReply(std::move(reply)));
         },
     .isHeavy = &always,
     .holds = true},
    {.name = "startReportingSessionForID",
     .arguments = kReporter,
     .reply = ReplyKind::Boolean,
     .replyMayBeHeld = true,
     .invoke = &invokeOnReporter<&VXReportingServiceProtocol::startReportingSessionForID>,
     .isHeavy = &always},
    {.name = "sendMessage",
     .arguments = kMessage,
     .reply = ReplyKind::OptionalError,
     .invoke =
         [](ExportedObject& object, CallArguments& arguments, Reply reply) {
           service(object).sendMessage(
               arguments.dictionary(0), arguments.uint32(1), arguments.uint16(2),
               arguments.optionalInt64Array(3),
               [reply = std::move(reply)](const std::optional<Error>& error) {
                 if (error)
                   reply(*error);
                 else
                   reply(std::monostate());
               });
         },
     .isHeavy = &goesToMany},
    {.name = "stopReportingSessionForID",
     .arguments = kReporter,
     .reply = ReplyKind::Boolean,
     .invoke = &invokeOnReporter<&VXReportingServiceProtocol::stopReportingSessionForID>,
     .isHeavy = &always},
    {.name = "destroyReportingSession",
     .arguments = kReporter,
     .reply = ReplyKind::Boolean,
     .resource = ResourceEffect::Release,
     .invoke = &invokeOnReporter<&VXReportingServiceProtocol::destroyReportingSession>,
     .isHeavy = &always},
    {.name = "reporterID",
     .arguments = kReporter,
     .reply = ReplyKind::Dictionary,
     .recorded = false,
     .invoke =
         [](ExportedObject& object, CallArguments& arguments, Reply reply) {
           service(object).reporterID(
               arguments.int64(0),
               [reply = std::move(reply)](const Payload& answer) { reply(answer); });
         }},
    {.name = "getAllReporters",
     .arguments = {},
     .reply = ReplyKind::Int64Array,
     .recorded = false,
     .invoke =
         [](ExportedObject& object, CallArguments&, Reply reply) {
           service(object).getAllReporters(
               [reply = std::move(reply)](const std::vector<ReporterID>& numbers) {
                 reply(numbers);
               });
         },
     .isHeavy = &always},
    {.name = "killService",
     .arguments = {},
     .reply = ReplyKind::Boolean,
     .recorded = false,
     .invoke = [](ExportedObject& object, CallArguments&,
                  Reply reply) { service(object).killService(booleanReply(std::move(reply))); },
     .privileged = true},
}};

}  // namespace

const InterfaceDescription& vxReportingServiceInterface() {
  static constexpr InterfaceDescription kInterface{.name = "VXReportingServiceProtocol",
                                                   .operations = kOperations};
  return kInterface;
}

}  // namespace vx
