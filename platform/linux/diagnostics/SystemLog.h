// The log scopes and the system log: the journal when there is one, else stderr.
#pragma once

#include <atomic>
#include <deque>
#include <string>

#include "base/Mutex.h"
#include "base/UniqueFd.h"
#include "platform/Preferences.h"
#include "platform/ScopedLog.h"
#include "platform/linux/diagnostics/LogOptions.h"

namespace vx::lnx {

// Thread-safe. Owned by the platform. Lines of one statement are limited to a burst and a rate, so
// that no client can flood the log or make the service pay for text that nobody reads; how many
// were left out is said with the next line. Never waits for stderr or the journal: a line that its
// reader has no room for is dropped and counted. On stderr control characters appear as \n, \t or
// \xNN, so that text from a client cannot pass for a line, or a priority, of its own.
class SystemLog final : public ScopedLog {
 public:
  SystemLog();
  // Before any other thread logs.
  void configure(const LogOptions& options);
  // Where the scopes' verbose preferences are, which are read at registration and by
  // refreshVerbose(). Must outlive this.
  void setPreferences(Preferences& preferences) { preferences_ = &preferences; }
  // Opens each domain once, however many scopes have their preference there.
  void refreshVerbose();

  const LogScope* registerScope(bool enabled, uint32_t code, std::string_view name,
                                std::string_view domain, std::string_view verboseKey,
                                uint32_t level) override;
  bool isLogEnabled(int level, const LogScope* scope) override;
  bool wantsLine(const LogScope* scope, LogLevel level, const LogSite& site) override;
  void write(const LogScope* scope, LogLevel level, const LogSite& site, std::string_view text,
             std::size_t prefixLength) override;

  uint64_t droppedLines() const { return dropped_.load(); }

 private:
  struct Scope final : LogScope {
    std::string name;
    std::string domain;
    std::string verboseKey;
    std::atomic<bool> verbose{false};
  };
  bool sendToJournal(const std::string& entry) const;
  void writeStderr(int priority, std::string_view scopeName, std::string_view text);

  std::atomic<int> threshold_;  // the lowest rank that is written
  std::atomic<uint32_t> burst_;
  std::atomic<double> refillPerMs_;
  UniqueFd journal_;  // none: stderr
  std::string journalSocket_;
  std::atomic<uint64_t> dropped_{0};
  std::atomic<Preferences*> preferences_{nullptr};
  Mutex mutex_;
  std::deque<Scope> scopes_ GUARDED_BY(mutex_);  // a handful; never removed, so handles stay valid
  Mutex stderrMutex_;  // held over writes that do not wait, so nobody waits for it for long
  bool lineCutOff_ GUARDED_BY(stderrMutex_) = false;  // the last line has no end yet
};

}  // namespace vx::lnx
