#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <iterator>
#include <map>
#include <set>
#include <unordered_map>
#include <vector>

#include "core/log.h"
#include "platform/file_system.h"
#include "platform/message_service.h"
#include "wire/unix_socket.h"

namespace dr {
namespace {

// Linux 6.5 and later hand out a pidfd for the peer; older kernels refuse
// the option, and the audit token then carries none.
#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

constexpr size_t kReadChunk = 65536;
// How long the listener leaves its socket alone when accept fails for want
// of descriptors or memory.
constexpr std::chrono::milliseconds kAcceptBackOff{250};
// Reads of one connection in one turn of the loop, so that a peer sending
// without pause does not keep the loop from the others.
constexpr int kReadsPerTurn = 16;

// The pieces one write takes: a spliced reply holds a few per form, and
// the socket's buffer takes a few hundred kilobytes a call.
constexpr size_t kWriteParts = 256;

int MakeWakeFd() { return ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK); }

void DrainWakeFd(int fd) {
  uint64_t n;
  while (::read(fd, &n, sizeof n) > 0) {
  }
}

std::atomic<int> gKeepAlive{0};

void NotifyKeepAlive(int count) {
  // Only meaningful under systemd; sd_notify does nothing elsewhere.
  if (count > 0) {
    sd_notifyf(0, "STATUS=busy: %d keep-alive transaction(s)", count);
  } else {
    sd_notify(0, "STATUS=idle");
  }
}

// The most a frame of `bodyLength` bytes may count for before it is decoded,
// and what it counts for once it holds `values` values.
size_t FrameBytes(size_t bodyLength, size_t values) {
  return drm1::kHeaderSize + bodyLength + values * PeerConnection::kValueCost;
}
size_t MostFrameBytes(size_t bodyLength) {
  return FrameBytes(bodyLength, std::min(std::max<size_t>(bodyLength, 1), drm1::kMaxValues));
}

}  // namespace

void KeepAliveBegin() { NotifyKeepAlive(++gKeepAlive); }
void KeepAliveEnd() { NotifyKeepAlive(--gKeepAlive); }
int KeepAliveCount() { return gKeepAlive.load(); }

// ---- The loop ---------------------------------------------------------------

// A thread that reads connections: epoll over their sockets, plus an
// eventfd through which other threads ask it to look at a connection again
// (closed, or room made in a budget). There are kLoops of them, made when
// first needed, each living until exit. All connections of one process are
// read by the same loop, and a process with none is given the loop that
// reads the fewest: a process flooding drd keeps its own loop busy, while
// the other processes' loops sleep until their peers send, and so are
// scheduled at once although at background priority.
class ConnectionLoop {
 public:
  static constexpr size_t kLoops = 4;

  // The loop for a new connection of process `pid`.
  static ConnectionLoop& For(pid_t pid) {
    Assignments& a = Assignments::Get();
    std::lock_guard<std::mutex> lock(a.mu);
    auto it = a.byProcess.find(pid);
    size_t i;
    if (it != a.byProcess.end()) {
      i = it->second.loop;
      ++it->second.connections;
    } else {
      i = static_cast<size_t>(std::min_element(a.connections.begin(), a.connections.end()) -
                              a.connections.begin());
      a.byProcess[pid] = {i, 1};
    }
    ++a.connections[i];
    if (!a.loops[i]) a.loops[i] = new ConnectionLoop();  // served until exit
    return *a.loops[i];
  }

  // A connection of process `pid` has ended.
  static void Leave(pid_t pid) {
    Assignments& a = Assignments::Get();
    std::lock_guard<std::mutex> lock(a.mu);
    auto it = a.byProcess.find(pid);
    if (it == a.byProcess.end()) return;
    --a.connections[it->second.loop];
    if (--it->second.connections == 0) a.byProcess.erase(it);
  }

  // Serves `connection`, named by newId() already.
  void add(std::shared_ptr<PeerConnection> connection) {
    PeerConnection& c = *connection;
    c.lastProgress_ = std::chrono::steady_clock::now();
    {
      std::lock_guard<std::mutex> lock(mu_);
      connections_[c.id_] = std::move(connection);
    }
    std::lock_guard<std::mutex> lock(c.mu_);
    struct epoll_event ev = {};
    ev.events = c.interest_ = EPOLLIN;
    ev.data.u64 = c.id_;
    if (::epoll_ctl(epollFd_, EPOLL_CTL_ADD, c.fd_, &ev) != 0) {
      SystemLog("closing %@: %@", c.description(), PosixError(errno, "epoll_ctl"));
      c.closed_ = true;
    }
    if (c.closed_) post(c.id_);  // cancelled already, or not to be served
  }

