// The service's account of itself as text: for people, and for what collects metrics.
#pragma once

#include <string>
#include <vector>

#include "propertylist/Payload.h"

namespace vx::report {

// A number of the account by the names of the dictionaries around it, "store.bytes".
struct Figure {
  std::string name;
  double value = 0;
  bool isCounter = false;  // only grows while the service runs
};
std::vector<Figure> figuresOf(const Payload& account);

// Of `status`. Counters that are 0 and the configuration are left out.
std::string statusText(const Payload& account);
// The same in the text format that Prometheus reads.
std::string metricsText(const Payload& account);
// Counters per second between two accounts, those that moved.
std::string ratesText(const Payload& before, const Payload& now);

std::string utcText(double secondsSince1970, bool withMilliseconds = false);
std::string bytesText(double bytes);

// Rows of texts, in columns that are as wide as they must be.
std::string tableText(const std::vector<std::vector<std::string>>& rows);

}  // namespace vx::report
