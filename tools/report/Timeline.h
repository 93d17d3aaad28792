// A session in the trace-event format, which trace viewers open.
#pragma once

#include <cstdint>
#include <string>

#include "tools/report/StoreReader.h"

namespace vx::report {

// `relaySession`: as StoreReader::sessionOf says it.
std::string timelineOf(StoreReader& store, int64_t relaySession);

}  // namespace vx::report