  // A name for a connection about to be added.
  uint64_t newId() {
    std::lock_guard<std::mutex> lock(mu_);
    return nextId_++;
  }

  // Has the loop serve connection `id` again soon.
  void post(uint64_t id) {
    std::lock_guard<std::mutex> lock(mu_);
    postLocked(id);
  }

  void setInterest(int fd, uint64_t id, uint32_t events) {
    struct epoll_event ev = {};
    ev.events = events;
    ev.data.u64 = id;
    ::epoll_ctl(epollFd_, EPOLL_CTL_MOD, fd, &ev);  // fails only once the connection ended
  }

  void remove(PeerConnection& c) {
    ::epoll_ctl(epollFd_, EPOLL_CTL_DEL, c.fd_, nullptr);
    midFrame_.erase(c.id_);
    backlogged_.erase(c.id_);
  }

  void forget(uint64_t id) {
    std::shared_ptr<PeerConnection> last;  // perhaps the last reference: dropped unlocked
    std::lock_guard<std::mutex> lock(mu_);
    auto it = connections_.find(id);
    if (it == connections_.end()) return;
    last = std::move(it->second);
    connections_.erase(it);
  }

  // Whether `c` is waiting in the middle of a frame for its peer.
  void noteMidFrame(PeerConnection& c, bool midFrame) {
    if (midFrame) {
      midFrame_.insert(c.id_);
    } else {
      midFrame_.erase(c.id_);
    }
  }

  // Whether `c` is not read because its peer does not take its replies.
  void noteBacklogged(PeerConnection& c, bool backlogged) {
    if (backlogged) {
      backlogged_.insert(c.id_);
    } else {
      backlogged_.erase(c.id_);
    }
  }

  char* readBuffer() { return readBuffer_.get(); }

 private:
  ConnectionLoop()
      : epollFd_(::epoll_create1(EPOLL_CLOEXEC)),
        wakeFd_(MakeWakeFd()),
        readBuffer_(new char[kReadChunk]) {
    struct epoll_event ev = {};
    ev.events = EPOLLIN;
    ev.data.u64 = 0;
    if (epollFd_ < 0 || wakeFd_ < 0 || ::epoll_ctl(epollFd_, EPOLL_CTL_ADD, wakeFd_, &ev) != 0) {
      SystemLog("the connection loop cannot start: %@", PosixError(errno, "epoll"));
      std::abort();
    }
    std::thread([this] { run(); }).detach();
  }

  // Which loop reads which process's connections.
  struct Assignments {
    static Assignments& Get() {
      static Assignments* assignments = new Assignments();  // used until exit
      return *assignments;
    }
    struct Process {
      size_t loop;
      size_t connections;
    };
    std::mutex mu;
    std::array<ConnectionLoop*, kLoops> loops{};   // guarded by mu
    std::array<size_t, kLoops> connections{};      // guarded by mu
    std::unordered_map<pid_t, Process> byProcess;  // guarded by mu
  };

  void postLocked(uint64_t id) {
    const bool first = posted_.empty();
    posted_.push_back(id);
    if (first) {
      uint64_t one = 1;
      [[maybe_unused]] ssize_t n = ::write(wakeFd_, &one, sizeof one);
    }
  }

  std::shared_ptr<PeerConnection> find(uint64_t id) {
    std::lock_guard<std::mutex> lock(mu_);
    auto it = connections_.find(id);
    return it == connections_.end() ? nullptr : it->second;
  }

