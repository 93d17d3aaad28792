// Who keeps the database's log from being written back.
#pragma once

#include <sys/types.h>

#include <istream>
#include <string>
#include <vector>

namespace vx::lnx {

// The processes that have a read transaction open on the database at `path`, as "name (pid n)", for
// people; of at most a few, and only those that this process may see. They hold a lock on the log's
// index from byte 123 on (WAL_READ_LOCK in https://www.sqlite.org/walformat.html).
std::string readersOf(const std::string& path);

// Of the lines of /proc/locks (proc(5)); this process left out.
std::vector<pid_t> readersIn(std::istream& locks, ino_t index);

}  // namespace vx::lnx
