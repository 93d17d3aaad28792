// Which client holds a reporter identifier, over all clients.
#pragma once

#include <cstdint>
#include <map>
#include <utility>

#include "Statistics/VXReportingUtility.h"

namespace vx {

class VXReportingServerInstance;

// One entry for each session of each registered client, so that a lookup costs the same however
// many clients there are. Owned by the service delegate, and kept by the clients, which tell it of
// their sessions; belongs to the service queue. Bounded by the number of sessions.
class VXReportingReporterIndex {
 public:
  // `registration`: the client's number in the order in which clients registered.
  void add(ReporterID reporterID, uint64_t registration, VXReportingServerInstance& client) {
    clients_.insert_or_assign({reporterID, registration}, &client);
  }
  void remove(ReporterID reporterID, uint64_t registration) {
    clients_.erase({reporterID, registration});
  }
  // Of those that hold it, the one that registered first; null when nobody does.
  VXReportingServerInstance* firstHolder(ReporterID reporterID) const {
    const auto found = clients_.lower_bound({reporterID, 0});
    return found != clients_.end() && found->first.first == reporterID ? found->second : nullptr;
  }

 private:
  std::map<std::pair<ReporterID, uint64_t>, VXReportingServerInstance*> clients_;
};

}  // namespace vx
