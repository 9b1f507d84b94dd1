#include "wire/unix_socket.h"

#include <sys/socket.h>

#include <cstring>

namespace dr {

// Room for the descriptors of one message: a few more than any frame may
// carry, so that what a peer sends is seen (and closed) rather than cut.
constexpr size_t kControlDescriptors = 16;

ssize_t SendWithDescriptors(int fd, const struct iovec* parts, size_t count,
                            const std::vector<UniqueFd>& descriptors) {
  alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * kControlDescriptors)] = {};
  struct msghdr msg = {};
  msg.msg_iov = const_cast<struct iovec*>(parts);
  msg.msg_iovlen = count;
  if (!descriptors.empty() && descriptors.size() <= kControlDescriptors) {
    msg.msg_control = control;
    msg.msg_controllen = CMSG_SPACE(sizeof(int) * descriptors.size());
    struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
    c->cmsg_level = SOL_SOCKET;
    c->cmsg_type = SCM_RIGHTS;
    c->cmsg_len = CMSG_LEN(sizeof(int) * descriptors.size());
    for (size_t i = 0; i < descriptors.size(); ++i) {
      const int d = descriptors[i].get();
      std::memcpy(CMSG_DATA(c) + i * sizeof(int), &d, sizeof d);
    }
  }
  return ::sendmsg(fd, &msg, MSG_DONTWAIT | MSG_NOSIGNAL);
}

ssize_t ReceiveWithDescriptors(int fd, void* buffer, size_t size, std::vector<int>* descriptors,
                               bool* cut) {
  alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * kControlDescriptors)];
  struct iovec iov = {buffer, size};
  struct msghdr msg = {};
  msg.msg_iov = &iov;
  msg.msg_iovlen = 1;
  msg.msg_control = control;
  msg.msg_controllen = sizeof control;
  const ssize_t n = ::recvmsg(fd, &msg, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
  if (n < 0) return n;
  if (msg.msg_flags & MSG_CTRUNC) *cut = true;  // the kernel closed what did not fit
  for (struct cmsghdr* c = CMSG_FIRSTHDR(&msg); c; c = CMSG_NXTHDR(&msg, c)) {
    if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
    const size_t received = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
    for (size_t i = 0; i < received; ++i) {
      int d;
      std::memcpy(&d, CMSG_DATA(c) + i * sizeof(int), sizeof d);
      descriptors->push_back(d);
    }
  }
  return n;
}

ssize_t ReceiveRefusingDescriptors(int fd, void* buffer, size_t size, bool* sawDescriptors) {
  std::vector<int> descriptors;
  bool cut = false;
  const ssize_t n = ReceiveWithDescriptors(fd, buffer, size, &descriptors, &cut);
  for (int d : descriptors) ::close(d);
  if (cut || !descriptors.empty()) *sawDescriptors = true;
  return n;
}

}  // namespace dr
