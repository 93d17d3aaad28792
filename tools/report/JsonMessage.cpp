#include "tools/report/JsonMessage.h"

#include <sqlite3.h>

#include "platform/linux/store/Database.h"
#include "tools/report/Command.h"

namespace vx::report {

namespace {

// SQLite has read JSON for the views all along: it reads this too.
class Reader {
 public:
  Reader() {
    sqlite3* opened = nullptr;
    sqlite3_open(":memory:", &opened);
    database_.reset(opened);
  }
  bool isObject(const std::string& json) {
    lnx::Statement type(database_.get(), "SELECT CASE WHEN json_valid(?1) THEN json_type(?1) END");
    type.bind(std::string_view(json));
    return type.row() && type.text(0) == "object";
  }
  Payload dictionary(const std::string& json, int depth = 0) {
    PayloadBuilder builder;
    eachOf(json, depth, [&](const std::string& key, const auto& value) {
      const std::size_t before = builder.size();
      builder.set(key, value);
      if (builder.size() == before)
        throw Failure("the key \"" + key + "\" occurs twice in one dictionary");
    });
    return builder.build();
  }

 private:
  ArrayBuilder array(const std::string& json, int depth) {
    ArrayBuilder builder;
    eachOf(json, depth, [&](const std::string&, const auto& value) { builder.add(value); });
    return builder;
  }

  template <class Add>
  void eachOf(const std::string& json, int depth, const Add& add) {
    if (depth > Payload::kMaxNesting) {
      throw Failure("the message is nested deeper than " + std::to_string(Payload::kMaxNesting) +
                    " levels");
    }
    lnx::Statement entries(database_.get(), "SELECT key, value, type FROM json_each(?)");
    entries.bind(std::string_view(json));
    while (entries.row()) {
      const std::string key = entries.text(0);
      const std::string type = entries.text(2);
      if (type == "object")
        add(key, dictionary(entries.text(1), depth + 1));
      else if (type == "array")
        add(key, array(entries.text(1), depth + 1));
      else if (type == "true" || type == "false")
        add(key, type == "true");
      else if (type == "text")
        add(key, entries.text(1));
      else if (type == "null")
        throw Failure("\"" + key + "\" is null, which no message holds: leave the key out");
      else if (entries.type(1) == SQLITE_INTEGER)
        add(key, entries.integer(1));
      else
        add(key, entries.real(1));
    }
  }

  lnx::Database database_;
};

}  // namespace

Payload messageOf(const std::string& json) {
  Reader reader;
  if (!reader.isObject(json)) throw Failure("the message is not a JSON object");
  return reader.dictionary(json);
}

}  // namespace vx::report
