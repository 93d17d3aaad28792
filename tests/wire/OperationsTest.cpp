#include <gtest/gtest.h>

#include "Statistics/Service/VXReportingServiceProtocol.h"
#include "wire/Operations.h"

namespace vx {
namespace {

// Neither side sees the other: the service describes its operations, clients know their numbers.
TEST(Operations, ClientsAndServiceMeanTheSameNumbers) {
  const auto& described = vxReportingServiceInterface().operations;
  ASSERT_EQ(described.size(), wire::kOperationNames.size());
  for (std::size_t i = 0; i < described.size(); ++i)
    EXPECT_EQ(described[i].name, wire::kOperationNames[i]) << "operation " << i + 1;
}

}  // namespace
}  // namespace vx
