// What drd's figures are read against: a DRM1 echo over a Unix socket (the
// floor: the cost of the socket and the framing alone) and a D-Bus method
// call through a private dbus-daemon (the peer: the usual desktop IPC).
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/uio.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <functional>
#include <map>

#include "bench/load.h"
#include "wire/drm1.h"

namespace drbench {

// ---- Floor -------------------------------------------------------------------

namespace {

// A listening Unix socket at <folder>/<name>; dies when it cannot be made.
int Listen(const std::string& folder, const std::string& name) {
  std::filesystem::create_directories(folder);
  const std::string path = folder + "/" + name;
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  if (fd < 0 || ::bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0 ||
      ::listen(fd, 64) != 0) {
    Die("cannot listen at " + path);
  }
  return fd;
}

}  // namespace

FloorServer::FloorServer(std::string folder, std::string name)
    : folder_(std::move(folder)), name_(std::move(name)) {
  listenFd_ = Listen(folder_, name_);
  wakeFd_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
}

FloorServer::~FloorServer() {
  ::close(listenFd_);
  ::close(wakeFd_);
}

void FloorServer::start() {
  thread_ = std::thread([this] { run(); });
}

void FloorServer::stop() {
  if (!thread_.joinable()) return;
  stop_ = true;
  uint64_t one = 1;
  (void)!::write(wakeFd_, &one, sizeof one);
  thread_.join();
}

EchoServer::EchoServer(std::string folder, std::string name)
    : FloorServer(std::move(folder), std::move(name)) {
  reply_ = dr::Value::EmptyDictionary();
  start();
}

void EchoServer::setReply(const dr::Value& body) {
  std::lock_guard<std::mutex> lock(mu_);
  reply_ = body;
}

// Serves the peers of `listenFd` on the calling thread until `stop`: accepts
// new ones and hands each one's received bytes to `take` with that peer's
// state; a peer that hangs up is closed. `wakeFd` ends a wait for `stop`.
namespace {

template <typename Peer>
void ServePeers(int listenFd, int wakeFd, const std::atomic<bool>& stop, const char* what,
                const std::function<void(int, Peer&, std::string_view)>& take) {
  std::map<int, Peer> peers;
  std::vector<struct pollfd> fds;
  char buffer[65536];
  while (!stop) {
    fds.clear();
    fds.push_back({listenFd, POLLIN, 0});
    fds.push_back({wakeFd, POLLIN, 0});
    for (const auto& [fd, peer] : peers) fds.push_back({fd, POLLIN, 0});
    if (::poll(fds.data(), fds.size(), -1) < 0 && errno != EINTR) Die(std::string(what) + " poll");
    if (fds[0].revents & POLLIN) {
      int fd;
      while ((fd = ::accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC)) >= 0) peers[fd];
    }
    for (size_t i = 2; i < fds.size(); ++i) {
      if (fds[i].revents == 0) continue;
      const int fd = fds[i].fd;
      ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
      if (n <= 0) {
        ::close(fd);
        peers.erase(fd);
        continue;
      }
      take(fd, peers[fd], std::string_view(buffer, static_cast<size_t>(n)));
    }
  }
  for (const auto& [fd, peer] : peers) ::close(fd);
}

}  // namespace

void EchoServer::run() {
  struct Peer {
    dr::drm1::FrameDecoder decoder{dr::drm1::kFromDaemon};
    uint64_t serial = 1;
  };
  auto take = [this](int fd, Peer& peer, std::string_view bytes) {
    peer.decoder.feed(bytes);
    for (;;) {
      auto frame = peer.decoder.next();
      if (!frame.ok() || !frame->has_value()) break;
      dr::Value reply;
      {
        std::lock_guard<std::mutex> lock(mu_);
        reply = reply_;
      }
      auto encoded = dr::drm1::EncodeFrame(peer.serial++, (**frame).header.serial,
                                           dr::drm1::kFlagIsReply, reply);
      size_t sent = 0;
      while (encoded.ok() && sent < encoded->size()) {
        ssize_t w = ::send(fd, encoded->data() + sent, encoded->size() - sent, MSG_NOSIGNAL);
        if (w <= 0) break;
        sent += static_cast<size_t>(w);
      }
    }
  };
  ServePeers<Peer>(listenFd_, wakeFd_, stop_, "echo server", take);
}

