// The parts of the page that are the same for every store, from the files in tools/report/page/ and
// the charting library. Compiled in: the tool is one file.
#pragma once

#include <string_view>

namespace vx::report {

struct PageParts {
  std::string_view html;  // with @@NAME@@ where the others go
  std::string_view style;
  std::string_view script;
  std::string_view charts;
  std::string_view chartsLicence;
};
PageParts pageParts();

}  // namespace vx::report