  void run() {
    // Reading connections gives way to running the requests read: a peer
    // flooding drd with frames waits, not the clients.
    EnterBackgroundPriority();
    struct epoll_event events[64];
    auto lastSweep = std::chrono::steady_clock::now();
    for (;;) {
      // Only a connection in the middle of a frame, or one whose peer does
      // not take its replies, has a deadline.
      const bool deadlines = !midFrame_.empty() || !backlogged_.empty();
      const int timeout = deadlines ? 1000 : -1;
      const int n = ::epoll_wait(epollFd_, events, 64, timeout);
      if (n < 0 && errno != EINTR) {
        SystemLog("the connection loop failed: %@", PosixError(errno, "epoll_wait"));
        std::abort();
      }
      for (int i = 0; i < n; ++i) {
        if (events[i].data.u64 == 0) {
          DrainWakeFd(wakeFd_);
        } else if (std::shared_ptr<PeerConnection> c = find(events[i].data.u64)) {
          c->serve(events[i].events);
        }
      }
      std::vector<uint64_t> posted;
      {
        std::lock_guard<std::mutex> lock(mu_);
        posted.swap(posted_);
      }
      for (uint64_t id : posted) {
        if (std::shared_ptr<PeerConnection> c = find(id)) c->serve(0);
      }
      const auto now = std::chrono::steady_clock::now();
      if (deadlines && now - lastSweep >= std::chrono::seconds(1)) {
        lastSweep = now;
        sweepStalled(now);
      }
    }
  }

  void sweepStalled(std::chrono::steady_clock::time_point now) {
    std::vector<uint64_t> ids(midFrame_.begin(), midFrame_.end());
    for (uint64_t id : ids) {
      std::shared_ptr<PeerConnection> c = find(id);
      if (!c || now - c->lastProgress_ < PeerConnection::kFrameStallLimit) continue;
      SystemLog("protocol error on %@: no byte for %d s in the middle of a frame", c->description(),
                static_cast<int>(PeerConnection::kFrameStallLimit.count()));
      c->end();
    }
    ids.assign(backlogged_.begin(), backlogged_.end());
    for (uint64_t id : ids) {
      std::shared_ptr<PeerConnection> c = find(id);
      if (!c) continue;
      std::chrono::steady_clock::time_point last;
      {
        std::lock_guard<std::mutex> lock(c->mu_);
        last = c->lastReplyProgress_;
      }
      if (now - last < PeerConnection::kReplyStallLimit) continue;
      SystemLog("closing %@: took none of its replies for %d s", c->description(),
                static_cast<int>(PeerConnection::kReplyStallLimit.count()));
      c->end();
    }
  }

  const int epollFd_;
  const int wakeFd_;
  std::unique_ptr<char[]> readBuffer_;
  std::mutex mu_;
  std::unordered_map<uint64_t, std::shared_ptr<PeerConnection>> connections_;  // guarded by mu_
  std::vector<uint64_t> posted_;                                               // guarded by mu_
  uint64_t nextId_ = 1;                                                        // guarded by mu_
  std::set<uint64_t> midFrame_;    // the loop thread's alone
  std::set<uint64_t> backlogged_;  // the loop thread's alone
};

// The budget all connections share, and the connections waiting for room.
struct MessageBudget {
  static MessageBudget& Get() {
    static MessageBudget* budget = new MessageBudget();  // used until exit
    return *budget;
  }

  // Takes `bytes` when they fit, or when `small` (a connection with nothing
  // in flight reading a small frame); else `c` waits for room.
  bool take(PeerConnection& c, size_t bytes, bool small) {
    std::lock_guard<std::mutex> lock(mu);
    if (small || used + bytes <= PeerConnection::kMaxBytesInFlightTotal) {
      used += bytes;
      return true;
    }
    waiting.emplace_back(c.loop_, c.id_);
    if (!full) {
      full = true;
      SystemLog("connections have %zu MiB in flight in all: reading waits for room", used >> 20);
    }
    return false;
  }

  void give(size_t bytes) {
    if (bytes == 0) return;
    std::vector<std::pair<ConnectionLoop*, uint64_t>> wake;
    {
      std::lock_guard<std::mutex> lock(mu);
      used -= bytes;
      if (waiting.empty()) {
        full = false;
        return;
      }
      wake.swap(waiting);
    }
    for (const auto& [loop, id] : wake) loop->post(id);
  }

  std::mutex mu;
  size_t used = 0;  // guarded by mu
  // Guarded by mu: connections to serve again once room is made.
  std::vector<std::pair<ConnectionLoop*, uint64_t>> waiting;
  bool full = false;  // guarded by mu: logged once until it empties
};

