#include "tools/tarnweb/guarded_server.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <climits>
#include <cstring>

#include "platform/tarn_log.h"

static const char kLogUnit[] = "tarnweb";

namespace {

// Set by CloseAfterResponse() on the worker that runs the request.
thread_local bool closeAfterResponse = false;

long long NowMs()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

// poll() for one descriptor, restarted on signals with the time left.
int PollOne(int fd, short events, long long timeoutMs)
{
    long long end = NowMs() + timeoutMs;
    for (;;) {
        struct pollfd p = {fd, events, 0};
        int r = poll(&p, 1, static_cast<int>(std::min<long long>(timeoutMs, INT_MAX)));
        if (r >= 0 || errno != EINTR)
            return r;
        timeoutMs = std::max<long long>(0, end - NowMs());
    }
}

std::string AddressText(const struct sockaddr_storage &ss, int *port)
{
    char text[INET6_ADDRSTRLEN] = "";
    *port = 0;
    if (ss.ss_family == AF_INET) {
        const auto *in = reinterpret_cast<const struct sockaddr_in *>(&ss);
        inet_ntop(AF_INET, &in->sin_addr, text, sizeof(text));
        *port = ntohs(in->sin_port);
    } else if (ss.ss_family == AF_INET6) {
        const auto *in6 = reinterpret_cast<const struct sockaddr_in6 *>(&ss);
        inet_ntop(AF_INET6, &in6->sin6_addr, text, sizeof(text));
        *port = ntohs(in6->sin6_port);
    }
    return text;
}

std::string PeerAddress(int fd, int *port)
{
    struct sockaddr_storage ss;
    socklen_t len = sizeof(ss);
    memset(&ss, 0, sizeof(ss));
    if (getpeername(fd, reinterpret_cast<struct sockaddr *>(&ss), &len) != 0) {
        *port = 0;
        return "";
    }
    return AddressText(ss, port);
}

// The library's request handling over one connected socket, with a read
// buffer so that the line reader does not cost a system call per byte.
class FdStream : public httplib::Stream {
public:
    FdStream(int fd, long long readTimeoutMs, long long writeTimeoutMs)
        : fd(fd), readTimeoutMs(readTimeoutMs), writeTimeoutMs(writeTimeoutMs)
    {
    }
    bool is_readable() const override { return used < filled || PollOne(fd, POLLIN, readTimeoutMs) > 0; }
    bool is_writable() const override
    {
        struct pollfd p = {fd, POLLOUT, 0};
        if (PollOne(fd, POLLOUT, writeTimeoutMs) <= 0)
            return false;
        // A peer that has gone shows as readable with nothing to read.
        p.events = POLLIN;
        if (poll(&p, 1, 0) == 1 && used == filled) {
            char c;
            if (recv(fd, &c, 1, MSG_PEEK | MSG_DONTWAIT) == 0)
                return false;
        }
        return true;
    }
    ssize_t read(char *ptr, size_t size) override
    {
        if (used == filled) {
            if (!is_readable())
                return -1;
            ssize_t n;
            do {
                n = recv(fd, buffer, sizeof(buffer), 0);
            } while (n < 0 && errno == EINTR);
            if (n <= 0)
                return n;
            used = 0;
            filled = static_cast<size_t>(n);
        }
        size_t n = std::min(size, filled - used);
        memcpy(ptr, buffer + used, n);
        used += n;
        return static_cast<ssize_t>(n);
    }
    ssize_t write(const char *ptr, size_t size) override
    {
        if (!is_writable())
            return -1;
        ssize_t n;
        do {
            n = send(fd, ptr, size, MSG_NOSIGNAL);
        } while (n < 0 && errno == EINTR);
        return n;
    }
    void get_remote_ip_and_port(std::string &ip, int &port) const override { ip = PeerAddress(fd, &port); }
    void get_local_ip_and_port(std::string &ip, int &port) const override
    {
        struct sockaddr_storage ss;
        socklen_t len = sizeof(ss);
        memset(&ss, 0, sizeof(ss));
        port = 0;
        ip.clear();
        if (getsockname(fd, reinterpret_cast<struct sockaddr *>(&ss), &len) == 0)
            ip = AddressText(ss, &port);
    }
    socket_t socket() const override { return fd; }
    bool HasBuffered() const { return used < filled; }

