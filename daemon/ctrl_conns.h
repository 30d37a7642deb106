// The control connections the loop holds open. Each accepted connection is
// non-blocking and has its own deadline: 0.5 s to deliver its request, then
// 0.5 s to take its reply. A slow or silent client therefore never delays
// another; at its deadline it is closed without a log line, unless its
// request arrived in time and only waits for its turn to be served.
#ifndef TARN_CTRL_CONNS_H
#define TARN_CTRL_CONNS_H

#include <poll.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

// Most connections held at once; past this, new ones wait in the backlog.
#define CTRL_CONNS_MAX 512

// Milliseconds on a monotonic clock.
int64_t NowMs();

class ControlConnections {
public:
    ControlConnections() = default;
    ~ControlConnections();
    ControlConnections(const ControlConnections &) = delete;
    ControlConnections &operator=(const ControlConnections &) = delete;

    // Accepts every connection pending on the (non-blocking) listening
    // socket, up to the limit. Returns the number accepted.
    int AcceptAll(int listenFd);
    // Appends one pollfd per connection (POLLIN while its request is awaited,
    // POLLOUT while its reply is being written).
    void AddPollFds(std::vector<struct pollfd> &fds) const;
    // After poll: records which connections are ready. fds[first...] are
    // those AddPollFds appended.
    void TakeReady(const std::vector<struct pollfd> &fds, size_t first);
    // A connection whose request can be read now, or -1.
    int NextReadable() const;
    // Takes the reply of the connection fd; sends what the socket takes at
    // once and keeps the rest for later turns. Closes fd when done.
    void Reply(int fd, const char *bytes, size_t size);
    // Forgets fd and closes it.
    void Close(int fd);
    // Continues the replies whose sockets are writable; closes connections
    // past their deadline. Call once per turn.
    void Service();
    // The nearest deadline in ms from now (0: due), -1 when none.
    int TimeoutMs() const;
    size_t Count() const { return conns.size(); }
    void CloseAll();

private:
    struct Conn {
        int fd;
        int64_t deadline;
        std::string out;  // reply bytes not yet sent
        size_t sent;
        bool replying;
        bool ready;
    };
    Conn *Find(int fd);
    // True when bytes of the request wait to be read on fd.
    static bool Delivered(int fd);
    // Writes what the socket takes; true when the reply is complete or the
    // client is gone.
    static bool Flush(Conn &c);
    std::vector<Conn> conns;
};

#endif
