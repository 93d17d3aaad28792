#include "client/vxreporting.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <exception>
#include <memory>
#include <new>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "client/RealtimeReporter.h"
#include "client/ReportingClient.h"
#include "propertylist/Payload.h"

using vx::ArrayBuilder;
using vx::ClientResult;
using vx::ClientStatus;
using vx::Payload;
using vx::PayloadBuilder;
using vx::ReportingClient;

namespace {

using Code = ClientStatus::Code;
using Patience = std::chrono::milliseconds;

static_assert(static_cast<int>(Code::TooLarge) == VXR_TOO_LARGE,
              "the codes of both libraries are the same");

constexpr const char* kCodeTexts[] = {"no error",
                                      "not connected to the service",
                                      "the connection to the service was lost",
                                      "the buffer is full: the service is not reading",
                                      "the time is over",
                                      "the service refused the call",
                                      "the service refused the message",
                                      "too large for a frame or for the buffer",
                                      "an argument is missing or out of range",
                                      "there is no memory",
                                      "an error inside the library"};
static_assert(std::size(kCodeTexts) == VXR_INTERNAL_ERROR + 1);

Patience patienceOf(int timeoutMs) {
  return timeoutMs < 0 ? ReportingClient::kDefaultPatience : Patience(timeoutMs);
}

}  // namespace

// How deep it nests is counted here: the service ends the connection over one that is too deep.
struct vxr_dict {
  PayloadBuilder builder;
  int levels = 1;
};

// A client, and what C has no other place for. Freed inside a callback, it goes when the functions
// that ran the callback have returned.
struct vxr_client {
  std::unique_ptr<ReportingClient> cpp;
  std::ptrdiff_t unanswered = 0;  // calls, starts apart
  ClientStatus failed;            // the first of the calls without a callback
  char text[512] = "";  // of a fixed size: saying that there is no memory must not need any
  int depth = 0;
  bool freed = false;

  int fail(int code, const char* why) {
    std::snprintf(text, sizeof text, "%s", why);
    return code;
  }
  int note(const ClientStatus& status) {
    return status.ok() ? VXR_OK : fail(static_cast<int>(status.code), status.text.c_str());
  }
};

struct vxr_realtime {
  vx::RealtimeReporter reporter;
};

namespace {

// While one lives, the client does.
class Entered {
 public:
  explicit Entered(vxr_client* client) : client_(client) { ++client->depth; }
  ~Entered() {
    if (--client_->depth == 0 && client_->freed) delete client_;
  }
  Entered(const Entered&) = delete;
  Entered& operator=(const Entered&) = delete;