    // Reads the head of the next request into the buffer (as far as it
    // fits) and rewrites a Range end too big for a 64-bit number, such as
    // "bytes=0-18446744073709551615", as an open end ("bytes=0-"): the
    // library refuses such a number with 416, where it means "to the end".
    void NormalizeRangeEnds()
    {
        if (used > 0 && used == filled)
            used = filled = 0;
        if (used > 0) {  // a request follows another in the buffer
            memmove(buffer, buffer + used, filled - used);
            filled -= used;
            used = 0;
        }
        long long end = NowMs() + readTimeoutMs;
        while (!HeadComplete() && filled < sizeof(buffer)) {
            long long left = end - NowMs();
            if (left <= 0 || PollOne(fd, POLLIN, left) <= 0)
                return;
            ssize_t n = recv(fd, buffer + filled, sizeof(buffer) - filled, 0);
            if (n <= 0)
                return;
            filled += static_cast<size_t>(n);
        }
        if (!HeadComplete())
            return;
        std::string head(buffer, filled);
        size_t headEnd = head.find("\r\n\r\n");
        std::string lower = head.substr(0, headEnd);
        for (char &c : lower)
            c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
        size_t at = lower.find("\r\nrange:");
        if (at == std::string::npos)
            return;
        size_t lineEnd = lower.find("\r\n", at + 2);
        // Digit runs after a '-' that no int64 holds are dropped.
        for (size_t i = at; i < lineEnd; ++i) {
            if (head[i] != '-')
                continue;
            size_t j = i + 1;
            while (j < lineEnd && isdigit(static_cast<unsigned char>(head[j])))
                ++j;
            std::string digits = head.substr(i + 1, j - i - 1);
            size_t nonZero = digits.find_first_not_of('0');
            std::string value = nonZero == std::string::npos ? "0" : digits.substr(nonZero);
            if (value.size() > 19 || (value.size() == 19 && value > "9223372036854775807")) {
                head.erase(i + 1, j - i - 1);
                lineEnd -= j - i - 1;
            }
        }
        if (head.size() != filled) {
            memcpy(buffer, head.data(), head.size());
            filled = head.size();
        }
    }

private:
    int fd;
    long long readTimeoutMs, writeTimeoutMs;
    bool HeadComplete() const { return memmem(buffer + used, filled - used, "\r\n\r\n", 4) != nullptr; }

    char buffer[8192];
    size_t used = 0, filled = 0;
};

}  // namespace

// The library's task queue, forwarding to the server's own pool so that the
// waiting room can hand connections to the same workers.
class GuardedServer::PoolProxy : public httplib::TaskQueue {
public:
    explicit PoolProxy(GuardedServer *owner) : owner(owner) {}
    void enqueue(std::function<void()> fn) override { owner->pool->enqueue(std::move(fn)); }
    void shutdown() override { owner->StopAll(); }

private:
    GuardedServer *owner;
};

GuardedServer::GuardedServer(const GuardLimits &l) : limits(l)
{
    limits.workers = std::max(1, limits.workers);
    limits.perClient = std::max(1, limits.perClient);
    limits.waitingMax = std::max(1, limits.waitingMax);
    pool.reset(new httplib::ThreadPool(static_cast<size_t>(limits.workers)));
    if (pipe2(wakePipe, O_CLOEXEC | O_NONBLOCK) != 0)
        TLOG("Cannot make the waiting room's pipe, %m");
    room = std::thread([this] { WaitingRoom(); });
    new_task_queue = [this] { return new PoolProxy(this); };
}

GuardedServer::~GuardedServer()
{
    StopAll();
    for (int fd : wakePipe) {
        if (fd >= 0)
            close(fd);
    }
}

int GuardedServer::SetBacklog(int backlog)
{
    if (svr_sock_ == INVALID_SOCKET || ::listen(svr_sock_, backlog) != 0) {
        TLOG("Cannot widen the listening queue to %d, %m", backlog);
        return -1;
    }
    return 0;
}

// Stops the waiting room (closing what waits there) and the workers, after
// the requests they hold are done. Safe to call more than once.
void GuardedServer::StopAll()
{
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (stopping)
            return;
        stopping = true;
    }
    if (wakePipe[1] >= 0 && ::write(wakePipe[1], "x", 1) < 0) {
        // A full pipe already wakes the room.
    }
    if (room.joinable())
        room.join();
    pool->shutdown();
}

bool GuardedServer::Admit(const std::string &client)
{
    std::lock_guard<std::mutex> lock(mutex);
    int &n = perClient[client];
    if (n >= limits.perClient) {
        if (n == 0)
            perClient.erase(client);
        long long now = NowMs();
        if (now - lastRefusalLogMs >= 10000) {
            lastRefusalLogMs = now;
            TLOG("Too many connections from %s (at most %d at once): closing the newest",
                 client.c_str(), limits.perClient);
        }
        return false;
    }
    ++n;
    return true;
}

