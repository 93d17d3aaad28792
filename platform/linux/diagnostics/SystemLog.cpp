#include "platform/linux/diagnostics/SystemLog.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cstring>
#include <map>
#include <memory>
#include <vector>

namespace vx::lnx {

namespace {

constexpr std::size_t kMaxLineBytes = 16 << 10;
constexpr uint32_t kClockWrap = UINT32_MAX - 60'000;

int rank(LogLevel level) {
  switch (level) {
    case LogLevel::Debug:
      return 0;
    case LogLevel::Info:
      return 1;
    case LogLevel::Default:
      return 2;
    case LogLevel::Error:
      return 3;
  }
  return 2;
}

int priority(LogLevel level) {
  switch (level) {
    case LogLevel::Debug:
      return LOG_DEBUG;
    case LogLevel::Info:
      return LOG_INFO;
    case LogLevel::Default:
      return LOG_NOTICE;
    case LogLevel::Error:
      return LOG_ERR;
  }
  return LOG_NOTICE;
}

// The longest beginning of at most `most` bytes that does not end inside a character.
std::string_view cut(std::string_view text, std::size_t most) {
  if (text.size() <= most) return text;
  while (most > 0 && (static_cast<unsigned char>(text[most]) & 0xC0) == 0x80) --most;
  return text.substr(0, most);
}

void appendOnOneLine(std::string& line, std::string_view text) {
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte >= 0x20 && byte != 0x7F) {
      line += c;
    } else if (c == '\n' || c == '\t') {
      line += c == '\n' ? "\\n" : "\\t";
    } else {
      line += "\\x";
      line += "0123456789ABCDEF"[byte >> 4];
      line += "0123456789ABCDEF"[byte & 15];
    }
  }
}

// One field of a journal entry, as systemd's "Native Journal Protocol" has it: NAME=value and a
// newline, or where the value has newlines NAME, a newline, its size in 64 bits with the lowest
// byte first, the value and a newline.
void appendField(std::string& entry, std::string_view name, std::string_view value) {
  entry += name;
  if (value.find('\n') == std::string_view::npos) {
    entry += '=';
  } else {
    entry += '\n';
    for (int shift = 0; shift < 64; shift += 8)
      entry += static_cast<char>(uint64_t{value.size()} >> shift & 0xFF);
  }
  entry += value;
  entry += '\n';
}

uint32_t coarseMilliseconds() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC_COARSE, &now);
  return static_cast<uint32_t>(now.tv_sec * 1000 + now.tv_nsec / 1000000);
}

// The word that a log statement lends us: how many lines it may still write at once (16 bits), how
// many were left out since the last one written (16 bits), and when that was last brought up to
// date (32 bits of milliseconds).
struct Bucket {
  uint16_t tokens;
  uint16_t suppressed;
  uint32_t updatedMs;
  static Bucket from(uint64_t word) {
    return {static_cast<uint16_t>(word >> 48), static_cast<uint16_t>(word >> 32),
            static_cast<uint32_t>(word)};
  }
  uint64_t word() const { return uint64_t{tokens} << 48 | uint64_t{suppressed} << 32 | updatedMs; }
};

}  // namespace

SystemLog::SystemLog() { configure(LogOptions{.destination = LogOptions::Destination::Stderr}); }

void SystemLog::configure(const LogOptions& options) {
  using Log = LogOptions;
  threshold_ = static_cast<int>(options.level);
  burst_ = std::min<uint32_t>(options.burst, UINT16_MAX);
  refillPerMs_ = options.refillPerSecond / 1000;
  const bool journal = options.destination == Log::Destination::Journal ||
                       (options.destination == Log::Destination::Auto &&
                        access(options.journalSocket.c_str(), W_OK) == 0);
  journalSocket_ = options.journalSocket;
  journal_.reset(journal ? socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0) : -1);
}

// Opening a domain may log, and so ask for a scope: not under the lock.
void SystemLog::refreshVerbose() {
  Preferences* const preferences = preferences_;
  if (preferences == nullptr) return;
  std::map<std::string_view, std::vector<Scope*>> byDomain;
  {
    MutexLock lock(mutex_);
    for (Scope& scope : scopes_) byDomain[scope.domain].push_back(&scope);
  }
  for (const auto& [name, scopes] : byDomain) {
    const std::unique_ptr<PreferencesDomain> domain = preferences->open(name);
    for (Scope* scope : scopes) scope->verbose = domain->boolean(scope->verboseKey);
  }
}

const LogScope* SystemLog::registerScope(bool enabled, uint32_t, std::string_view name,
                                         std::string_view domain, std::string_view verboseKey,
                                         uint32_t) {
  if (!enabled) return nullptr;
  Preferences* const preferences = preferences_;
  const bool verbose = preferences != nullptr && preferences->open(domain)->boolean(verboseKey);
  MutexLock lock(mutex_);
  Scope& scope = scopes_.emplace_back();
  scope.name = name;
  scope.domain = domain;
  scope.verboseKey = verboseKey;
  scope.verbose = verbose;
  return &scope;
}

bool SystemLog::isLogEnabled(int level, const LogScope* scope) {
  if (level < 5) return true;
  if (scope == nullptr) return threshold_.load(std::memory_order_relaxed) <= rank(LogLevel::Debug);
  return static_cast<const Scope*>(scope)->verbose.load(std::memory_order_relaxed);
}

