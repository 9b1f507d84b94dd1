#include "client/include/drd/connection.h"

#include <errno.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <deque>
#include <mutex>
#include <optional>
#include <string_view>
#include <vector>

#include "wire/drm1.h"
#include "wire/locations.h"
#include "wire/unix_socket.h"

namespace dr::client {

struct Connection::State {
  explicit State(int fd) : fd(fd) {}
  ~State() {
    dropDescriptors();
    if (fd >= 0) ::close(fd);
  }

  Result<uint64_t> write(const Value& message, uint32_t flags,
                         std::chrono::steady_clock::time_point deadline);
  Status fail(int64_t code, std::string description);

  // Reads what the socket has into the decoder, and the descriptors sent
  // beside those bytes into `received`; 0 at end of stream, else as recv.
  ssize_t receive();
  // Closes every descriptor received and not handed out.
  void dropDescriptors();

  std::mutex mu;
  int fd;  // guarded by mu; -1 once dead
  // Descriptors received, one batch per frame that carries them, oldest
  // first: a batch arrives with the first byte of its frame, so no later
  // than the frame, and frames are decoded in order. Guarded by mu.
  std::deque<std::vector<int>> received;
  Status dead;                                    // guarded by mu: why the connection died
  uint64_t nextSerial = 1;                        // guarded by mu
  drm1::FrameDecoder decoder{drm1::kFromDaemon};  // guarded by mu
};

namespace {

using Clock = std::chrono::steady_clock;

// Milliseconds left until `deadline`, rounded up, for poll(); 0 when past.
int MillisecondsLeft(Clock::time_point deadline) {
  auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
  if (left <= 0) return 0;
  return left > INT32_MAX ? INT32_MAX : static_cast<int>(left);
}

Clock::time_point DeadlineAfter(std::chrono::milliseconds timeout) {
  if (timeout > std::chrono::hours(24 * 365)) return Clock::time_point::max();
  return Clock::now() + timeout;
}

Error ClientError(int64_t code, std::string description) {
  return Error(kClientErrorDomain, code, std::move(description));
}

}  // namespace

std::string DefaultSocketDirectory() { return SocketDirectory(); }

Result<std::unique_ptr<Connection>> Connection::Open(const std::string& serviceName,
                                                     const std::string& socketDirectory) {
  const std::string path = socketDirectory + "/" + serviceName;
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  if (serviceName.empty() || socketDirectory.empty()) {
    return PosixError(EINVAL, "connect to drd at \"" + path + "\"");
  }
  if (path.size() >= sizeof addr.sun_path)
    return PosixError(ENAMETOOLONG, "connect to drd at " + path);
  std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return PosixError(errno, "socket");
  int rc;
  do {
    rc = ::connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr);
  } while (rc != 0 && errno == EINTR);
  if (rc != 0) {
    int saved = errno;
    ::close(fd);
    return PosixError(saved, "connect to drd at " + path);
  }
  return std::unique_ptr<Connection>(new Connection(fd));
}

Connection::Connection(int fd) : state_(std::make_unique<State>(fd)) {}

Connection::~Connection() = default;

bool Connection::isOpen() const {
  std::lock_guard<std::mutex> lock(state_->mu);
  return state_->fd >= 0;
}

int Connection::descriptor() const {
  std::lock_guard<std::mutex> lock(state_->mu);
  return state_->fd;
}

void Connection::State::dropDescriptors() {
  for (const std::vector<int>& batch : received) {
    for (int d : batch) ::close(d);
  }
  received.clear();
}

ssize_t Connection::State::receive() {
  char buffer[65536];
  std::vector<int> batch;
  bool cut = false;
  const ssize_t n = ReceiveWithDescriptors(fd, buffer, sizeof buffer, &batch, &cut);
  if (!batch.empty()) received.push_back(std::move(batch));
  if (n < 0) return n;
  if (cut) {
    errno = EPROTO;  // descriptors were lost: the stream cannot be trusted
    return -1;
  }
  decoder.feed(std::string_view(buffer, static_cast<size_t>(n)));
  return n;
}

Status Connection::State::fail(int64_t code, std::string description) {
  dropDescriptors();
  if (fd >= 0) ::close(fd);
  fd = -1;
  dead = ClientError(code, std::move(description));
  return dead;
}