 private:
  vxr_client* const client_;
};

// Whatever a function of the C interface does: no exception leaves it. `fail` tells what happened.
template <class Work, class Fail>
int guarded(const Work& work, const Fail& fail) noexcept {
  try {
    return work();
  } catch (const std::bad_alloc&) {
    return fail(VXR_NO_MEMORY, "there is no memory");
  } catch (const std::length_error& e) {
    return fail(VXR_TOO_LARGE, e.what());
  } catch (const std::exception& e) {
    return fail(VXR_INTERNAL_ERROR, e.what());
  } catch (...) {
    return fail(VXR_INTERNAL_ERROR, "an unknown exception");
  }
}

// `work` is given the C++ client and returns a ClientStatus.
template <class Work>
int withClient(vxr_client* client, const Work& work) noexcept {
  if (client == nullptr || client->freed) return VXR_INVALID_ARGUMENT;
  const Entered entered(client);
  return guarded([&] { return client->note(work(*client->cpp)); },
                 [&](int code, const char* why) { return client->fail(code, why); });
}

template <class Work>
int withDict(vxr_dict* dict, const char* key, const Work& work) noexcept {
  if (dict == nullptr || key == nullptr) return VXR_INVALID_ARGUMENT;
  return guarded(
      [&] {
        work(dict->builder);
        return VXR_OK;
      },
      [](int code, const char*) { return code; });
}

template <class T>
int setArray(vxr_dict* dict, const char* key, const T* values, std::size_t count) {
  if (values == nullptr && count > 0) return VXR_INVALID_ARGUMENT;
  if constexpr (std::is_pointer_v<T>) {
    if (std::find(values, values + count, nullptr) != values + count) return VXR_INVALID_ARGUMENT;
  }
  return withDict(dict, key, [&](PayloadBuilder& builder) {
    ArrayBuilder array;
    std::for_each(values, values + count, [&](const T& value) { array.add(value); });
    builder.set(key, array);
    dict->levels = std::max(dict->levels, 2);
  });
}

void fill(vxr_result& result, ReportingClient::Done) { result.value = 0; }
void fill(vxr_result& result, bool value) { result.value = value ? 1 : 0; }
void fill(vxr_result& result, uint16_t serviceType) {
  result.value = result.service_type = serviceType;
}
void fill(vxr_result& result, const vx::ReporterValidation& reporter) {
  result.value = reporter.reporterID;
  result.service_type = reporter.serviceType;
}
void fill(vxr_result& result, const std::vector<int64_t>& identifiers) {
  result.identifiers = identifiers.data();
  result.identifier_count = identifiers.size();
}

enum class Waits : uint8_t { ForTheAnswer, NotForIt };

// What runs in C++ when an answer comes.
template <class T>
ReportingClient::Callback<T> answering(vxr_client* client, vxr_callback done, void* user,
                                       Waits waits) {
  return [=](const ClientResult<T>& answered) {
    const ClientStatus& status = answered.status;
    if (waits == Waits::ForTheAnswer) --client->unanswered;
    if (done == nullptr) {
      if (waits == Waits::ForTheAnswer && client->failed.ok()) client->failed = status;
      return;
    }
    vxr_result result{static_cast<int>(status.code),
                      status.text.c_str(),
                      status.domain.c_str(),
                      status.wireCode,
                      0,
                      0,
                      nullptr,
                      0};
    if (status.ok()) fill(result, answered.value);
    done(&result, user);
  };
}

// `make` is given the C++ client and the callback.
template <class T, class Make>
int call(vxr_client* client, vxr_callback done, void* user, const Make& make,
         Waits waits = Waits::ForTheAnswer) {
  return withClient(client, [&](ReportingClient& cpp) {
    ClientStatus taken = make(cpp, answering<T>(client, done, user, waits));
    // Possibly after the answer: that the connection is lost.
    if (taken.ok() && waits == Waits::ForTheAnswer) ++client->unanswered;
    return taken;
  });
}

int callOnReporter(vxr_client* client, int64_t identifier, vxr_callback done, void* user,
                   ClientStatus (ReportingClient::*make)(int64_t, ReportingClient::Callback<bool>),
                   Waits waits = Waits::ForTheAnswer) {
  return call<bool>(
      client, done, user,
      [&](ReportingClient& cpp, ReportingClient::Callback<bool> answer) {
        return (cpp.*make)(identifier, std::move(answer));
      },
      waits);
}

int missing(vxr_client* client, const char* what) {
  return client == nullptr ? VXR_INVALID_ARGUMENT : client->fail(VXR_INVALID_ARGUMENT, what);
}

}  // namespace

const char* vxr_code_text(int code) {
  return code >= 0 && code < static_cast<int>(std::size(kCodeTexts)) ? kCodeTexts[code]
                                                                     : "an unknown error";
}

const char* vxr_version(void) { return VXR_LIBRARY_VERSION; }

// ---------------------------------------------------------------------------------------------------------------------
// Dictionaries

vxr_dict* vxr_dict_new(void) { return new (std::nothrow) vxr_dict; }
void vxr_dict_free(vxr_dict* dict) { delete dict; }

int vxr_dict_set_int(vxr_dict* dict, const char* key, int64_t value) {
  return withDict(dict, key, [&](PayloadBuilder& b) { b.set(key, value); });
}
int vxr_dict_set_double(vxr_dict* dict, const char* key, double value) {
  return withDict(dict, key, [&](PayloadBuilder& b) { b.set(key, value); });
}
int vxr_dict_set_bool(vxr_dict* dict, const char* key, bool value) {
  return withDict(dict, key, [&](PayloadBuilder& b) { b.set(key, value); });
}
int vxr_dict_set_string(vxr_dict* dict, const char* key, const char* value) {
  if (value == nullptr) return VXR_INVALID_ARGUMENT;
  return withDict(dict, key, [&](PayloadBuilder& b) { b.set(key, value); });
}
int vxr_dict_set_date(vxr_dict* dict, const char* key, double seconds) {
  return withDict(dict, key, [&](PayloadBuilder& b) { b.set(key, vx::PayloadDate{seconds}); });
}
int vxr_dict_set_dict(vxr_dict* dict, const char* key, const vxr_dict* value) {
  if (value == nullptr || value->levels >= Payload::kMaxNesting) return VXR_INVALID_ARGUMENT;
  return withDict(dict, key, [&](PayloadBuilder& b) {
    b.set(key, value->builder.build());
    dict->levels = std::max(dict->levels, value->levels + 1);
  });
}
int vxr_dict_set_ints(vxr_dict* dict, const char* key, const int64_t* values, size_t count) {
  return setArray(dict, key, values, count);
}
int vxr_dict_set_doubles(vxr_dict* dict, const char* key, const double* values, size_t count) {
  return setArray(dict, key, values, count);
}
int vxr_dict_set_strings(vxr_dict* dict, const char* key, const char* const* values, size_t count) {
  return setArray(dict, key, values, count);
}