// A delivered message's share of the budgets.
class MessageShare {
 public:
  MessageShare(std::weak_ptr<PeerConnection> connection, size_t bytes)
      : connection_(std::move(connection)), bytes_(bytes) {}
  ~MessageShare() {
    MessageBudget::Get().give(bytes_);
    if (std::shared_ptr<PeerConnection> c = connection_.lock()) c->release(bytes_);
  }
  MessageShare(const MessageShare&) = delete;
  MessageShare& operator=(const MessageShare&) = delete;

 private:
  const std::weak_ptr<PeerConnection> connection_;
  const size_t bytes_;
};

// ---- PeerConnection ---------------------------------------------------------

PeerConnection::PeerConnection(int fd, AuditToken token) : fd_(fd), token_(token) {}

PeerConnection::~PeerConnection() {
  ::close(fd_);
  if (token_.pidfd >= 0) ::close(token_.pidfd);
}

std::string PeerConnection::description() const {
  return "<connection fd=" + std::to_string(fd_) + " pid=" + std::to_string(token_.pid) + ">";
}

void PeerConnection::setContext(std::shared_ptr<void> context) {
  std::lock_guard<std::mutex> lock(mu_);
  context_ = std::move(context);
}

void PeerConnection::setEventHandler(std::function<void(const ConnectionEvent&)> handler) {
  handler_ = std::move(handler);
}

void PeerConnection::resume() {
  if (resumed_) return;  // REQUIRES: called from one thread
  // The loop owns a reference, so the connection lives while it is served.
  loop_ = &ConnectionLoop::For(token_.pid);
  id_ = loop_->newId();  // before resumed_, which tells other threads both are set
  resumed_ = true;
  loop_->add(shared_from_this());
}

void PeerConnection::endSoon() {
  closed_ = true;
  if (resumed_) loop_->post(id_);
}

Status PeerConnection::sendReply(uint64_t requestSerial, const Value& body,
                                 std::vector<UniqueFd> descriptors) {
  drm1::Splice frame(drm1::kMaxReplyBodySize);
  frame.value(body, 1);
  return sendReply(requestSerial, std::move(frame), std::move(descriptors));
}

Status PeerConnection::sendReply(uint64_t requestSerial, drm1::Splice frame,
                                 std::vector<UniqueFd> descriptors) {
  std::lock_guard<std::mutex> lock(mu_);
  if (closed_) return Error(drm1::kDrm1ErrorDomain, drm1::kProtocolError, "connection closed");
  if (descriptors.size() > drm1::kMaxDescriptors) {
    return Error(drm1::kDrm1ErrorDomain, drm1::kUnencodable, "too many descriptors");
  }
  const uint32_t flags = drm1::kFlagIsReply | (descriptors.empty() ? 0 : drm1::kFlagDescriptors);
  if (Status sealed = frame.seal(nextSerial_, requestSerial, flags); !sealed.ok()) return sealed;
  ++nextSerial_;
  const bool queuedBefore = !outbox_.empty();
  if (queuedBefore) outboxQueued_ += frame.size();
  // A peer that does not take its replies gets no more of its requests
  // read; the loop closes it if it then takes nothing for long.
  if (outboxQueued_ > kMaxQueuedReplyBytes && !repliesBacklogged_) {
    repliesBacklogged_ = true;
    lastReplyProgress_ = std::chrono::steady_clock::now();
    SystemLog("not reading %@: more than 64 MiB of replies unread", description());
    if (id_ != 0) loop_->post(id_);
  }
  outbox_.push_back(std::move(frame));
  outboxDescriptors_.push_back(std::move(descriptors));
  // Nothing ahead of it: write it from here rather than have the loop do
  // so, which would double the thread switches of every request. A failure
  // is left to the loop to find.
  if (!queuedBefore && !writeSomeLocked()) {
    endSoon();
    return Status::OK();
  }
  updateInterestLocked();
  return Status::OK();
}

void PeerConnection::cancel() { endSoon(); }

bool PeerConnection::flush(int timeoutMs) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (outbox_.empty()) return true;
    }
    if (closed_ || std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
}

