#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <map>

#include "core/log.h"
#include "platform/file_system.h"
#include "platform/message_service.h"
#include "platform/unix_socket.h"

namespace dr {
namespace {

// Linux 6.5 and later hand out a pidfd for the peer; older kernels refuse
// the option, and the audit token then carries none.
#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

constexpr size_t kReadChunk = 65536;

int MakeWakeFd() { return ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK); }

void DrainWakeFd(int fd) {
  uint64_t n;
  while (::read(fd, &n, sizeof n) > 0) {
  }
}

std::atomic<int> gKeepAlive{0};

// How long a connection's thread waits for another connection to serve
// before it ends, and how many may wait at once: a burst of thousands of
// connections must not leave thousands of threads behind, which would also
// end all at once and hold up thread creation meanwhile (glibc frees their
// stacks under one lock).
constexpr auto kReaderLinger = std::chrono::seconds(10);
constexpr size_t kMaxIdleReaders = 16;

// The threads connections read on. A thread whose connection ended waits a
// while for the next one instead of ending: a peer that connects and
// disconnects in a loop otherwise costs a thread's creation and teardown
// (clone, stack mapping and guard page) per connection, about a tenth of
// what drd spends on such a connection.
class ReaderThreads {
 public:
  static ReaderThreads& Get() {
    static ReaderThreads* threads = new ReaderThreads();  // waiting threads use it until exit
    return *threads;
  }

  // Runs `job` on a waiting thread, or on a new one when none waits.
  void run(std::function<void()> job) {
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (idle_ > jobs_.size()) {
        jobs_.push_back(std::move(job));
        cv_.notify_one();
        return;
      }
    }
    std::thread([this, job = std::move(job)]() mutable {
      // Reading connections gives way to running the requests read: a peer
      // flooding drd with connections or frames waits, not the clients.
      EnterBackgroundPriority();
      job();
      job = nullptr;  // release what the job holds before waiting
      serveMore();
    }).detach();
  }

 private:
  void serveMore() {
    std::unique_lock<std::mutex> lock(mu_);
    for (;;) {
      if (idle_ >= kMaxIdleReaders) return;
      ++idle_;
      const bool got = cv_.wait_for(lock, kReaderLinger, [&] { return !jobs_.empty(); });
      --idle_;
      if (!got) return;
      std::function<void()> job = std::move(jobs_.front());
      jobs_.pop_front();
      lock.unlock();
      job();
      job = nullptr;
      lock.lock();
    }
  }

  std::mutex mu_;
  std::condition_variable cv_;
  std::deque<std::function<void()>> jobs_;  // guarded by mu_
  size_t idle_ = 0;                         // guarded by mu_: threads waiting for a job
};

void NotifyKeepAlive(int count) {
  // Only meaningful under systemd; sd_notify does nothing elsewhere.
  if (count > 0) {
    sd_notifyf(0, "STATUS=busy: %d keep-alive transaction(s)", count);
  } else {
    sd_notify(0, "STATUS=idle");
  }
}

}  // namespace

void KeepAliveBegin() { NotifyKeepAlive(++gKeepAlive); }
void KeepAliveEnd() { NotifyKeepAlive(--gKeepAlive); }
int KeepAliveCount() { return gKeepAlive.load(); }

// ---- PeerConnection ---------------------------------------------------------

PeerConnection::PeerConnection(int fd, AuditToken token)
    : fd_(fd), wakeFd_(MakeWakeFd()), token_(token) {}

PeerConnection::~PeerConnection() {
  ::close(fd_);
  if (wakeFd_ >= 0) ::close(wakeFd_);
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
  if (resumed_.exchange(true)) return;
  // The thread owns a reference, so the connection lives while it reads.
  ReaderThreads::Get().run([self = shared_from_this()] { self->run(); });
}

void PeerConnection::wake() {
  uint64_t one = 1;
  [[maybe_unused]] ssize_t n = ::write(wakeFd_, &one, sizeof one);
}

Status PeerConnection::sendReply(uint64_t requestSerial, const Value& body,
                                 std::vector<UniqueFd> descriptors) {
  std::lock_guard<std::mutex> lock(mu_);
  if (closed_) return Error(drm1::kDrm1ErrorDomain, drm1::kProtocolError, "connection closed");
  if (descriptors.size() > drm1::kMaxDescriptors) {
    return Error(drm1::kDrm1ErrorDomain, drm1::kUnencodable, "too many descriptors");
  }
  const uint32_t flags = drm1::kFlagIsReply | (descriptors.empty() ? 0 : drm1::kFlagDescriptors);
  Result<std::string> frame = drm1::EncodeFrame(nextSerial_, requestSerial, flags, body);
  if (!frame) return frame.error();
  ++nextSerial_;
  // A connection at its limit of unanswered requests is not being read; its
  // thread must hear that this reply makes room.
  const bool wasFull = unanswered_ >= kMaxUnansweredRequests;
  if (unanswered_ > 0) --unanswered_;
  if (outbox_.size() - outboxSent_ + frame->size() > kMaxQueuedReplyBytes) {
    SystemLog("closing %@: more than 64 MiB of replies unread", description());
    closed_ = true;
    wake();
    return Error(drm1::kDrm1ErrorDomain, drm1::kProtocolError, "reply queue full");
  }
  const bool queuedBefore = outboxSent_ < outbox_.size();
  if (!descriptors.empty()) outboxDescriptors_.emplace_back(outbox_.size(), std::move(descriptors));
  outbox_ += *frame;
  // Nothing ahead of it: write it from here rather than waking the
  // connection's thread to do so, which would double the thread switches
  // of every request. A failure is left to that thread to find.
  if (!queuedBefore) writeSomeLocked();
  if (outboxSent_ < outbox_.size() || wasFull) wake();
  return Status::OK();
}

