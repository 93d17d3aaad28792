// What people ask of the database, as views: the questions of docs/store.md are asked of these.
#pragma once

#include <span>
#include <string>

namespace vx::lnx {

// Immutable. A view computes a column only for a query that reads it, so a wide one costs no more
// than a narrow one.
struct StoreView {
  const char* name;
  std::string select;  // what it is made of
  std::string createSql() const {
    return std::string("CREATE VIEW ") + name + " AS\n" + select + ";\n";
  }
};

// In the order in which they are made: each after those it reads.
std::span<const StoreView> storeViews();

}  // namespace vx::lnx