Result<uint64_t> Connection::State::write(const Value& message, uint32_t flags,
                                          Clock::time_point deadline) {
  if (fd < 0) return dead;
  const uint64_t serial = nextSerial;
  Result<std::string> frame = drm1::EncodeFrame(serial, 0, flags, message);
  if (!frame.ok()) return frame.error();
  ++nextSerial;
  const std::string& bytes = *frame;
  size_t sent = 0;
  while (sent < bytes.size()) {
    ssize_t n = ::send(fd, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n > 0) {
      sent += static_cast<size_t>(n);
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      struct pollfd p = {fd, POLLOUT, 0};
      int ready = ::poll(&p, 1, MillisecondsLeft(deadline));
      if (ready < 0 && errno == EINTR) continue;
      if (ready > 0) continue;
      if (sent == 0) return ClientError(kTimeout, "drd did not take the message in time");
      // Half a frame on the wire: the stream can never be used again.
      return fail(kTimeout, "drd did not take the whole message in time; connection closed");
    }
    return fail(kConnectionClosed, "connection closed by drd (" +
                                       std::string(std::strerror(n < 0 ? errno : EPIPE)) + ")");
  }
  return serial;
}

Status Connection::send(const Value& message, std::chrono::milliseconds timeout) {
  std::lock_guard<std::mutex> lock(state_->mu);
  Result<uint64_t> serial = state_->write(message, 0, DeadlineAfter(timeout));
  return serial.status();
}

Result<Value> Connection::request(const Value& message, std::chrono::milliseconds timeout) {
  std::vector<int> descriptors;
  Result<Value> reply = request(message, timeout, &descriptors);
  for (int d : descriptors) ::close(d);  // not asked for
  return reply;
}

Result<Value> Connection::request(const Value& message, std::chrono::milliseconds timeout,
                                  std::vector<int>* descriptors) {
  State& s = *state_;
  std::lock_guard<std::mutex> lock(s.mu);
  const Clock::time_point deadline = DeadlineAfter(timeout);
  Result<uint64_t> serial = s.write(message, drm1::kFlagWantsReply, deadline);
  if (!serial.ok()) return serial.error();
  for (;;) {
    Result<std::optional<drm1::Frame>> frame = s.decoder.next();
    if (!frame.ok()) {
      return s.fail(kProtocolError, "protocol error from drd: " + frame.error().description());
    }
    if (frame->has_value()) {
      drm1::Frame& f = **frame;
      std::vector<int> attached;
      if (f.header.carriesDescriptors()) {
        if (s.received.empty())
          return s.fail(kProtocolError, "protocol error from drd: descriptors missing");
        attached = std::move(s.received.front());
        s.received.pop_front();
      }
      // Anything else is a late reply to a request given up on, or a
      // message this connection does not wait for.
      if (f.header.isReply() && f.header.replyTo == *serial) {
        *descriptors = std::move(attached);
        return std::move(f.body);
      }
      for (int d : attached) ::close(d);
      continue;
    }
    // With no part of a frame left, a batch left over has no frame.
    if (!s.received.empty() && s.decoder.buffered() == 0) {
      return s.fail(kProtocolError, "protocol error from drd: descriptors without a frame");
    }
    struct pollfd p = {s.fd, POLLIN, 0};
    int ready = ::poll(&p, 1, MillisecondsLeft(deadline));
    if (ready < 0 && errno == EINTR) continue;
    if (ready < 0) return s.fail(kConnectionClosed, PosixError(errno, "poll").description());
    if (ready == 0) {
      return ClientError(kTimeout,
                         "no reply from drd within " + std::to_string(timeout.count()) + " ms");
    }
    ssize_t n = s.receive();
    if (n < 0 && (errno == EINTR || errno == EAGAIN)) continue;
    if (n == 0) return s.fail(kConnectionClosed, "connection closed by drd");
    if (n < 0 && errno == EPROTO)
      return s.fail(kProtocolError, "protocol error from drd: descriptors cut short");
    if (n < 0) {
      return s.fail(kConnectionClosed,
                    "connection closed by drd (" + std::string(std::strerror(errno)) + ")");
    }
  }
}

}  // namespace dr::client