// ---------------------------------------------------------------------------------------------------------------------
// The connection

vxr_client* vxr_client_new(const vxr_options* options) {
  vxr_client* made = nullptr;
  (void)guarded(
      [&] {
        vxr_options given = VXR_OPTIONS_INIT;
        // A caller that was built with an older header has a shorter structure.
        if (options != nullptr) std::memcpy(&given, options, std::min(options->size, sizeof given));
        ReportingClient::Options chosen;
        if (given.max_buffered_bytes != 0) chosen.maxBufferedBytes = given.max_buffered_bytes;
        if (given.max_pending_calls != 0) chosen.maxPendingCalls = given.max_pending_calls;
        chosen.keepSessions = given.keep_sessions;
        auto client = std::make_unique<vxr_client>();
        client->cpp = std::make_unique<ReportingClient>(chosen);
        made = client.release();
        return VXR_OK;
      },
      [](int code, const char*) { return code; });
  return made;
}

void vxr_client_free(vxr_client* client) {
  if (client == nullptr || client->freed) return;
  const Entered entered(client);
  client->freed = true;
  client->cpp.reset();
}

int vxr_connect(vxr_client* client, const char* socket_path, int timeout_ms) {
  return withClient(client, [&](ReportingClient& cpp) {
    return cpp.connect(socket_path != nullptr ? socket_path : "", patienceOf(timeout_ms));
  });
}

bool vxr_is_connected(const vxr_client* client) {
  return client != nullptr && !client->freed && client->cpp->isConnected();
}

int vxr_goodbye(vxr_client* client, int timeout_ms) {
  return withClient(client, [&](ReportingClient& cpp) {
    const ClientStatus status = cpp.goodbye(patienceOf(timeout_ms));
    const ClientStatus failed = std::exchange(client->failed, {});
    return status.ok() ? failed : status;
  });
}

void vxr_disconnect(vxr_client* client) {
  (void)withClient(client, [](ReportingClient& cpp) {
    cpp.disconnect();
    return ClientStatus();
  });
}

int vxr_fd(const vxr_client* client) {
  return client != nullptr && !client->freed ? client->cpp->fd() : -1;
}

bool vxr_wants_write(const vxr_client* client) {
  return client != nullptr && !client->freed && client->cpp->wantsWrite();
}

int vxr_retry_in_ms(const vxr_client* client) {
  if (client == nullptr || client->freed) return -1;
  const auto retry = client->cpp->retryIn();
  return retry ? static_cast<int>(retry->count()) : -1;
}

int vxr_get_counters(const vxr_client* client, vxr_counters* counters, size_t size) {
  if (client == nullptr || client->freed || counters == nullptr) return VXR_INVALID_ARGUMENT;
  const ReportingClient::Counters now = client->cpp->counters();
  const vxr_counters all{now.reconnections, now.unanswered, now.dropped, now.sessionsNotRestored};
  std::memset(counters, 0, size);  // a caller that was built with a newer header knows more of them
  std::memcpy(counters, &all, std::min(size, sizeof all));
  return VXR_OK;
}

int vxr_process(vxr_client* client) {
  return withClient(client, [](ReportingClient& cpp) { return cpp.process(); });
}

int vxr_flush(vxr_client* client) {
  return withClient(client, [](ReportingClient& cpp) { return cpp.flush(); });
}

int vxr_wait(vxr_client* client, int timeout_ms) {
  return withClient(client, [&](ReportingClient& cpp) {
    const ClientStatus waited = cpp.waitUntil(
        [client] { return client->freed || client->unanswered == 0; }, patienceOf(timeout_ms));
    const ClientStatus failed = std::exchange(client->failed, {});
    return failed.ok() ? waited : failed;
  });
}

const char* vxr_error_text(const vxr_client* client) {
  return client != nullptr ? client->text : "there is no client (vxr_client_new() gave NULL?)";
}

// ---------------------------------------------------------------------------------------------------------------------
// Calls

int vxr_create_session(vxr_client* client, int64_t identifier, vxr_callback done, void* user) {
  return callOnReporter(client, identifier, done, user,
                        &ReportingClient::createReportingSessionAsync);
}

int vxr_set_service_type(vxr_client* client, int64_t identifier, uint16_t service_type,
                         vxr_callback done, void* user) {
  return call<bool>(client, done, user, [&](ReportingClient& cpp, auto answer) {
    return cpp.setServiceTypeAsync(service_type, identifier, std::move(answer));
  });
}

int vxr_set_configuration(vxr_client* client, int64_t identifier, const vxr_dict* configuration,
                          vxr_callback done, void* user) {
  if (configuration == nullptr) return missing(client, "there is no configuration");
  return call<bool>(client, done, user, [&](ReportingClient& cpp, auto answer) {
    return cpp.setConfigurationAsync(configuration->builder.build(), identifier, std::move(answer));
  });
}