void PeerConnection::cancel() {
  closed_ = true;
  wake();
}

bool PeerConnection::flush(int timeoutMs) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  for (;;) {
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (outboxSent_ == outbox_.size()) return true;
    }
    if (closed_ || std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
}

bool PeerConnection::writeSome() {
  std::lock_guard<std::mutex> lock(mu_);
  return writeSomeLocked();
}

bool PeerConnection::writeSomeLocked() {
  static const std::vector<UniqueFd> kNone;
  while (outboxSent_ < outbox_.size()) {
    // Descriptors go with the first byte of their frame, and a write stops
    // short of the next frame that carries some.
    size_t end = outbox_.size();
    const std::vector<UniqueFd>* attached = &kNone;
    if (!outboxDescriptors_.empty()) {
      if (outboxDescriptors_.front().first == outboxSent_) {
        attached = &outboxDescriptors_.front().second;
        if (outboxDescriptors_.size() > 1) end = outboxDescriptors_[1].first;
      } else {
        end = outboxDescriptors_.front().first;
      }
    }
    struct iovec part = {outbox_.data() + outboxSent_, end - outboxSent_};
    ssize_t n = SendWithDescriptors(fd_, &part, 1, *attached);
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno == EAGAIN || errno == EWOULDBLOCK;
    }
    if (attached != &kNone) outboxDescriptors_.pop_front();  // sent, and closed here
    outboxSent_ += static_cast<size_t>(n);
  }
  outbox_.clear();
  outboxSent_ = 0;
  return true;
}

void PeerConnection::run() {
  drm1::FrameDecoder decoder;
  // On the stack: a zeroed buffer on the heap cost a 64 KiB memset for every
  // connection, however little it sent.
  char buf[kReadChunk];
  bool peerOpen = true;
  // Delivers the frames already received, as far as the limit of unanswered
  // requests allows; false on a protocol error.
  auto deliver = [&]() -> bool {
    for (;;) {
      {
        std::lock_guard<std::mutex> lock(mu_);
        if (unanswered_ >= kMaxUnansweredRequests) return true;
      }
      Result<std::optional<drm1::Frame>> frame = decoder.next();
      if (!frame) {
        SystemLog("protocol error on %@: %@", description(), frame.error());
        return false;
      }
      if (!frame->has_value()) return true;
      drm1::Frame& f = **frame;
      if (f.header.isReply()) {
        SystemLog("protocol error on %@: a peer sent a reply", description());
        return false;
      }
      if (f.header.carriesDescriptors()) {
        SystemLog("protocol error on %@: a request may not carry descriptors", description());
        return false;
      }
      if (f.header.wantsReply()) {
        std::lock_guard<std::mutex> lock(mu_);
        ++unanswered_;
      }
      ConnectionEvent event;
      event.message = PeerMessage{f.header.serial, f.header.wantsReply(), std::move(f.body)};
      if (handler_) handler_(event);
    }
  };
  while (peerOpen && !closed_) {
    if (!deliver()) break;
    bool pendingOut, readable;
    {
      std::lock_guard<std::mutex> lock(mu_);
      pendingOut = outboxSent_ < outbox_.size();
      readable = unanswered_ < kMaxUnansweredRequests;
    }
    const short events = static_cast<short>((readable ? POLLIN : 0) | (pendingOut ? POLLOUT : 0));
    struct pollfd fds[2] = {{fd_, events, 0}, {wakeFd_, POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      break;
    }
    if (fds[1].revents & POLLIN) DrainWakeFd(wakeFd_);
    if ((fds[0].revents & POLLOUT) && !writeSome()) break;
    if (fds[0].revents & (POLLHUP | POLLERR) && !readable) break;
    if (fds[0].revents & (POLLIN | POLLHUP | POLLERR)) {
      bool sawDescriptors = false;
      ssize_t n = ReceiveRefusingDescriptors(fd_, buf, sizeof buf, &sawDescriptors);
      if (sawDescriptors) {
        SystemLog("protocol error on %@: descriptors sent with a request", description());
        break;
      }
      if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
      if (n <= 0) {
        peerOpen = false;
        break;
      }
      decoder.feed(std::string_view(buf, static_cast<size_t>(n)));
    }
    // Write what the handler just queued without waiting for the next poll.
    if (!writeSome()) break;
  }
  closed_ = true;
  ::shutdown(fd_, SHUT_RDWR);
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
      if (errno != EINTR && errno != EAGAIN && errno != ECONNABORTED) {
        SystemLog("accept failed: %@", PosixError(errno, "accept"));
        // Out of descriptors or memory: pause instead of spinning.
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
      }
      continue;
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
