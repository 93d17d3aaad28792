// What the commands of vxreport have in common: their table, their options, their mistakes.
#pragma once

#include <exception>
#include <map>
#include <optional>
#include <span>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

namespace vx::report {

using Words = std::vector<std::string>;

// The command was not given as its help says: exit status 2, with that help.
class UsageError : public std::exception {};
// It was, and cannot be done: exit status 1, with this sentence.
class Failure : public std::runtime_error {
  using std::runtime_error::runtime_error;
};

struct Command {
  const char* name;
  const char* synopsis;            // what comes after the name
  const char* summary;             // in a few words, for the list
  const char* help;                // in full, after the synopsis
  int (*run)(const Words& words);  // of which the first is the name; the exit status
};
// One function a group; each group is a file.
std::span<const Command> serviceCommands();  // calls of the running service
std::span<const Command> inspectCommands();  // what the running service says of itself
std::span<const Command> eraseCommands();
std::span<const Command> storeCommands();    // what the store holds, as text
std::span<const Command> pictureCommands();  // what it holds, to look at
std::span<const Command> messageCommands();  // what becomes of a message
std::span<const Command> configurationCommands();

// The options of a command, taken out of its words. UsageError for one that it does not have.
class Options {
 public:
  // Of the names, those that end in "=" take a value, as the next word or after the sign.
  Options(const Words& words, std::initializer_list<std::string_view> names);
  bool has(const std::string& name) const { return given_.contains(name); }
  std::optional<std::string> value(const std::string& name) const;
  // The words that are neither its name nor options: this many of them.
  const Words& words(std::size_t fewest, std::size_t most) const;

 private:
  std::map<std::string, std::string> given_;
  Words words_;
};

// A whole number in C's notations, or UsageError.
int64_t numberOf(const std::string& text);
// The text with control characters as \xNN: it may come from a client, and go to a terminal.
std::string printable(std::string_view text);

}  // namespace vx::report
