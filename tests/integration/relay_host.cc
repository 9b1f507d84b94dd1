// A stand-in host application for the end-to-end tests.
//
//   drd_relay_host DRD_SOCKET RELAY_SOCKET
//
// Copied into an application bundle's Contents/Exec/ and started from there,
// it connects to drd, so drd sees a peer whose executable lies in that
// bundle and carries the bundle's entitlements. It then listens on
// RELAY_SOCKET, accepts one connection (the test's) and passes bytes both
// ways until either side closes. Exits 0 after a clean end, 1 on a failure.
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <string>

namespace {

int Connect(const std::string& path) {
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    std::perror("connect");
    return -1;
  }
  return fd;
}

int AcceptOne(const std::string& path) {
  int listener = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  ::unlink(path.c_str());
  if (listener < 0 ||
      ::bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      ::listen(listener, 1) != 0) {
    std::perror("listen");
    return -1;
  }
  // The test waits for this line before it connects.
  std::printf("ready\n");
  std::fflush(stdout);
  int fd = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
  ::close(listener);
  return fd;
}

// Copies what `from` has to `to`; false at end of stream or on an error.
bool Pass(int from, int to) {
  char buffer[65536];
  ssize_t n = ::read(from, buffer, sizeof buffer);
  if (n <= 0) return false;
  for (ssize_t done = 0; done < n;) {
    ssize_t w = ::write(to, buffer + done, static_cast<size_t>(n - done));
    if (w <= 0) return false;
    done += w;
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) {
    std::fprintf(stderr, "usage: drd_relay_host DRD_SOCKET RELAY_SOCKET\n");
    return 2;
  }
  int drd = Connect(argv[1]);
  if (drd < 0) return 1;
  int test = AcceptOne(argv[2]);
  if (test < 0) return 1;
  pollfd fds[2] = {{test, POLLIN, 0}, {drd, POLLIN, 0}};
  for (;;) {
    if (::poll(fds, 2, -1) < 0) return 1;
    if (fds[0].revents && !Pass(test, drd)) break;
    if (fds[1].revents && !Pass(drd, test)) break;
  }
  ::close(test);
  ::close(drd);
  return 0;
}