// ---- Canned floor --------------------------------------------------------------

namespace {

void PutU32(char* at, uint32_t v) {
  for (int i = 0; i < 4; ++i) at[i] = static_cast<char>(v >> (8 * i));
}

void PutU64(char* at, uint64_t v) {
  for (int i = 0; i < 8; ++i) at[i] = static_cast<char>(v >> (8 * i));
}

// Writes all of `head` and then `body`; false when the peer is gone.
bool SendBoth(int fd, std::string_view head, std::string_view body) {
  while (!head.empty() || !body.empty()) {
    struct iovec io[2] = {{const_cast<char*>(head.data()), head.size()},
                          {const_cast<char*>(body.data()), body.size()}};
    struct msghdr m = {};
    m.msg_iov = head.empty() ? io + 1 : io;
    m.msg_iovlen = head.empty() ? 1 : 2;
    ssize_t n = ::sendmsg(fd, &m, MSG_NOSIGNAL);
    if (n <= 0) return false;
    size_t sent = static_cast<size_t>(n);
    const size_t fromHead = std::min(sent, head.size());
    head.remove_prefix(fromHead);
    body.remove_prefix(sent - fromHead);
  }
  return true;
}

}  // namespace

CannedServer::CannedServer(std::string folder, std::string name)
    : FloorServer(std::move(folder), std::move(name)) {
  start();
}

void CannedServer::record(std::string request, std::string reply) {
  std::lock_guard<std::mutex> lock(mu_);
  replies_[std::move(request)] = std::move(reply);
}

void CannedServer::run() {
  struct Peer {
    std::string in;  // bytes received and not yet answered
    uint64_t serial = 0;
  };
  auto take = [this](int fd, Peer& peer, std::string_view bytes) {
    peer.in.append(bytes);
    size_t at = 0;
    while (peer.in.size() - at >= dr::drm1::kHeaderSize) {
      const std::string_view rest = std::string_view(peer.in).substr(at);
      auto header = dr::drm1::DecodeHeader(rest);
      if (!header.ok()) Die("canned floor: " + header.error().description());
      if (rest.size() < dr::drm1::kHeaderSize + header->bodyLength) break;
      const std::string_view body = rest.substr(dr::drm1::kHeaderSize, header->bodyLength);
      std::lock_guard<std::mutex> lock(mu_);
      auto reply = replies_.find(body);
      if (reply == replies_.end()) Die("canned floor: a request with no recorded reply");
      char head[dr::drm1::kHeaderSize] = {};
      std::memcpy(head, dr::drm1::kMagic, 4);
      PutU32(head + 4, static_cast<uint32_t>(reply->second.size()));
      PutU64(head + 8, ++peer.serial);
      PutU64(head + 16, header->serial);
      PutU32(head + 24, dr::drm1::kFlagIsReply);
      if (!SendBoth(fd, std::string_view(head, sizeof head), reply->second)) break;
      at += dr::drm1::kHeaderSize + header->bodyLength;
    }
    peer.in.erase(0, at);
  };
  ServePeers<Peer>(listenFd_, wakeFd_, stop_, "canned floor", take);
}

// ---- Raw client ------------------------------------------------------------------

