// Checks the arguments of a call against what its operation takes.
#pragma once

#include <cstddef>
#include <optional>

#include "base/Status.h"
#include "platform/ClientConnection.h"

namespace vx::lnx {

// From a call's frame, [1, number, operation, argument...], to `arguments`: all but a dictionary,
// which is left to the caller (dictionaryElement). A failure's text is for the peer. Arguments may
// be set also then.
Status readArguments(const OperationDescription& operation, const Frame& frame,
                     CallArguments& arguments);

// How many elements the longest array among a call's arguments has; to be asked before they are
// read, which copies them.
std::size_t longestArray(const OperationDescription& operation, const Frame& frame);

// Of a call whose arguments have been read: the element that is its dictionary; none when it has
// none.
std::optional<std::size_t> dictionaryElement(const OperationDescription& operation,
                                             const Frame& frame);

}  // namespace vx::lnx
