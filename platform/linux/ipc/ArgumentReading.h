// Checks the arguments of a call against what its operation takes.
#pragma once

#include "base/Status.h"
#include "platform/ClientConnection.h"

namespace vx::lnx {

// From a call's frame, [1, number, operation, argument...], to `arguments`. A failure's text is for
// the peer. Arguments may be set also then.
Status readArguments(const OperationDescription& operation, const Frame& frame,
                     CallArguments& arguments);

}  // namespace vx::lnx