RawClient::RawClient(const std::string& folder, const std::string& name) {
  const std::string path = folder + "/" + name;
  struct sockaddr_un addr = {};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd_ < 0 || ::connect(fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0) {
    Die("cannot connect to " + path);
  }
  struct timeval limit = {120, 0};
  ::setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
  ::setsockopt(fd_, SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
}

RawClient::~RawClient() {
  if (fd_ >= 0) ::close(fd_);
}

void RawClient::readExactly(char* to, size_t size) {
  for (size_t at = 0; at < size;) {
    ssize_t n = ::recv(fd_, to + at, size - at, 0);
    if (n <= 0) Die(n == 0 ? "the peer closed a raw connection" : "a raw connection failed");
    at += static_cast<size_t>(n);
  }
}

const std::string& RawClient::exchange(const std::string& frame) {
  if (frame.size() < dr::drm1::kHeaderSize) Die("a raw request without a header");
  const uint64_t serial = ++serial_;
  char head[dr::drm1::kHeaderSize];
  std::memcpy(head, frame.data(), sizeof head);
  PutU64(head + 8, serial);
  if (!SendBoth(fd_, std::string_view(head, sizeof head),
                std::string_view(frame).substr(dr::drm1::kHeaderSize))) {
    Die("a raw connection failed to send");
  }
  for (;;) {
    readExactly(head, sizeof head);
    auto header =
        dr::drm1::DecodeHeader(std::string_view(head, sizeof head), dr::drm1::kFromDaemon);
    if (!header.ok()) Die("a raw reply: " + header.error().description());
    body_.resize(header->bodyLength);
    readExactly(body_.data(), body_.size());
    // Anything but the reply to this request (a notification) is passed over.
    if (header->isReply() && header->replyTo == serial) return body_;
  }
}

// ---- D-Bus peer ------------------------------------------------------------------

namespace {

constexpr const char* kBusName = "org.bench.Echo";
constexpr const char* kObjectPath = "/org/bench/Echo";
constexpr const char* kInterface = "org.bench.Echo";

int OnEchoCall(sd_bus_message* m, void* userdata, sd_bus_error* /*error*/) {
  return DbusPeer::OnEcho(m, userdata);
}

const sd_bus_vtable kEchoVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("Echo", "ay", "ay", OnEchoCall, SD_BUS_VTABLE_UNPRIVILEGED),
    SD_BUS_VTABLE_END,
};

sd_bus* OpenBus(const std::string& address) {
  sd_bus* bus = nullptr;
  if (sd_bus_new(&bus) < 0) return nullptr;
  if (sd_bus_set_address(bus, address.c_str()) < 0 || sd_bus_set_bus_client(bus, 1) < 0 ||
      sd_bus_start(bus) < 0) {
    sd_bus_unref(bus);
    return nullptr;
  }
  return bus;
}

// The decoded body of a DRM1 frame; dies on bytes that are not one.
dr::Value DecodeFrame(const void* data, size_t size) {
  std::string_view bytes(static_cast<const char*>(data), size);
  if (bytes.size() < dr::drm1::kHeaderSize) Die("D-Bus echo: short frame");
  auto header = dr::drm1::DecodeHeader(bytes);
  auto body =
      header.ok() ? dr::drm1::DecodeBody(bytes.substr(dr::drm1::kHeaderSize)) : header.error();
  if (!body.ok()) Die("D-Bus echo: bad frame");
  return std::move(body).value();
}

}  // namespace

int DbusPeer::OnEcho(void* message, void* userdata) {
  auto* m = static_cast<sd_bus_message*>(message);
  auto* self = static_cast<DbusPeer*>(userdata);
  const void* data = nullptr;
  size_t size = 0;
  int r = sd_bus_message_read_array(m, 'y', &data, &size);
  if (r < 0) return r;
  dr::Value request = DecodeFrame(data, size);
  dr::Value reply;
  {
    std::lock_guard<std::mutex> lock(self->mu_);
    reply = self->reply_;
  }
  auto bytes = dr::drm1::EncodeFrame(1, 1, dr::drm1::kFlagIsReply, reply);
  if (!bytes.ok()) Die("D-Bus echo: cannot encode the reply");
  sd_bus_message* out = nullptr;
  r = sd_bus_message_new_method_return(m, &out);
  if (r >= 0) r = sd_bus_message_append_array(out, 'y', bytes->data(), bytes->size());
  if (r >= 0) r = sd_bus_send(nullptr, out, nullptr);
  sd_bus_message_unref(out);
  return r;
}