bool SystemLog::wantsLine(const LogScope* scope, LogLevel level, const LogSite& site) {
  const int threshold = threshold_.load(std::memory_order_relaxed);
  // Verbose lines come at debug level and are wanted whatever the threshold while their scope is
  // verbose.
  if (rank(level) < threshold && !(level == LogLevel::Debug && isLogEnabled(5, scope)))
    return false;
  const uint32_t burst = burst_.load(std::memory_order_relaxed);
  if (burst == 0) return true;

  std::atomic_ref<uint64_t> word(site.platformWord);
  const uint32_t now = coarseMilliseconds();
  uint64_t before = word.load(std::memory_order_relaxed);
  for (;;) {
    Bucket bucket =
        before == 0 ? Bucket{static_cast<uint16_t>(burst), 0, now} : Bucket::from(before);
    uint32_t elapsedMs = now - bucket.updatedMs;
    if (elapsedMs > kClockWrap)
      elapsedMs = 0;  // another thread read the clock a tick later than we did
    const double perMs = refillPerMs_.load(std::memory_order_relaxed);
    const double earned = elapsedMs * perMs;
    if (earned >= burst) {
      bucket = {static_cast<uint16_t>(burst), bucket.suppressed, now};
    } else if (earned >= 1) {
      const auto whole = static_cast<uint32_t>(earned);
      bucket.tokens = static_cast<uint16_t>(std::min(burst, bucket.tokens + whole));
      bucket.updatedMs += static_cast<uint32_t>(whole / perMs);  // the fraction is kept for later
    }
    const bool allowed = bucket.tokens > 0;
    if (allowed)
      --bucket.tokens;
    else if (bucket.suppressed < UINT16_MAX)
      ++bucket.suppressed;
    else
      return false;
    if (word.compare_exchange_weak(before, std::max<uint64_t>(bucket.word(), 1),
                                   std::memory_order_relaxed))
      return allowed;
  }
}

void SystemLog::write(const LogScope* scope, LogLevel level, const LogSite& site,
                      std::string_view text, std::size_t) {
  const std::string_view scopeName =
      scope != nullptr ? std::string_view(static_cast<const Scope*>(scope)->name) : "default";
  std::atomic_ref<uint64_t> word(site.platformWord);
  uint32_t suppressed = 0;
  if (Bucket::from(word.load(std::memory_order_relaxed)).suppressed > 0) {
    suppressed = Bucket::from(word.fetch_and(~(uint64_t{0xFFFF} << 32), std::memory_order_relaxed))
                     .suppressed;
  }
  std::string changed;
  if (suppressed > 0 || text.size() > kMaxLineBytes) {
    changed = cut(text, kMaxLineBytes);
    if (text.size() > kMaxLineBytes) changed += "\xE2\x80\xA6";
    if (suppressed > 0) {
      changed += " (" + std::to_string(suppressed) + (suppressed == UINT16_MAX ? " or more" : "") +
                 " lines like this were left out)";
    }
    text = changed;
  }
  if (!journal_) return writeStderr(priority(level), scopeName, text);

  // The line stays whole, prefix included: the same words are found wherever it went.
  std::string entry;
  appendField(entry, "MESSAGE", text);
  appendField(entry, "PRIORITY", std::to_string(priority(level)));
  appendField(entry, "SYSLOG_IDENTIFIER", "vxreporting");
  appendField(entry, "VX_SCOPE", scopeName);
  appendField(entry, "CODE_FILE", site.file);
  appendField(entry, "CODE_LINE", std::to_string(site.line));
  appendField(entry, "CODE_FUNC", site.function);
  if (!sendToJournal(entry)) ++dropped_;
}

// By name each time, so that a journal that was restarted is found again. Never waits: a journal
// that hangs leaves its socket full.
bool SystemLog::sendToJournal(const std::string& entry) const {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (journalSocket_.size() >= sizeof address.sun_path) return false;
  std::memcpy(address.sun_path, journalSocket_.data(), journalSocket_.size());
  return sendto(journal_.get(), entry.data(), entry.size(), MSG_NOSIGNAL | MSG_DONTWAIT,
                reinterpret_cast<const sockaddr*>(&address), sizeof address) >= 0;
}

void SystemLog::writeStderr(int linePriority, std::string_view scopeName, std::string_view text) {
  std::string line = "<" + std::to_string(linePriority) + ">";
  line += scopeName;
  line += ": ";
  appendOnOneLine(line, text);
  line += '\n';
  MutexLock lock(stderrMutex_);
  if (lineCutOff_) line.insert(line.begin(), '\n');
  // Whoever reads the other end may have stopped: the service must not wait for it. A pipe that is
  // ready takes PIPE_BUF bytes without waiting, and no more than that is certain.
  std::string_view left = line;
  while (!left.empty()) {
    pollfd ready{STDERR_FILENO, POLLOUT, 0};
    if (poll(&ready, 1, 0) != 1 || (ready.revents & POLLOUT) == 0) break;
    const ssize_t written =
        ::write(STDERR_FILENO, left.data(), std::min<std::size_t>(left.size(), PIPE_BUF));
    if (written <= 0) break;
    left.remove_prefix(static_cast<std::size_t>(written));
  }
  if (left.empty()) {
    lineCutOff_ = false;
  } else {
    ++dropped_;
    lineCutOff_ = lineCutOff_ || left.size() < line.size();
  }
}

}  // namespace vx::lnx
