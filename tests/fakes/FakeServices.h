// Logging, the relay and the small services in memory. Everything that reaches them leaves a line
// in one journal, so that orders of steps can be asserted across services.
#pragma once

#include <atomic>
#include <iomanip>
#include <sstream>

#include "tests/fakes/FakeExecution.h"

namespace vx::fakes {

// Silent where several threads would write to it.
struct Journal : std::vector<std::string> {
  bool silent = false;
};
// Gets what would become a row in the journal's place, from any thread; true.
using RowSink = std::function<bool(std::string text, const Payload& payload)>;

template <class... Parts>
void note(Journal& journal, const Parts&... parts) {
  if (journal.silent) return;
  std::ostringstream line;
  (line << ... << parts);
  journal.push_back(line.str());
}

class FakeLog final : public ScopedLog {
 public:
  explicit FakeLog(Journal& journal) : journal_(journal) {}
  const LogScope* registerScope(bool enabled, uint32_t code, std::string_view name,
                                std::string_view domain, std::string_view verboseKey,
                                uint32_t level) override {
    if (journal_.silent) return nullptr;
    note(registrations, name, " ", code, " ", domain, " ", verboseKey, " ", level,
         enabled ? "" : " off");
    scopes_.emplace_back().name = name;
    return &scopes_.back();
  }
  bool isLogEnabled(int level, const LogScope*) override { return level < 5 || verbose; }
  bool wantsLine(const LogScope*, LogLevel, const LogSite&) override { return !journal_.silent; }
  void write(const LogScope* scope, LogLevel level, const LogSite& site, std::string_view text,
             std::size_t prefixLength) override {
    static constexpr const char* kLevels[] = {"default", "info", "debug", "error"};
    note(lines, scope != nullptr ? static_cast<const Scope*>(scope)->name : "system", " ",
         kLevels[static_cast<int>(level)], " ", text.substr(prefixLength));
    functions.push_back(site.function);
    journal_.push_back("log " + lines.back());
  }
  // Lines as "scope level text", for example "vxrs default DESTROYING SERVICE".
  Journal lines;
  std::vector<std::string> functions;  // of each line
  Journal registrations;
  bool verbose = false;

 private:
  struct Scope final : LogScope {
    std::string name;
  };
  Journal& journal_;
  std::deque<Scope> scopes_;
};

class FakeVyrReporting final : public VyrReporting {
 public:
  struct Sent {
    uint16_t category;
    Payload payload;
    VyrSessionInfo info;  // of one-offs
    Payload userInfo;
  };
  class Session final : public VyrReportingSession {
   public:
    Session(FakeVyrReporting& owner, VyrSessionInfo sessionInfo, Payload user)
        : info(std::move(sessionInfo)),
          userInfo(std::move(user)),
          name(std::to_string(std::get<int64_t>(info[2].second))),
          owner_(owner) {}
    std::string description() const override { return "<relay>"; }
    void startConfigurationWithCompletionHandler(
        Function<void(std::optional<BackendList>)> handler) override {
      if (owner_.toRows) return handler(owner_.backends);
      if (!owner_.configurationAfter) return;
      owner_.threading_.at(*owner_.configurationAfter,
                           [handler = std::move(handler), backends = owner_.backends]() mutable {
                             handler(backends);
                           });
    }
    bool sendMessageWithCategory(uint16_t category, uint16_t type, const Payload& payload,
                                 std::optional<Error>& error) override {
      if (owner_.toRows) return owner_.toRows("message " + name + " " + payload.text(), payload);
      if (!owner_.takes("relay ", category, type, error)) return false;
      owner_.sent.push_back({category, payload, {}, {}});
      return true;
    }
    void flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) override {
      note(owner_.journal_, "flush");
      if (owner_.toRows) owner_.toRows("flush " + name, {});
      handler(owner_.flushError);
    }
    const VyrSessionInfo info;
    const Payload userInfo;
    const std::string name;

   private:
    FakeVyrReporting& owner_;
  };

