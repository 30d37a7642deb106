#include "daemon/ctrl_conns.h"

#include "platform/tarn_clock.h"

#include <cerrno>
#include <ctime>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

namespace {

// The client's share of the time: to deliver its request, to take its reply.
const int64_t kWaitMs = 500;

}  // namespace

int64_t NowMs()
{
    return TarnNowMs();
}

ControlConnections::~ControlConnections()
{
    CloseAll();
}

int ControlConnections::AcceptAll(int listenFd)
{
    int accepted = 0;
    while (listenFd >= 0 && conns.size() < CTRL_CONNS_MAX) {
        int fd = accept4(listenFd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED)
                continue;
            break;  // EAGAIN: none left; anything else: try next turn
        }
        conns.push_back(Conn{fd, NowMs() + kWaitMs, std::string(), 0, false, false});
        accepted++;
    }
    return accepted;
}

void ControlConnections::AddPollFds(std::vector<struct pollfd> &fds) const
{
    for (const Conn &c : conns)
        fds.push_back(pollfd{c.fd, static_cast<short>(c.replying ? POLLOUT : POLLIN), 0});
}

void ControlConnections::TakeReady(const std::vector<struct pollfd> &fds, size_t first)
{
    for (size_t i = 0; i < conns.size() && first + i < fds.size(); i++) {
        const struct pollfd &p = fds[first + i];
        conns[i].ready = p.fd == conns[i].fd && p.revents != 0;
    }
}

int ControlConnections::NextReadable() const
{
    for (const Conn &c : conns)
        if (c.ready && !c.replying)
            return c.fd;
    return -1;
}

ControlConnections::Conn *ControlConnections::Find(int fd)
{
    for (Conn &c : conns)
        if (c.fd == fd)
            return &c;
    return nullptr;
}

bool ControlConnections::Flush(Conn &c)
{
    while (c.sent < c.out.size()) {
        ssize_t n = send(c.fd, c.out.data() + c.sent, c.out.size() - c.sent, MSG_NOSIGNAL);
        if (n > 0) {
            c.sent += static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR)
            continue;
        // Full socket: later. A client that went away is its own loss.
        return n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK) ? false : true;
    }
    return true;
}

void ControlConnections::Reply(int fd, const char *bytes, size_t size)
{
    Conn *c = Find(fd);
    if (!c)
        return;
    c->out.assign(bytes, size);
    c->sent = 0;
    c->replying = true;
    c->ready = false;
    c->deadline = NowMs() + kWaitMs;
    if (Flush(*c))
        Close(fd);
}

void ControlConnections::Close(int fd)
{
    for (size_t i = 0; i < conns.size(); i++) {
        if (conns[i].fd == fd) {
            close(fd);
            conns.erase(conns.begin() + static_cast<long>(i));
            return;
        }
    }
}

void ControlConnections::Service()
{
    int64_t now = NowMs();
    for (size_t i = 0; i < conns.size();) {
        Conn &c = conns[i];
        bool done = false;
        if (c.replying && c.ready)
            done = Flush(c);
        // Silent, or not taking its reply: closed without a line. A request
        // that arrived in time but waits behind others is still served.
        if (!done && now >= c.deadline && (c.replying || !Delivered(c.fd)))
            done = true;
        if (done) {
            close(c.fd);
            conns.erase(conns.begin() + static_cast<long>(i));
            continue;
        }
        c.ready = false;
        i++;
    }
}

bool ControlConnections::Delivered(int fd)
{
    int pending = 0;
    return ioctl(fd, FIONREAD, &pending) == 0 && pending > 0;
}

int ControlConnections::TimeoutMs() const
{
    // Connections past their deadline that are still held have delivered
    // their request and wake the loop through poll; they set no timer.
    int64_t now = NowMs();
    int64_t nearest = -1;
    for (const Conn &c : conns) {
        if (c.deadline <= now && !c.replying && Delivered(c.fd))
            continue;
        if (nearest < 0 || c.deadline < nearest)
            nearest = c.deadline;
    }
    if (nearest < 0)
        return -1;
    int64_t left = nearest - NowMs();
    return left <= 0 ? 0 : static_cast<int>(left + 1);
}

void ControlConnections::CloseAll()
{
    for (Conn &c : conns)
        close(c.fd);
    conns.clear();
}
