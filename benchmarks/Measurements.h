// What is measured of the daemon. Each function measures its figures beside their floors,
// interleaved, and adds them.
#pragma once

#include <cstddef>

#include "benchmarks/Results.h"

namespace vx::bench {

struct Effort {
  bool quick = false;
  std::size_t rounds = 5;  // medians of
  std::size_t roundTripsPerRound = 20000;
  std::size_t burstMessages = 30000;
  std::size_t sustainedMessages = 1000000;  // over all rounds
  std::size_t idleSeconds = 20;
  std::size_t trickleSeconds = 60;
  static Effort quickEffort();
};

void measureStart(Results& results, const Effort& effort);
void measureRoundTrip(Results& results, const Effort& effort);
void measureFlood(Results& results, const Effort& effort);
void measureAccepted(Results& results, const Effort& effort);
void measureSustained(Results& results,
                      const Effort& effort);  // stored_per_s, CPU, aggregated memory
void measureIdle(Results& results, const Effort& effort);
// flash_bytes_per_message, syncs_per_minute, wakeups_per_message
void measureTrickle(Results& results, const Effort& effort);
void measureCrashSafety(Results& results, const Effort& effort);
void measureSessions(Results& results, const Effort& effort);
void measureStop(Results& results, const Effort& effort);
void measureClientSend(Results& results, const Effort& effort);
void measureConnections(Results& results, const Effort& effort);
// Throughput and memory against the number of clients and of started sessions; writes a JSON file.
void measureGrowth(const char* file, const Effort& effort);

}  // namespace vx::bench
