// A host's connection to drd, the per-user plug-in registry daemon.
//
// What: Open() connects to drd's socket, <socketDirectory>/<serviceName>.
// request() sends one message that wants a reply and waits for the reply
// bound to it; send() sends one message that wants none. Each message gets a
// fresh serial, non-zero and increasing on this connection. Frames that are
// not the awaited reply (for instance the late reply to a request that timed
// out) are skipped.
//
// Threads: a Connection may be used from any thread; calls are serialized,
// so one request waits for the one before it to finish.
//
// Errors are dr::Error values (core/status.h, installed with this header)
// and messages are dr::Value dictionaries (core/value.h).
//
// Failure: every failure is a returned error, never an exception or a
// signal. Connecting fails with the system's error (a missing socket means
// drd is not running under that name). Once drd closes the connection, or
// sends bytes that break the protocol, the connection is dead: that call and
// every later one fail with kClientErrorDomain (kConnectionClosed or
// kProtocolError), and the host opens a new connection. A request whose
// reply does not come in time fails with kTimeout and leaves the connection
// usable. A message that cannot be encoded fails with drd's encoding error
// and sends nothing.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "core/status.h"
#include "core/value.h"
#include "export.h"

namespace dr::client {

inline constexpr const char* kClientErrorDomain = "drd.client";
inline constexpr int64_t kConnectionClosed = 1;  // drd closed the connection
inline constexpr int64_t kProtocolError = 2;     // drd's bytes broke the frame rules
inline constexpr int64_t kTimeout = 3;           // no reply (or no room to send) in time

inline constexpr const char* kDefaultServiceName = "com.corvel.dromon.drd";
inline constexpr std::chrono::milliseconds kDefaultTimeout{30000};

// The folder of drd's sockets for this user: $DR_SOCKET_DIR, else
// $XDG_RUNTIME_DIR/dromon, else /tmp/dromon-<uid>.
DRD_EXPORT std::string DefaultSocketDirectory();

class DRD_EXPORT Connection {
 public:
  static Result<std::unique_ptr<Connection>> Open(
      const std::string& serviceName = kDefaultServiceName,
      const std::string& socketDirectory = DefaultSocketDirectory());
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Sends `message` (a dictionary) wanting a reply; the reply's body.
  Result<Value> request(const Value& message, std::chrono::milliseconds timeout = kDefaultTimeout);
  // request(), and the descriptors drd sent with the reply (its "open"
  // reply carries one), which the caller then owns and closes.
  Result<Value> request(const Value& message, std::chrono::milliseconds timeout,
                        std::vector<int>* descriptors);
  // Sends `message` (a dictionary) wanting no reply.
  Status send(const Value& message, std::chrono::milliseconds timeout = kDefaultTimeout);

  // False once drd closed the connection or broke the protocol.
  bool isOpen() const;

  // The connection's socket, for a caller that waits in poll() between
  // requests (-1 once the connection is known dead). drd sends nothing
  // unasked, so between requests it turns readable only when drd closes the
  // connection (or dies). Owned by the Connection: read, write or close it
  // only through the members above.
  int descriptor() const;

 private:
  struct State;  // the socket and the frame decoder, kept out of this header
  explicit Connection(int fd);

  std::unique_ptr<State> state_;
};

}  // namespace dr::client