DbusPeer::DbusPeer(const std::string& folder) : reply_(dr::Value::EmptyDictionary()) {
  std::filesystem::create_directories(folder);
  const std::string socket = folder + "/bus";
  address_ = "unix:path=" + socket;
  if (::access("/usr/bin/dbus-daemon", X_OK) != 0) {
    reason_ = "dbus-daemon is not installed (Debian package dbus-daemon)";
    return;
  }
  const std::string log = folder + "/dbus-daemon.log";
  daemon_ = ::fork();
  if (daemon_ == 0) {
    int fd = ::open(log.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (fd >= 0) {
      ::dup2(fd, STDOUT_FILENO);
      ::dup2(fd, STDERR_FILENO);
    }
    std::string address = "--address=" + address_;
    ::execl("/usr/bin/dbus-daemon", "dbus-daemon", "--session", "--nofork", "--nopidfile",
            address.c_str(), static_cast<char*>(nullptr));
    ::_exit(127);
  }
  const Clock::time_point deadline = Clock::now() + std::chrono::seconds(10);
  while (!std::filesystem::exists(socket) && Clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  thread_ = std::thread([this] { serve(); });
  while (!ready_ && !stop_ && Clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  available_ = ready_;
  if (!available_) reason_ = "the private dbus-daemon did not come up (see " + log + ")";
}

DbusPeer::~DbusPeer() {
  stop_ = true;
  if (thread_.joinable()) thread_.join();
  if (daemon_ > 0) {
    ::kill(daemon_, SIGTERM);
    ::waitpid(daemon_, nullptr, 0);
  }
}

void DbusPeer::setReply(const dr::Value& body) {
  std::lock_guard<std::mutex> lock(mu_);
  reply_ = body;
}

void DbusPeer::serve() {
  sd_bus* bus = OpenBus(address_);
  sd_bus_slot* slot = nullptr;
  if (bus == nullptr || sd_bus_request_name(bus, kBusName, 0) < 0 ||
      sd_bus_add_object_vtable(bus, &slot, kObjectPath, kInterface, kEchoVtable, this) < 0) {
    stop_ = true;
    if (bus) sd_bus_unref(bus);
    return;
  }
  ready_ = true;
  while (!stop_) {
    int r = sd_bus_process(bus, nullptr);
    if (r < 0) break;
    if (r > 0) continue;
    sd_bus_wait(bus, 100000);  // µs: wakes now and then to see stop_
  }
  sd_bus_slot_unref(slot);
  sd_bus_flush_close_unref(bus);
}

DbusPeer::Client::Client(const std::string& address) {
  bus_ = OpenBus(address);
  if (bus_ == nullptr) Die("cannot connect to the private bus at " + address);
}

DbusPeer::Client::~Client() { sd_bus_flush_close_unref(static_cast<sd_bus*>(bus_)); }

dr::Value DbusPeer::Client::call(const dr::Value& request) {
  auto bytes = dr::drm1::EncodeFrame(serial_++, 0, dr::drm1::kFlagWantsReply, request);
  if (!bytes.ok()) Die("D-Bus echo: cannot encode the request");
  sd_bus* bus = static_cast<sd_bus*>(bus_);
  sd_bus_message* m = nullptr;
  sd_bus_message* reply = nullptr;
  sd_bus_error error = SD_BUS_ERROR_NULL;
  int r = sd_bus_message_new_method_call(bus, &m, kBusName, kObjectPath, kInterface, "Echo");
  if (r >= 0) r = sd_bus_message_append_array(m, 'y', bytes->data(), bytes->size());
  if (r >= 0) r = sd_bus_call(bus, m, 0, &error, &reply);
  const void* data = nullptr;
  size_t size = 0;
  if (r >= 0) r = sd_bus_message_read_array(reply, 'y', &data, &size);
  if (r < 0) {
    Die(std::string("D-Bus echo failed: ") + (error.message ? error.message : std::strerror(-r)));
  }
  dr::Value body = DecodeFrame(data, size);
  sd_bus_error_free(&error);
  sd_bus_message_unref(m);
  sd_bus_message_unref(reply);
  return body;
}

std::unique_ptr<DbusPeer::Client> DbusPeer::connect() const {
  return std::make_unique<Client>(address_);
}

}  // namespace drbench