int vxr_start_session(vxr_client* client, int64_t identifier, vxr_callback done, void* user) {
  return callOnReporter(client, identifier, done, user, &ReportingClient::startReportingSession,
                        Waits::NotForIt);
}

int vxr_send_message(vxr_client* client, const vxr_dict* message, uint32_t category, uint16_t type,
                     vxr_callback done, void* user) {
  if (message == nullptr) return missing(client, "there is no message");
  return call<ReportingClient::Done>(client, done, user, [&](ReportingClient& cpp, auto answer) {
    return cpp.sendMessageAsync(message->builder.build(), category, type, std::move(answer));
  });
}

int vxr_send_message_to(vxr_client* client, const vxr_dict* message, uint32_t category,
                        uint16_t type, const int64_t* identifiers, size_t count, vxr_callback done,
                        void* user) {
  if (message == nullptr) return missing(client, "there is no message");
  if (identifiers == nullptr && count > 0) return missing(client, "there are no identifiers");
  return call<ReportingClient::Done>(client, done, user, [&](ReportingClient& cpp, auto answer) {
    return cpp.sendMessageAsync(message->builder.build(), category, type,
                                std::vector<int64_t>(identifiers, identifiers + count),
                                std::move(answer));
  });
}

int vxr_stop_session(vxr_client* client, int64_t identifier, vxr_callback done, void* user) {
  return callOnReporter(client, identifier, done, user,
                        &ReportingClient::stopReportingSessionAsync);
}

int vxr_destroy_session(vxr_client* client, int64_t identifier, vxr_callback done, void* user) {
  return callOnReporter(client, identifier, done, user,
                        &ReportingClient::destroyReportingSessionAsync);
}

int vxr_get_service_type(vxr_client* client, int64_t identifier, vxr_callback done, void* user) {
  return call<uint16_t>(client, done, user, [&](ReportingClient& cpp, auto answer) {
    return cpp.getServiceTypeAsync(identifier, std::move(answer));
  });
}

int vxr_validate_reporter(vxr_client* client, int64_t identifier, vxr_callback done, void* user) {
  return call<vx::ReporterValidation>(client, done, user, [&](ReportingClient& cpp, auto answer) {
    return cpp.validateReporterAsync(identifier, std::move(answer));
  });
}

int vxr_get_reporters(vxr_client* client, vxr_callback done, void* user) {
  return call<std::vector<int64_t>>(client, done, user, [&](ReportingClient& cpp, auto answer) {
    return cpp.getAllReportersAsync(std::move(answer));
  });
}

// ---------------------------------------------------------------------------------------------------------------------
// From a thread that must never wait

static_assert(sizeof(vxr_number) == sizeof(uint64_t));

vxr_realtime* vxr_realtime_new(const vxr_key* keys, size_t key_count, uint32_t category,
                               uint16_t type, const int64_t* identifiers, size_t identifier_count,
                               size_t capacity) {
  using Kind = vx::RealtimeReporter::Kind;
  if (keys == nullptr && key_count > 0) return nullptr;
  vxr_realtime* made = nullptr;
  (void)guarded(
      [&]() -> int {
        vx::RealtimeReporter::Shape shape{{}, category, type, {}};
        for (const vxr_key& key : std::span(keys, key_count)) {
          if (key.name == nullptr || key.kind < VXR_INTEGER || key.kind > VXR_BOOLEAN)
            return VXR_INVALID_ARGUMENT;
          shape.keys.push_back({key.name, static_cast<Kind>(key.kind)});
        }
        if (identifiers != nullptr)
          shape.reporterIDs.emplace(identifiers, identifiers + identifier_count);
        made = new vxr_realtime{{std::move(shape), capacity}};
        return VXR_OK;
      },
      [](int code, const char*) { return code; });
  return made;
}

void vxr_realtime_free(vxr_realtime* realtime) { delete realtime; }

bool vxr_realtime_send(vxr_realtime* realtime, const vxr_number* numbers, size_t count) {
  return realtime != nullptr && (numbers != nullptr || count == 0) &&
         realtime->reporter.sendWords(std::span(reinterpret_cast<const uint64_t*>(numbers), count));
}

int vxr_realtime_process(vxr_realtime* realtime, vxr_client* client) {
  if (realtime == nullptr) return missing(client, "there is no ring");
  return withClient(client, [&](ReportingClient& cpp) { return realtime->reporter.process(cpp); });
}

uint64_t vxr_realtime_dropped(const vxr_realtime* realtime) {
  return realtime == nullptr ? 0 : realtime->reporter.dropped() + realtime->reporter.refused();
}
