// What the store holds, to look at: a page for a browser, a session for a trace viewer.
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>

#include "tools/report/Page.h"
#include "tools/report/StoreReader.h"
#include "tools/report/Timeline.h"

namespace vx::report {

namespace {

int writeTo(const Options& options, const std::string& text) {
  const std::string path = *options.value("-o");
  std::FILE* const file = path == "-" ? stdout : std::fopen(path.c_str(), "wbe");
  if (file == nullptr) throw Failure("cannot write " + path + ": " + std::strerror(errno));
  const bool written = std::fwrite(text.data(), 1, text.size(), file) == text.size();
  if (file == stdout) return written ? 0 : 1;
  if (std::fclose(file) != 0 || !written)
    throw Failure("cannot write " + path + ": " + std::strerror(errno));
  return 0;
}

int writePage(const Words& words) {
  const Options options(words, {"--store=", "--since=", "--application=", "--session=", "-o="});
  (void)options.words(0, 0);
  if (!options.has("-o")) throw UsageError();
  StoreReader store(options);
  PageChoice choice{.since = store.since(),
                    .application = options.value("--application"),
                    .session = {},
                    .asGiven = {}};
  if (const auto session = options.value("--session")) choice.session = store.sessionOf(*session);
  for (const char* name : {"--since", "--application", "--session"}) {
    if (const auto value = options.value(name))
      choice.asGiven += std::string(name) + " " + *value + " ";
  }
  return writeTo(options, pageOf(store, choice));
}

int writeTimeline(const Words& words) {
  const Options options(words, {"--store=", "-o="});
  const std::string session = options.words(1, 1)[0];
  if (!options.has("-o")) throw UsageError();
  StoreReader store(options);
  return writeTo(options, timelineOf(store, store.sessionOf(session)));
}

#define VX_SESSION_HELP                                                                 \
  "SESSION is a client's identifier: the last session that had it. @N is the session\n" \
  "that the store knows as relay_session N.\n"
constexpr Command kCommands[] = {
    {"page", "-o FILE [--since TIME] [--application NAME] [--session SESSION] [--store FILE]",
     "a page with plots and tables",
     "Writes one HTML file that opens from disk and asks nothing of any network: messages over\n"
     "time, sessions on a timeline, each session opened, haptics, uptimes, and what was lost.\n"
     "-o - writes to standard output. " VX_SESSION_HELP "\n" VX_SINCE_HELP VX_STORE_HELP,
     writePage},
    {"timeline", "SESSION -o FILE [--store FILE]", "a session as a trace-event file",
     "Writes the session as JSON that trace viewers open: its messages as events, its numbers as\n"
     "counters. -o - writes to standard output. " VX_SESSION_HELP "\n" VX_STORE_HELP,
     writeTimeline},
};

}  // namespace

std::span<const Command> pictureCommands() { return kCommands; }

}  // namespace vx::report
