// drd_relay_host DRD_SOCKET RELAY_SOCKET, run from a bundle's Contents/Exec/: connects
// to drd (judged by that bundle), prints "ready" and relays one connection on
// RELAY_SOCKET to drd both ways until either side closes.
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>

namespace {

int Socket(const char* path, sockaddr_un* address) {
  *address = {};
  address->sun_family = AF_UNIX;
  std::strncpy(address->sun_path, path, sizeof address->sun_path - 1);
  return ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
}

// Copies what `from` has to `to`; false at end of stream or on an error.
bool Pass(int from, int to) {
  char buffer[65536];
  ssize_t n = ::read(from, buffer, sizeof buffer);
  for (ssize_t done = 0, w = 0; n > 0 && done < n; done += w) {
    if ((w = ::write(to, buffer + done, static_cast<size_t>(n - done))) <= 0) return false;
  }
  return n > 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) return 2;
  sockaddr_un address;
  const int drd = Socket(argv[1], &address);
  if (::connect(drd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return 1;
  const int listener = Socket(argv[2], &address);
  ::unlink(argv[2]);
  if (::bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      ::listen(listener, 1) != 0) {
    return 1;
  }
  std::printf("ready\n");  // the test connects once it reads this
  std::fflush(stdout);
  const int test = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
  pollfd fds[2] = {{test, POLLIN, 0}, {drd, POLLIN, 0}};
  while (test >= 0 && ::poll(fds, 2, -1) > 0 && (!fds[0].revents || Pass(test, drd)) &&
         (!fds[1].revents || Pass(drd, test))) {
  }
  return 0;
}