  FakeVyrReporting(Journal& journal, FakeThreading& threading)
      : journal_(journal), threading_(threading) {}
  std::shared_ptr<const VyrSecureHierarchyToken> newSecureHierarchyTokenFromParentToken(
      const VyrSecureHierarchyToken*) override {
    struct Token final : VyrSecureHierarchyToken {};
    ++tokens;
    return std::make_shared<Token>();
  }
  std::shared_ptr<VyrReportingSession> initWithSessionInfo(
      const VyrSessionInfo& info, const Payload& userInfo,
      const std::vector<std::string>&) override {
    note(journal_, "relay session");
    auto session = std::make_shared<Session>(*this, info, userInfo);
    if (!toRows) return sessions.emplace_back(std::move(session));
    toRows("session " + session->name, {});
    return session;
  }
  bool sendOneMessageWithSessionInfo(const VyrSessionInfo& info, const Payload& userInfo,
                                     uint16_t category, uint16_t type, const Payload& payload,
                                     std::optional<Error>& error) override {
    if (toRows)
      return toRows("one-off session", {}) && toRows("one-off " + payload.text(), payload);
    if (!takes("one-off ", category, type, error)) return false;
    oneOffs.push_back({category, payload, info, userInfo});
    return true;
  }

  std::optional<std::chrono::nanoseconds> configurationAfter{0};  // none: never answers
  std::optional<VyrReportingSession::BackendList> backends{{"store"}};
  std::optional<Error> sendError;
  std::optional<Error> flushError;
  std::vector<std::shared_ptr<Session>> sessions;
  std::vector<Sent> sent;
  std::vector<Sent> oneOffs;
  std::atomic<int> tokens = 0;
  RowSink toRows;

 private:
  bool takes(const char* what, uint16_t category, uint16_t type, std::optional<Error>& error) {
    note(journal_, what, category, " ", type);
    if (sendError) error = sendError;
    return !sendError;
  }
  Journal& journal_;
  FakeThreading& threading_;
};