bool PeerConnection::writeSomeLocked() {
  while (!outbox_.empty()) {
    // Several queued replies leave in one call. Descriptors go with the
    // first byte of their frame, so a call that carries some starts at that
    // frame, and one stops short of the next frame that has some.
    const bool attach = outboxSent_ == 0 && !outboxDescriptors_.front().empty();
    struct iovec parts[kWriteParts];
    size_t count = 0;
    auto descriptors = outboxDescriptors_.begin();
    for (auto it = outbox_.begin(); it != outbox_.end() && count < std::size(parts);
         ++it, ++descriptors) {
      if (count > 0 && !descriptors->empty()) break;
      count += it->gather(count == 0 ? outboxSent_ : 0, parts + count, std::size(parts) - count);
    }
    static const std::vector<UniqueFd> kNone;
    ssize_t n = SendWithDescriptors(fd_, parts, count, attach ? outboxDescriptors_.front() : kNone);
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno == EAGAIN || errno == EWOULDBLOCK;
    }
    if (attach) outboxDescriptors_.front().clear();  // sent: ours are closed
    lastReplyProgress_ = std::chrono::steady_clock::now();
    size_t sent = static_cast<size_t>(n);
    while (sent > 0) {
      const size_t left = outbox_.front().size() - outboxSent_;
      if (sent < left) {
        outboxSent_ += sent;
        break;
      }
      sent -= left;
      outbox_.pop_front();
      outboxDescriptors_.pop_front();
      outboxSent_ = 0;
      if (!outbox_.empty()) outboxQueued_ -= outbox_.front().size();
    }
    if (repliesBacklogged_ && outboxQueued_ <= kMaxQueuedReplyBytes) {
      repliesBacklogged_ = false;  // the loop reads again when it next serves it
      SystemLog("reading %@ again: its replies are taken", description());
    }
  }
  return true;
}

void PeerConnection::updateInterestLocked() {
  if (closed_ || id_ == 0) return;
  const uint32_t events = (reading_ ? EPOLLIN : 0u) | (outbox_.empty() ? 0u : EPOLLOUT);
  if (events == interest_) return;
  interest_ = events;
  loop_->setInterest(fd_, id_, events);
}

void PeerConnection::release(size_t bytes) {
  bool wake;
  {
    std::lock_guard<std::mutex> lock(mu_);
    --inFlight_;
    inFlightBytes_ -= bytes;
    wake = waitingForBudget_;
    waitingForBudget_ = false;
  }
  if (wake) loop_->post(id_);
}

