#include "tests/support/stand_in_listener.h"

#include <gtest/gtest.h>

namespace dr::testing {

std::unique_ptr<Listener> StartStandInListener(const std::string& socketDirectory,
                                               const std::string& serviceName, SerialQueue* queue,
                                               StandInHandler handler,
                                               std::shared_ptr<void> context) {
  ListenerOptions options;
  options.socketDirectory = socketDirectory;
  options.serviceName = serviceName;
  options.useSocketActivation = false;
  Result<std::unique_ptr<Listener>> listener = Listener::Create(options, queue);
  if (!listener.ok()) {
    ADD_FAILURE() << listener.error().description();
    return nullptr;
  }
  // The context is held weakly here, so that only connections keep it.
  std::weak_ptr<void> weakContext = context;
  (*listener)->setEventHandler([handler, weakContext](std::shared_ptr<PeerConnection> c) {
    std::weak_ptr<PeerConnection> weak = c;
    if (std::shared_ptr<void> context = weakContext.lock()) c->setContext(std::move(context));
    c->setEventHandler([handler, weak](const ConnectionEvent& e) { handler(weak.lock(), e); });
    c->resume();
  });
  (*listener)->resume();
  return std::move(*listener);
}

}  // namespace dr::testing