void GuardedServer::Release(const std::string &client)
{
    std::lock_guard<std::mutex> lock(mutex);
    auto it = perClient.find(client);
    if (it != perClient.end() && --it->second <= 0)
        perClient.erase(it);
}

void GuardedServer::Close(int fd, const std::string &client)
{
    shutdown(fd, SHUT_RDWR);
    close(fd);
    Release(client);
}

void GuardedServer::CloseAfterResponse()
{
    closeAfterResponse = true;
}

bool GuardedServer::process_and_close_socket(socket_t sock)
{
    int port;
    std::string client = PeerAddress(sock, &port);
    if (!Admit(client)) {
        refusedPerClient++;
        shutdown(sock, SHUT_RDWR);
        close(sock);
        return true;
    }
    if (PollOne(sock, POLLIN, 0) > 0)
        ServeReady(sock, client, 0);
    else
        Park(sock, client, 0);
    return true;
}

void GuardedServer::Park(int fd, const std::string &client, int requests)
{
    long long wait = requests == 0 ? limits.silentTimeoutMs : keep_alive_timeout_sec_ * 1000;
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (!stopping && static_cast<int>(waiting.size()) < limits.waitingMax) {
            waiting.push_back({fd, NowMs() + wait, client, requests});
            if (::write(wakePipe[1], "x", 1) < 0) {
                // A full pipe already wakes the room.
            }
            return;
        }
        if (!stopping)
            refusedRoomFull++;
    }
    Close(fd, client);
}

// Serves the requests of a connection that has bytes to read, as long as
// more follow at once; then parks it again or closes it.
void GuardedServer::ServeReady(int fd, const std::string &client, int requests)
{
    FdStream strm(fd, read_timeout_sec_ * 1000 + read_timeout_usec_ / 1000,
                  write_timeout_sec_ * 1000 + write_timeout_usec_ / 1000);
    for (;;) {
        bool last = svr_sock_ == INVALID_SOCKET || is_running() == false ||
                    static_cast<size_t>(requests) + 1 >= keep_alive_max_count_;
        bool closed = false;
        strm.NormalizeRangeEnds();
        closeAfterResponse = false;
        bool ok = process_request(strm, last, closed, nullptr);
        ++requests;
        if (!ok || closed || last || closeAfterResponse)
            break;
        if (!strm.HasBuffered() && PollOne(fd, POLLIN, 0) <= 0) {
            Park(fd, client, requests);
            return;
        }
    }
    Close(fd, client);
}

void GuardedServer::WaitingRoom()
{
    std::vector<struct pollfd> fds;
    for (;;) {
        long long now = NowMs();
        long long next = now + 60000;
        size_t n;
        {
            std::lock_guard<std::mutex> lock(mutex);
            if (stopping)
                break;
            n = waiting.size();
            fds.resize(n + 1);
            fds[0] = {wakePipe[0], POLLIN, 0};
            for (size_t i = 0; i < n; ++i) {
                fds[i + 1] = {waiting[i].fd, POLLIN, 0};
                next = std::min(next, waiting[i].deadlineMs);
            }
        }
        int r = poll(fds.data(), n + 1, static_cast<int>(std::max<long long>(0, next - now)));
        if (r < 0 && errno != EINTR) {
            TLOG("The waiting room's poll failed, %m");
            usleep(10000);
            continue;
        }
        if (fds[0].revents & POLLIN) {
            char drain[256];
            while (::read(wakePipe[0], drain, sizeof(drain)) > 0) {
            }
        }
        now = NowMs();
        // Only this thread removes entries, and others only append, so the
        // first n entries are still the ones polled.
        std::vector<Waiting> ready, expired;
        {
            std::lock_guard<std::mutex> lock(mutex);
            std::vector<Waiting> keep;
            keep.reserve(waiting.size());
            for (size_t i = 0; i < waiting.size(); ++i) {
                short ev = i < n && r > 0 ? fds[i + 1].revents : 0;
                if (ev & (POLLIN | POLLHUP | POLLERR))
                    ready.push_back(waiting[i]);
                else if (waiting[i].deadlineMs <= now)
                    expired.push_back(waiting[i]);
                else
                    keep.push_back(waiting[i]);
            }
            waiting.swap(keep);
        }
        for (const Waiting &w : expired) {
            if (w.requests == 0)
                closedSilent++;
            Close(w.fd, w.client);
        }
        for (const Waiting &w : ready)
            pool->enqueue([this, w] { ServeReady(w.fd, w.client, w.requests); });
    }
    std::vector<Waiting> left;
    {
        std::lock_guard<std::mutex> lock(mutex);
        left.swap(waiting);
    }
    for (const Waiting &w : left)
        Close(w.fd, w.client);
}
