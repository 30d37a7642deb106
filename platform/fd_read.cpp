#include "platform/fd_read.h"

#include <cerrno>
#include <chrono>
#include <poll.h>
#include <unistd.h>

size_t TarnReadUntilClosed(int fd, int timeoutMs, std::string *data, size_t atMost)
{
    using Clock = std::chrono::steady_clock;
    Clock::time_point end = Clock::now() + std::chrono::milliseconds(timeoutMs);
    while (atMost == 0 || data->size() < atMost) {
        long long left =
            std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
        if (left <= 0)
            break;
        struct pollfd p = {fd, POLLIN, 0};
        int r = poll(&p, 1, static_cast<int>(left));
        if (r < 0 && errno == EINTR)
            continue;
        if (r <= 0)
            break;
        char buf[8192];
        size_t want = sizeof(buf);
        if (atMost > 0 && atMost - data->size() < want)
            want = atMost - data->size();
        ssize_t n = read(fd, buf, want);
        if (n <= 0)
            break;
        data->append(buf, static_cast<size_t>(n));
    }
    return data->size();
}