bool PeerConnection::serve(uint32_t events) {
  ConnectionLoop& loop = *loop_;
  if (closed_) {
    end();
    return false;
  }
  if (events & EPOLLOUT) {
    std::lock_guard<std::mutex> lock(mu_);
    if (!writeSomeLocked()) {
      closed_ = true;
    } else {
      updateInterestLocked();
    }
  }
  if (closed_) {
    end();
    return false;
  }
  Pump state = Pump::kNeedBytes;
  // A read shorter than asked for most likely emptied the socket: the loop
  // hears of more, so it does not ask again only to be told there is none,
  // unless the peer has hung up, whose end is then found at once.
  bool drained = false;
  for (int reads = 0;; ++reads) {
    state = deliverFrames();
    if (state != Pump::kNeedBytes || reads == kReadsPerTurn) break;
    if (drained && !(events & (EPOLLHUP | EPOLLRDHUP | EPOLLERR))) break;
    bool sawDescriptors = false;
    const ssize_t n =
        ReceiveRefusingDescriptors(fd_, loop.readBuffer(), kReadChunk, &sawDescriptors);
    if (sawDescriptors) {
      SystemLog("protocol error on %@: descriptors sent with a request", description());
      state = Pump::kBroken;
      break;
    }
    if (n > 0) {
      decoder_.feed(std::string_view(loop.readBuffer(), static_cast<size_t>(n)));
      lastProgress_ = std::chrono::steady_clock::now();
      drained = static_cast<size_t>(n) < kReadChunk;
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
    state = Pump::kBroken;  // the peer hung up, or the socket failed
    break;
  }
  // Not reading, the socket's hang-up would be reported again and again.
  if (state == Pump::kWaiting && (events & (EPOLLHUP | EPOLLERR))) state = Pump::kBroken;
  if (state == Pump::kBroken || closed_) {
    end();
    return false;
  }
  const bool reading = state == Pump::kNeedBytes;
  {
    std::lock_guard<std::mutex> lock(mu_);
    // Time waiting for a budget is not the peer's stall.
    if (reading && !reading_) lastProgress_ = std::chrono::steady_clock::now();
    reading_ = reading;
    updateInterestLocked();
  }
  loop.noteMidFrame(*this, reading && decoder_.buffered() > 0);
  bool backlogged;
  {
    std::lock_guard<std::mutex> lock(mu_);
    backlogged = repliesBacklogged_;
  }
  loop.noteBacklogged(*this, backlogged);
  return true;
}

PeerConnection::Pump PeerConnection::deliverFrames() {
  for (;;) {
    bool idle;
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (repliesBacklogged_) return Pump::kWaiting;  // writing its replies resumes it
      if (inFlight_ >= kMaxMessagesInFlight || inFlightBytes_ >= kMaxBytesInFlight) {
        waitingForBudget_ = true;
        return Pump::kWaiting;
      }
      idle = inFlight_ == 0;
    }
    Result<std::optional<drm1::Header>> header = decoder_.nextHeader();
    if (!header.ok()) {
      SystemLog("protocol error on %@: %@", description(), header.error());
      return Pump::kBroken;
    }
    if (!header->has_value()) return Pump::kNeedBytes;
    const drm1::Header& h = **header;
    if (h.isReply()) {
      SystemLog("protocol error on %@: a peer sent a reply", description());
      return Pump::kBroken;
    }
    if (h.carriesDescriptors()) {
      SystemLog("protocol error on %@: a request may not carry descriptors", description());
      return Pump::kBroken;
    }
    if (reserved_ == 0) {
      const size_t most = MostFrameBytes(h.bodyLength);
      if (!MessageBudget::Get().take(*this, most, idle && h.bodyLength <= kSmallFrameBytes)) {
        return Pump::kWaiting;
      }
      reserved_ = most;
    }
    Result<std::optional<drm1::Frame>> frame = decoder_.next();
    if (!frame.ok()) {
      SystemLog("protocol error on %@: %@", description(), frame.error());
      return Pump::kBroken;
    }
    if (!frame->has_value()) return Pump::kNeedBytes;
    drm1::Frame& f = **frame;
    const size_t bytes = FrameBytes(f.header.bodyLength, f.values);
    MessageBudget::Get().give(reserved_ - bytes);
    reserved_ = 0;
    {
      std::lock_guard<std::mutex> lock(mu_);
      ++inFlight_;
      inFlightBytes_ += bytes;
    }
    ConnectionEvent event;
    event.message = PeerMessage{f.header.serial, f.header.wantsReply(), std::move(f.body),
                                std::make_shared<MessageShare>(weak_from_this(), bytes)};
    if (handler_) handler_(event);
  }
}

void PeerConnection::end() {
  ConnectionLoop& loop = *loop_;
  closed_ = true;
  loop.remove(*this);
  ::shutdown(fd_, SHUT_RDWR);
  MessageBudget::Get().give(reserved_);
  reserved_ = 0;
  decoder_ = drm1::FrameDecoder();
  {
    std::lock_guard<std::mutex> lock(mu_);
    outbox_.clear();
    outboxDescriptors_.clear();
    outboxSent_ = outboxQueued_ = 0;
  }
  ConnectionEvent invalid;
  invalid.kind = ConnectionEvent::Kind::kConnectionInvalid;
  if (handler_) handler_(invalid);
  handler_ = nullptr;
  // The finalizer: the context goes once the last event was delivered.
  std::shared_ptr<void> context;
  {
    std::lock_guard<std::mutex> lock(mu_);
    context = std::move(context_);
  }
  context.reset();
  ConnectionLoop::Leave(token_.pid);
  loop.forget(id_);  // the loop's reference, perhaps the last
}

// ---- Listener ---------------------------------------------------------------

namespace {

// A listening socket passed by systemd, or -1: the listening Unix stream
// socket bound to `path` when one is, else the first listening Unix stream
// socket (a unit may listen under another name). Every other descriptor
// passed is closed, with a log line.
int TakeActivatedSocket(const std::string& path) {
  int n = sd_listen_fds(1);
  if (n <= 0) return -1;
  int atPath = -1, first = -1;
  for (int fd = SD_LISTEN_FDS_START; fd < SD_LISTEN_FDS_START + n && atPath < 0; ++fd) {
    if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) <= 0) continue;
    if (first < 0) first = fd;
    // A length of 0 asks for a socket bound to that (NUL-terminated) path.
    if (sd_is_socket_unix(fd, SOCK_STREAM, 1, path.c_str(), 0) > 0) atPath = fd;
  }
  const int chosen = atPath >= 0 ? atPath : first;
  for (int fd = SD_LISTEN_FDS_START; fd < SD_LISTEN_FDS_START + n; ++fd) {
    if (fd == chosen) {
      ::fcntl(fd, F_SETFD, FD_CLOEXEC);
    } else {
      SystemLog("closing passed descriptor %d: not the one listening Unix stream socket", fd);
      ::close(fd);
    }
  }
  return chosen;
}

}  // namespace