class FakeServices final : public AnalyticsEventService,
                           public PowerEventLog,
                           public TracePoint,
                           public ProcessInfoQuery,
                           public ProcessControl,
                           public RandomSource,
                           public DevicePropertyQuery,
                           public Preferences,
                           public SystemNotify,
                           public OrientationNotifier,
                           public DiagnosticFiles {
 public:
  using Name = std::string_view;
  explicit FakeServices(Journal& journal) : journal_(journal) {}

  void sendEventLazy(Name name, Function<Payload()> builder, const Payload&, std::size_t) override {
    if (toRows) return (void)toRows("event " + std::string(name) + " " + builder().text(), {});
    note(journal_, "event ", name);
    events.push_back({std::string(name), share(std::move(builder))});
  }
  void logRegisteredEvent(int64_t, Name name, const Payload& record, const Payload*) override {
    if (toRows) return (void)toRows("power " + std::string(name), {});
    note(journal_, "power ", name);
    powers.push_back({std::string(name), record});
  }
  void emit(uint32_t code, uint64_t, uint64_t, uint64_t, uint64_t) override {
    note(journal_, std::hex, std::uppercase, std::setfill('0'), "trace 0x", std::setw(8), code);
  }
  int32_t ownProcessIdentifier() override { return 1000; }
  std::string ownProcessName() override { return "vxreportingd"; }
  std::optional<std::string> shortCommandName(int32_t pid) override {
    const auto found = processNames.find(pid);
    return found != processNames.end() ? std::optional(found->second) : std::nullopt;
  }
  void exit(int status) override { note(journal_, "exit ", status); }
  uint32_t below(uint32_t bound) override {
    note(journal_, "random below ", bound);
    return random;
  }
  bool boolean(Name name) override { return name == "InternalBuild" && internalBuild; }
  int32_t integer(Name name, int32_t defaultValue) override {
    return name == "DeviceClassNumber" ? deviceClass : defaultValue;
  }
  std::unique_ptr<PreferencesDomain> open(Name) override {
    return std::make_unique<Domain>(preferences);
  }
  uint32_t registerHandler(Name name, int& token, std::shared_ptr<WorkQueue>,
                           Function<void(int)> handler) override {
    note(journal_, "notify ", name);
    token = kToken;
    notifyHandler = share(std::move(handler));
    return notifyStatus;
  }
  void registerDeviceOrientationHandler(Name id, const void* registrant, Handler handler) override {
    note(journal_, "register device ", id);
    deviceHandlers[{std::string(id), registrant}] = share(std::move(handler));
  }
  void registerInterfaceOrientationHandler(Name id, const void* registrant,
                                           Handler handler) override {
    note(journal_, "register interface ", id);
    interfaceHandlers[{std::string(id), registrant}] = share(std::move(handler));
  }
  void unregisterDeviceOrientationHandler(Name id, const void* registrant) override {
    const bool was = deviceHandlers.erase({std::string(id), registrant}) > 0;
    note(journal_, "unregister device ", id, was ? "" : ", which was not");
  }
  void unregisterInterfaceOrientationHandler(Name id, const void* registrant) override {
    const bool was = interfaceHandlers.erase({std::string(id), registrant}) > 0;
    note(journal_, "unregister interface ", id, was ? "" : ", which was not");
  }
  std::string orientationText(int64_t value) override { return "o" + std::to_string(value); }
  std::string logsDirectory() override { return "/logs"; }
  std::optional<Error> createDirectory(const std::string& path, unsigned mode) override {
    note(journal_, "mkdir ", path, " ", std::oct, mode);
    return directoryError;
  }
  std::unique_ptr<AtomicFile> createAtomically(const std::string& directory,
                                               const std::string& name,
                                               std::optional<Error>&) override {
    return std::make_unique<File>(*this, directory + "/" + name);
  }

  struct Event {
    std::string name;
    std::shared_ptr<Function<Payload()>> builder;
  };
  struct Power {
    std::string name;
    Payload record;
  };
  using Texts = std::map<std::string, std::string, std::less<>>;
  std::vector<Event> events;
  std::vector<Power> powers;
  std::map<int32_t, std::string> processNames;
  uint32_t random = 0;
  bool internalBuild = false;
  int32_t deviceClass = 0;
  Texts preferences;  // "true" and "false" read as booleans too
  uint32_t notifyStatus = 0;
  std::shared_ptr<Function<void(int)>> notifyHandler;
  static constexpr int kToken = 77;
  using Handlers = std::map<std::pair<std::string, const void*>, std::shared_ptr<Handler>>;
  Handlers deviceHandlers;
  Handlers interfaceHandlers;
  Texts files;
  std::optional<Error> directoryError;
  std::optional<Error> writeError;  // of the next piece written, and of no other
  RowSink toRows;

 private:
  template <class F>
  static std::shared_ptr<F> share(F function) {
    return std::make_shared<F>(std::move(function));
  }
  class Domain final : public PreferencesDomain {
   public:
    explicit Domain(Texts held) : held_(std::move(held)) {}
    bool hasObject(Name key) const override { return held_.contains(key); }
    std::optional<std::string> string(Name key) const override {
      const auto found = held_.find(key);
      if (found == held_.end() || found->second == "<table>") return std::nullopt;
      return found->second;
    }
    bool boolean(Name key) const override { return string(key) == "true"; }

   private:
    const Texts held_;
  };
  class File final : public AtomicFile {
   public:
    File(FakeServices& owner, std::string path) : owner_(owner), path_(std::move(path)) {}
    std::optional<Error> take(std::string& text) override {
      content_ += std::exchange(text, {});
      return std::exchange(owner_.writeError, std::nullopt);
    }
    std::optional<Error> commit() override {
      note(owner_.journal_, "file ", path_);
      owner_.files[path_] = content_;
      return std::nullopt;
    }

   private:
    FakeServices& owner_;
    const std::string path_;
    std::string content_;
  };
  Journal& journal_;
};

}  // namespace vx::fakes
