// Bytes and descriptors over a connected Unix stream socket.
//
// Descriptors travel as SCM_RIGHTS ancillary data with the first byte of the
// bytes they go with. Stateless; any thread. Both calls never block and
// never raise SIGPIPE; they answer as sendmsg/recvmsg do (-1 with errno).
// They stay system-call shaped rather than answering a Status: their callers
// are non-blocking loops that must tell EAGAIN and EINTR from a failure
// before anything else, as for any other read or write on a socket.
#pragma once

#include <sys/types.h>
#include <sys/uio.h>

#include <cstddef>
#include <vector>

#include "core/unique_fd.h"

namespace dr {

// Sends the bytes of `parts`, with `descriptors` attached to the first byte
// when there are any (then at least one byte must go).
ssize_t SendWithDescriptors(int fd, const struct iovec* parts, size_t count,
                            const std::vector<UniqueFd>& descriptors);

// Receives up to `size` bytes, and appends the descriptors that came with
// them (close-on-exec, the caller's to close) to `descriptors`. Sets `cut`
// when the kernel had to drop some for want of room.
ssize_t ReceiveWithDescriptors(int fd, void* buffer, size_t size, std::vector<int>* descriptors,
                               bool* cut);

// Receives up to `size` bytes. Descriptors that came with them are closed at
// once and `sawDescriptors` set: a peer that may not send any has broken the
// protocol, and none may leak.
ssize_t ReceiveRefusingDescriptors(int fd, void* buffer, size_t size, bool* sawDescriptors);

}  // namespace dr
