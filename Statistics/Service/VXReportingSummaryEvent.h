// The event that condenses everything a session received.
#pragma once

#include <cstddef>
#include <deque>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "Statistics/Service/VXReportingRowReader.h"
#include "Statistics/VXReportingUtility.h"
#include "base/ChunkList.h"
#include "base/SeededHash.h"

namespace vx {

// Groups the values of many dictionaries by key: each key's texts in the order met, joined by ",".
// Lives for one stop of a session, on the service queue; as large as the texts it holds.
class VXReportingSummaryEvent {
 public:
  // The first value of all is the service type, under "VX_Session_Summary_Event". A payload that
  // holds this key too appends to it: nothing prevents that.
  explicit VXReportingSummaryEvent(ServiceType serviceType);
  void add(const VXReportingRow& row);
  // std::length_error when the event would be larger than a Payload can be.
  Payload build() const;

 private:
  struct Group {
    std::string key;
    ChunkList<char, (64 << 10), 128, 2> text;
    bool any = false;  // a value: the first may be the empty text
  };
  static void add(Group& group, const Value& value);
  static void append(Group& group, std::string_view text);
  Group& groupFor(std::string_view key);

  std::deque<Group> groups_;  // in order of their first values; never moves its elements
  std::unordered_map<std::string_view, Group*, SeededHash> index_;
  std::vector<std::vector<Group*>> shapes_;  // the groups of a shape's keys
};

}  // namespace vx
