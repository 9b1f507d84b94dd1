// A stand-in for drd in tests of the message service and the client
// library: a real listener on a real socket whose connections hand every
// event to the test.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "core/queue.h"
#include "platform/message_service.h"

namespace dr::testing {

// Called on the connection's own thread; `connection` is null once the
// connection is gone. Connection threads may deliver a last event after the
// test that made the listener ended, so the handler must not reach into a
// test fixture on a connection-invalid event.
using StandInHandler =
    std::function<void(const std::shared_ptr<PeerConnection>& connection, const ConnectionEvent&)>;

// The listener at <socketDirectory>/<serviceName> (no socket activation),
// accepting; each connection gets `handler` and, while the caller keeps it,
// `context` (the listener itself holds it only weakly). Null (and a test
// failure) when it cannot be made.
std::unique_ptr<Listener> StartStandInListener(const std::string& socketDirectory,
                                               const std::string& serviceName, SerialQueue* queue,
                                               StandInHandler handler,
                                               std::shared_ptr<void> context = nullptr);

}  // namespace dr::testing