Result<std::unique_ptr<Listener>> Listener::Create(const ListenerOptions& options,
                                                   SerialQueue* eventQueue) {
  if (options.useSocketActivation) {
    int fd = TakeActivatedSocket(options.socketDirectory + "/" + options.serviceName);
    if (fd >= 0) return std::unique_ptr<Listener>(new Listener(fd, "", false, eventQueue));
  }
  const std::string& name = options.serviceName;
  if (name.empty() || name == "." || name == ".." || name.find('/') != std::string::npos) {
    return Error(kPosixErrorDomain, EINVAL, "invalid service name \"" + name + "\"");
  }
  const std::string path = options.socketDirectory + "/" + name;
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof addr.sun_path) {
    return Error(kPosixErrorDomain, ENAMETOOLONG, "socket path too long: " + path);
  }
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  if (Status s = FileSystem::Default()->makeDirectories(options.socketDirectory, 0700); !s.ok()) {
    return s.error();
  }

  struct stat st;
  if (::lstat(path.c_str(), &st) == 0) {
    if (!S_ISSOCK(st.st_mode)) {
      return Error(kPosixErrorDomain, EEXIST, path + " exists and is not a socket");
    }
    // Somebody accepting on it means the name is taken; a refusal means the
    // socket was left behind by a daemon that is gone.
    int probe = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (probe < 0) return PosixError(errno, "socket");
    int rc = ::connect(probe, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr);
    int err = errno;
    ::close(probe);
    if (rc == 0) {
      return Error(kPosixErrorDomain, EADDRINUSE, "service \"" + name + "\" is already served");
    }
    if (err != ECONNREFUSED && err != ENOENT) return PosixError(err, "connect " + path);
    ::unlink(path.c_str());
  }

  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return PosixError(errno, "socket");
  // The folder is private already; the socket itself is the user's alone too.
  mode_t old = ::umask(0077);
  int rc = ::bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr);
  int err = errno;
  ::umask(old);
  if (rc != 0 || ::listen(fd, SOMAXCONN) != 0) {
    if (rc == 0) err = errno;
    ::close(fd);
    return PosixError(err, "listen on " + path);
  }
  return std::unique_ptr<Listener>(new Listener(fd, path, true, eventQueue));
}

// Connections accepted and not yet handed to the handler, by peer process,
// and the order in which the processes take their turns.
struct Listener::Arrivals {
  std::mutex mu;
  std::condition_variable room;
  std::map<pid_t, std::deque<std::shared_ptr<PeerConnection>>> waiting;  // guarded by mu
  std::deque<pid_t> turns;  // guarded by mu: each process with waiting connections, once
  size_t count = 0;         // guarded by mu: connections in `waiting`

  void add(std::shared_ptr<PeerConnection> connection) {
    std::lock_guard<std::mutex> lock(mu);
    auto& queue = waiting[connection->pid()];
    if (queue.empty()) turns.push_back(connection->pid());
    queue.push_back(std::move(connection));
    ++count;
  }
  // The first connection of the process whose turn it is; that process goes
  // to the back of the line if it has more.
  std::shared_ptr<PeerConnection> next() {
    std::lock_guard<std::mutex> lock(mu);
    if (turns.empty()) return nullptr;
    const pid_t pid = turns.front();
    turns.pop_front();
    auto it = waiting.find(pid);
    std::shared_ptr<PeerConnection> connection = std::move(it->second.front());
    it->second.pop_front();
    if (it->second.empty()) {
      waiting.erase(it);
    } else {
      turns.push_back(pid);
    }
    if (count-- == kMaxWaitingConnections) room.notify_all();
    return connection;
  }
  // Blocks while kMaxWaitingConnections wait, until one is handed over or
  // `stopping` is set (and room notified).
  void waitForRoom(const std::atomic<bool>& stopping) {
    std::unique_lock<std::mutex> lock(mu);
    room.wait(lock, [&] { return count < kMaxWaitingConnections || stopping; });
  }
  void wakeAll() {
    std::lock_guard<std::mutex> lock(mu);
    room.notify_all();
  }
};

