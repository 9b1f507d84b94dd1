// A stand-in for drd: a real listener on a real socket handing every event to the test.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "core/queue.h"
#include "platform/message_service.h"

namespace dr::testing {

// On the connection's thread; `connection` is null once gone. A last event may come after the
// test ended, so the handler must not reach into a fixture on a connection-invalid event.
using StandInHandler =
    std::function<void(const std::shared_ptr<PeerConnection>& connection, const ConnectionEvent&)>;

// Listens at <socketDirectory>/<serviceName>; connections get `handler` and `context` (held
// weakly by the listener). Null, and a test failure, when it cannot be made.
std::unique_ptr<Listener> StartStandInListener(const std::string& socketDirectory,
                                               const std::string& serviceName, SerialQueue* queue,
                                               StandInHandler handler,
                                               std::shared_ptr<void> context = nullptr);

}  // namespace dr::testing
