// The message service: drd's listening socket and its peer connections.
//
// A Listener accepts on a Unix stream socket ($DR_SOCKET_DIR/<service name>,
// or the socket systemd passed) and hands each new peer of the daemon's own
// uid to its handler on the event queue it was given; peers of another uid
// are closed at once with a log line. New peers are handed over one at a time
// in turns by process: a process that connects in a loop gets one turn per
// round, so another process's new connection waits for at most one of its
// connections, not for all of them. At most kMaxWaitingConnections wait
// for their turn; beyond that new peers stay in the socket's backlog until
// the queue catches up, so a peer connecting in a loop cannot exhaust the
// daemon's descriptors; when they run out all the same, accepting pauses
// (logged once) while the connections already made are served.
//
// Connections are read by a few event loop threads (epoll), all of one
// process's connections by the same loop, so a connection idle between
// frames costs no thread; a loop decodes DRM1 frames and delivers each
// connection's events to its handler one at a time, in order:
// a message per frame, and a final kConnectionInvalid when the peer hangs
// up, breaks the protocol (logged, and only that connection closes), stops
// for kFrameStallLimit in the middle of a frame, or is cancelled.
//
// Budgets. Every message delivered holds a share of its connection's budget
// until the work it started is over (the last copy of its PeerMessage is
// gone), whether it wants a reply or not: at kMaxMessagesInFlight messages
// or kMaxBytesInFlight bytes the connection is not read until work ends.
// All connections together hold at most kMaxBytesInFlightTotal, counted
// from a frame's header on (its bytes, and what its values may decode to),
// except that a connection with nothing in flight may always bring in one
// frame of at most kSmallFrameBytes, so that an ordinary client is served
// while others hold the whole budget. A connection over a budget is not
// closed: it waits, and so does its peer.
//
// Replies are queued per connection: one with nothing queued before it is
// written at once by the sender, as far as the socket takes it without
// waiting, and the rest by the loop, so sending never blocks the caller; a
// peer whose queue passes kMaxQueuedReplyBytes (the reply being written not
// counted) is not read until it takes them, and is closed when it takes
// none for kReplyStallLimit.
//
// Ownership: a connection keeps itself alive while the loop serves it, and
// holds its context object until its last event has been delivered; callers
// keep weak references. All members are safe to call from any thread.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "core/queue.h"
#include "core/status.h"
#include "core/unique_fd.h"
#include "core/value.h"
#include "wire/drm1.h"

namespace dr {

// Who is at the other end, as the kernel told it at accept time.
struct AuditToken {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  int pidfd = -1;  // -1 where the kernel cannot give one
};

struct PeerMessage {
  uint64_t serial = 0;
  bool wantsReply = false;
  Value body;  // a dictionary
  // The message's share of its connection's budget, given back when the
  // last copy of the message is gone.
  std::shared_ptr<const void> budget;
};

class ConnectionLoop;

struct ConnectionEvent {
  enum class Kind { kMessage, kConnectionInvalid };
  Kind kind = Kind::kMessage;
  PeerMessage message;  // for kMessage
};

class PeerConnection : public std::enable_shared_from_this<PeerConnection> {
 public:
  static constexpr size_t kMaxQueuedReplyBytes = size_t{64} << 20;
  // Messages delivered whose work is not over, per connection, with or
  // without a reply: one peer that pipelines without end cannot fill the
  // queue every peer's requests share.
  static constexpr uint32_t kMaxMessagesInFlight = 64;
  // The bytes those messages count for, per connection and in all: a
  // frame's own bytes plus kValueCost per value it holds, at least what its
  // decoded values take in memory (41 bytes a null in an array, 50 a short
  // string, 88 a dictionary entry with its own key). A 16 MiB frame counts
  // up to 112 MiB, so two such are in drd at once.
  static constexpr size_t kMaxBytesInFlight = size_t{16} << 20;
  static constexpr size_t kMaxBytesInFlightTotal = size_t{256} << 20;
  static constexpr size_t kValueCost = 96;
  // What a connection with nothing in flight may bring in past the total.
  static constexpr size_t kSmallFrameBytes = 4096;
  // How long a peer may stop in the middle of a frame.
  static constexpr std::chrono::seconds kFrameStallLimit{30};
  // A connection not read for its unread replies is closed when its peer
  // takes none of them for this long.
  static constexpr std::chrono::seconds kReplyStallLimit{30};

  ~PeerConnection();
  PeerConnection(const PeerConnection&) = delete;
  PeerConnection& operator=(const PeerConnection&) = delete;

  const AuditToken& auditToken() const { return token_; }
  pid_t pid() const { return token_.pid; }
  // "<connection fd=%d pid=%d>", for logs.
  std::string description() const;

  // The object the connection keeps alive until its last event was handled.
  void setContext(std::shared_ptr<void> context);
  // REQUIRES: called once, before resume().
  void setEventHandler(std::function<void(const ConnectionEvent&)> handler);
  // Starts reading and delivering events.
  void resume();

