#include "daemon/socket.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "platform/tarn_log.h"

static const char kLogUnit[] = "socket";

int SocketListen(const char *path, int backlog)
{
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    if (fd < 0) {
        TarnLog("%s:%d Failed to connect socket.", kLogUnit, 20);
        return -1;
    }
    unlink(path);
    struct sockaddr_un addr;
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path);
    if (bind(fd, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)) != 0) {
        TarnLog("%s:%d Failed to bind socket.", kLogUnit, 31);
        close(fd);
        return -1;
    }
    if (listen(fd, backlog) != 0) {
        TarnLog("%s:%d Failed to listen socket.", kLogUnit, 36);
        close(fd);
        return -1;
    }
    return fd;
}

int SocketAcceptPoll(int fd)
{
    if (fd < 0 || fd >= FD_SETSIZE) {
        TarnLog("%s:%d Bad parameter", kLogUnit, 58);
        return -1;
    }
    fd_set readSet;
    FD_ZERO(&readSet);
    FD_SET(fd, &readSet);
    struct timeval tv = {0, 0};
    if (select(FD_SETSIZE, &readSet, nullptr, nullptr, &tv) > 0 && FD_ISSET(fd, &readSet)) {
        struct sockaddr_un addr;
        socklen_t len = sizeof(addr);
        int client = accept(fd, reinterpret_cast<struct sockaddr *>(&addr), &len);
        if (client == -1)
            TarnLog("%s:%d Failed to accept client. [%m]", kLogUnit, 80);
        return client;
    }
    return -1;
}

int SocketWaitReady(int fd, bool forWrite, long long timeoutUs)
{
    if (fd < 0 || fd >= FD_SETSIZE)
        return 0;
    auto nowUs = [] {
        struct timespec ts;
        clock_gettime(CLOCK_MONOTONIC, &ts);
        return ts.tv_sec * 1000000LL + ts.tv_nsec / 1000;
    };
    long long end = nowUs() + timeoutUs;
    for (;;) {
        long long left = end - nowUs();
        if (left < 0)
            left = 0;
        fd_set set;
        FD_ZERO(&set);
        FD_SET(fd, &set);
        struct timeval tv = {static_cast<time_t>(left / 1000000),
                             static_cast<suseconds_t>(left % 1000000)};
        int r = forWrite ? select(fd + 1, nullptr, &set, nullptr, &tv)
                         : select(fd + 1, &set, nullptr, nullptr, &tv);
        if (r > 0)
            return FD_ISSET(fd, &set) ? 1 : 0;
        if (r == 0 || errno != EINTR || left == 0)
            return 0;
    }
}
