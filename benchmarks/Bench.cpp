// vx-bench [--quick] [--json FILE] [--compare FILE] [--only NAME] [--growth FILE]: every figure of
// the daemon beside its floor.
#include <chrono>
#include <cstdio>
#include <cstring>
#include <exception>
#include <string>

#include "benchmarks/Measurements.h"

namespace {

using namespace vx::bench;

struct Measurement {
  const char* name;
  void (*run)(Results&, const Effort&);
};

constexpr Measurement kMeasurements[] = {
    {"start", measureStart},         {"roundtrip", measureRoundTrip},
    {"flood", measureFlood},         {"accepted", measureAccepted},
    {"sustained", measureSustained}, {"idle", measureIdle},
    {"trickle", measureTrickle},     {"journal", measureCrashSafety},
    {"sessions", measureSessions},   {"stop", measureStop},
    {"client", measureClientSend},   {"connections", measureConnections},
};

int run(int argc, char** argv) {
  Effort effort;
  const char* json = nullptr;
  const char* compare = nullptr;
  const char* only = nullptr;
  const char* growth = nullptr;
  for (int i = 1; i < argc; ++i) {
    const char** value = nullptr;
    if (std::strcmp(argv[i], "--quick") == 0)
      effort = Effort::quickEffort();
    else if (std::strcmp(argv[i], "--json") == 0)
      value = &json;
    else if (std::strcmp(argv[i], "--compare") == 0)
      value = &compare;
    else if (std::strcmp(argv[i], "--only") == 0)
      value = &only;
    else if (std::strcmp(argv[i], "--growth") == 0)
      value = &growth;
    else
      value = nullptr;
    if (value != nullptr && i + 1 < argc) {
      *value = argv[++i];
    } else if (value != nullptr || std::strcmp(argv[i], "--quick") != 0) {
      std::fprintf(stderr, "vx-bench: cannot use '%s'\n", argv[i]);
      return 2;
    }
  }
  const auto start = std::chrono::steady_clock::now();
  if (growth != nullptr) {
    measureGrowth(growth, effort);
    return 0;
  }
  Results results;
  for (const Measurement& measurement : kMeasurements) {
    if (only == nullptr || std::strcmp(only, measurement.name) == 0)
      measurement.run(results, effort);
  }
  results.print();
  if (json != nullptr) results.writeJson(json);
  if (compare != nullptr) results.printComparison(compare);
  std::printf("\nTook %.0f s.%s\n",
              std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(),
              json != nullptr ? (std::string(" Written to ") + json).c_str() : "");
  if (!results.allReached()) std::printf("Figures marked SHORT miss what they must reach.\n");
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  try {
    return run(argc, argv);
  } catch (const std::exception& failure) {
    std::fprintf(stderr, "vx-bench: %s\n", failure.what());
    return 1;
  }
}