  // Queues the reply bound to the request with serial `requestSerial`.
  // Fails when the body cannot be encoded (nothing is sent) or when the
  // connection is closed; a queue past its limit closes the connection.
  // `descriptors` (at most drm1::kMaxDescriptors) go with it and are closed
  // here once sent.
  Status sendReply(uint64_t requestSerial, const Value& body,
                   std::vector<UniqueFd> descriptors = {});
  // The same for a body already written as pieces (its frame is sealed
  // here), whose shared pieces are written from where they lie.
  Status sendReply(uint64_t requestSerial, drm1::Splice frame,
                   std::vector<UniqueFd> descriptors = {});
  // Closes the connection; the handler then gets kConnectionInvalid.
  void cancel();
  bool isOpen() const { return !closed_.load(); }

  // Waits up to `timeoutMs` for the queued replies to be written; true when
  // none is left.
  bool flush(int timeoutMs);

 private:
  friend class Listener;
  friend class ConnectionLoop;
  friend struct MessageBudget;
  friend class MessageShare;
  enum class Pump { kNeedBytes, kWaiting, kBroken };

  PeerConnection(int fd, AuditToken token);
  // On the loop thread: serves the connection after `events` (0 when it
  // was asked to look again); false once it has ended.
  bool serve(uint32_t events);
  Pump deliverFrames();
  void end();
  void release(size_t bytes);   // a message's budget comes back
  void endSoon();               // from any thread: the loop ends it
  bool writeSomeLocked();       // false when the peer is gone; REQUIRES: mu_ held
  void updateInterestLocked();  // REQUIRES: mu_ held

  const int fd_;
  const AuditToken token_;
  ConnectionLoop* loop_ = nullptr;  // the loop that reads it, set by resume()
  uint64_t id_ = 0;                 // the loop's name for it, set by resume()
  std::atomic<bool> closed_{false};
  std::atomic<bool> resumed_{false};

  mutable std::mutex mu_;
  std::deque<drm1::Splice> outbox_;  // guarded by mu_: sealed frames not yet written
  // The descriptors sent with each frame of outbox_ (most have none).
  std::deque<std::vector<UniqueFd>> outboxDescriptors_;  // guarded by mu_
  size_t outboxSent_ = 0;          // guarded by mu_: bytes of the first one written
  size_t outboxQueued_ = 0;        // guarded by mu_: bytes of all but the first
  uint64_t nextSerial_ = 1;        // guarded by mu_
  uint32_t inFlight_ = 0;          // guarded by mu_: messages whose work is not over
  size_t inFlightBytes_ = 0;       // guarded by mu_
  bool reading_ = true;            // guarded by mu_: wants to read the socket
  bool waitingForBudget_ = false;  // guarded by mu_: a release must wake the loop
  // Over kMaxQueuedReplyBytes of replies unread: not read until they go.
  bool repliesBacklogged_ = false;                           // guarded by mu_
  std::chrono::steady_clock::time_point lastReplyProgress_;  // guarded by mu_
  uint32_t interest_ = 0;          // guarded by mu_: the events asked of epoll
  std::shared_ptr<void> context_;  // guarded by mu_
  std::function<void(const ConnectionEvent&)> handler_;  // set before resume

  // The loop thread's alone.
  drm1::FrameDecoder decoder_;
  size_t reserved_ = 0;  // of the total budget, for the frame being read
  std::chrono::steady_clock::time_point lastProgress_;
};

struct ListenerOptions {
  // The folder of the socket (made 0700 when missing) and the service name;
  // the socket is <socketDirectory>/<serviceName>.
  std::string socketDirectory;
  std::string serviceName;
  // Take a socket passed by systemd (LISTEN_FDS) when there is one.
  bool useSocketActivation = true;
};

class Listener {
 public:
  static constexpr size_t kMaxWaitingConnections = 256;

  // Opens the listening socket, suspended until resume(). A stale socket file
  // (nobody accepts on it) is replaced; a live one means the name is taken,
  // and anything else at that path is left alone: both are errors.
  static Result<std::unique_ptr<Listener>> Create(const ListenerOptions& options,
                                                  SerialQueue* eventQueue);
  ~Listener();

  // Each new peer connection goes to `handler` on the event queue.
  void setEventHandler(std::function<void(std::shared_ptr<PeerConnection>)> handler);
  // Starts accepting, on a thread of background priority: under a flood of
  // connections the work of the ones already made goes first, and the flood
  // waits in the socket's backlog.
  void resume();
  // Stops accepting; connections already made carry on.
  void stop();
  const std::string& path() const { return path_; }

 private:
  struct Arrivals;  // accepted connections waiting for the event queue

  Listener(int fd, std::string path, bool ownsPath, SerialQueue* queue);
  void acceptLoop();
  void handOver(std::shared_ptr<PeerConnection> connection);

  const int fd_;
  const int wakeFd_;
  const std::string path_;
  const bool ownsPath_;
  SerialQueue* const queue_;
  std::function<void(std::shared_ptr<PeerConnection>)> handler_;
  std::shared_ptr<Arrivals> arrivals_;  // shared with the work queued on queue_
  std::thread thread_;
  std::atomic<bool> stopping_{false};
};

// Keep-alive transactions: while the count is above zero the daemon is busy
// and must not exit for idleness (under systemd the status says so).
void KeepAliveBegin();
void KeepAliveEnd();
int KeepAliveCount();

}  // namespace dr