Listener::Listener(int fd, std::string path, bool ownsPath, SerialQueue* queue)
    : fd_(fd),
      wakeFd_(MakeWakeFd()),
      path_(std::move(path)),
      ownsPath_(ownsPath),
      queue_(queue),
      arrivals_(std::make_shared<Arrivals>()) {}

Listener::~Listener() {
  stop();
  ::close(fd_);
  if (wakeFd_ >= 0) ::close(wakeFd_);
  if (ownsPath_) ::unlink(path_.c_str());
}

void Listener::setEventHandler(std::function<void(std::shared_ptr<PeerConnection>)> handler) {
  handler_ = std::move(handler);
}

void Listener::resume() {
  if (thread_.joinable()) return;
  thread_ = std::thread([this] { acceptLoop(); });
}

void Listener::stop() {
  stopping_ = true;
  arrivals_->wakeAll();
  uint64_t one = 1;
  [[maybe_unused]] ssize_t n = ::write(wakeFd_, &one, sizeof one);
  if (thread_.joinable()) thread_.join();
}

void Listener::acceptLoop() {
  EnterBackgroundPriority();
  // Out of descriptors (or memory), and since when.
  bool outOfDescriptors = false;
  std::chrono::steady_clock::time_point outSince;
  while (!stopping_) {
    // A peer connecting faster than connections are handed over would
    // otherwise hold an unbounded number of descriptors here; beyond the
    // limit new peers wait in the socket's backlog instead.
    arrivals_->waitForRoom(stopping_);
    if (stopping_) return;
    struct pollfd fds[2] = {{fd_, POLLIN, 0}, {wakeFd_, POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      SystemLog("listener poll failed: %@", PosixError(errno, "poll"));
      return;
    }
    if (stopping_) return;
    if (!(fds[0].revents & POLLIN)) continue;
    int fd = ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) {
      const int err = errno;
      if (err == EINTR || err == EAGAIN || err == ECONNABORTED) continue;
      // Out of descriptors or memory: the peers wait in the backlog while
      // the connections already made go on; said once, not per attempt.
      if (!outOfDescriptors) {
        outOfDescriptors = true;
        outSince = std::chrono::steady_clock::now();
        SystemLog("accept failed: %@; new connections wait until descriptors are free",
                  PosixError(err, "accept"));
      }
      // The listening socket is not polled for a while; a stop still ends
      // the wait at once.
      struct pollfd wake = {wakeFd_, POLLIN, 0};
      ::poll(&wake, 1, static_cast<int>(kAcceptBackOff.count()));
      continue;
    }
    if (outOfDescriptors) {
      SystemLog("accepting again after %lld ms out of descriptors",
                static_cast<long long>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                           std::chrono::steady_clock::now() - outSince)
                                           .count()));
      outOfDescriptors = false;
    }
    struct ucred cred;
    socklen_t len = sizeof cred;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
      SystemLog("closing a peer without credentials: %@", PosixError(errno, "SO_PEERCRED"));
      ::close(fd);
      continue;
    }
    if (cred.uid != ::geteuid()) {
      SystemLog("refusing peer pid %d of uid %d: drd serves uid %d only", cred.pid, cred.uid,
                ::geteuid());
      ::close(fd);
      continue;
    }
    AuditToken token{cred.pid, cred.uid, cred.gid, -1};
    int pidfd = -1;
    len = sizeof pidfd;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &len) == 0) token.pidfd = pidfd;
    handOver(std::shared_ptr<PeerConnection>(new PeerConnection(fd, token)));
  }
}

void Listener::handOver(std::shared_ptr<PeerConnection> connection) {
  if (!handler_) return;
  arrivals_->add(std::move(connection));
  // One piece of work per connection, each taking whichever connection's
  // turn it is when it runs.
  queue_->async([handler = handler_, arrivals = arrivals_] {
    if (std::shared_ptr<PeerConnection> next = arrivals->next()) handler(next);
  });
}

}  // namespace dr
