#include <cerrno>
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include "peer/link.hpp"
#include "peer/peer.hpp"

namespace torvad::peer {

void outlive_console_events() {}

bool link_is_open(long value) {
    return value <= 0x7fffffff && fcntl(static_cast<int>(value), F_GETFD) != -1;
}

void close_link(int link) {
    close(link);
}

long read_link(int link, char* buffer, std::size_t size) {
    for (;;) {
        ssize_t got = read(link, buffer, size);
        if (got == -1 && errno == EINTR)
            continue;
        return got;
    }
}

bool write_link(int link, const char* data, std::size_t size, int wait_ms) {
    int flags = MSG_NOSIGNAL | (wait_ms >= 0 ? MSG_DONTWAIT : 0);
    std::size_t sent = 0;
    while (sent < size) {
        ssize_t put = send(link, data + sent, size - sent, flags);
        if (put == -1 && errno == EINTR)
            continue;
        if (put == -1 && errno == EAGAIN) {
            pollfd writable{link, POLLOUT, 0};
            if (poll(&writable, 1, wait_ms) == 1)
                continue;
            return false;
        }
        if (put <= 0)
            return false;
        sent += static_cast<std::size_t>(put);
    }
    return true;
}

} // namespace torvad::peer
