// An HTTP server that slow, idle or numerous clients cannot starve.
//
// cpp-httplib gives each accepted connection a worker thread for as long as
// the connection lasts, idle waits included. This server keeps the library's
// request parsing, routing and responses (its handlers are registered as on
// any httplib::Server) and changes how connections are held:
//   - at most `perClient` connections of one client address (its IP address)
//     at once, waiting or served; a connection beyond that is closed at once;
//   - a connection with no request to read (a new one, or a kept-alive one
//     between requests) waits in one poll() thread, not in a worker; it is
//     closed when it stays silent for `silentTimeoutMs` (new connections) or
//     the keep-alive time (kept-alive ones), or when the waiting room is full;
//   - workers only ever run requests that have bytes to read, with the read
//     and write time-outs of the server.
// A worker blocked writing to a client that does not read is bounded by the
// write time-out; the per-client limit keeps one address from holding many.
#ifndef TARNWEB_GUARDED_SERVER_H
#define TARNWEB_GUARDED_SERVER_H

#include <httplib.h>

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

struct GuardLimits {
    int workers = 32;            // requests served at once
    int perClient = 8;           // connections of one client address
    int waitingMax = 4096;       // connections waiting for a request at once
    int silentTimeoutMs = 5000;  // a new connection must send its request within this
};

class GuardedServer : public httplib::Server {
public:
    explicit GuardedServer(const GuardLimits &limits);
    ~GuardedServer() override;
    GuardedServer(const GuardedServer &) = delete;
    GuardedServer &operator=(const GuardedServer &) = delete;

    // Widens the queue of connections not yet accepted (the library asks
    // for 5, so that a burst of connections has SYNs dropped and clients
    // wait a second or more). Call after binding. 0 or -1.
    int SetBacklog(int backlog);

    // Connections closed since the start: over the per-client limit, with
    // the waiting room full, silent past their deadline.
    long RefusedPerClient() const { return refusedPerClient.load(); }
    long RefusedRoomFull() const { return refusedRoomFull.load(); }
    long ClosedSilent() const { return closedSilent.load(); }

    // For a handler, on the worker serving the request: the connection
    // closes after this response instead of waiting for another request
    // (a request refused before its body was read leaves the body in the
    // stream, where it would be read as the next request).
    static void CloseAfterResponse();

private:
    struct Waiting {
        int fd;
        long long deadlineMs;
        std::string client;
        int requests;  // requests served on this connection so far
    };
    class PoolProxy;

    bool process_and_close_socket(socket_t sock) override;

    bool Admit(const std::string &client);
    void Release(const std::string &client);
    void Close(int fd, const std::string &client);
    void Park(int fd, const std::string &client, int requests);
    void ServeReady(int fd, const std::string &client, int requests);
    void WaitingRoom();
    void StopAll();

    GuardLimits limits;
    std::unique_ptr<httplib::ThreadPool> pool;
    std::mutex mutex;  // guards perClient, waiting, stopping
    std::map<std::string, int> perClient;
    std::vector<Waiting> waiting;
    bool stopping = false;
    std::atomic<long> refusedPerClient{0}, refusedRoomFull{0}, closedSilent{0};
    long long lastRefusalLogMs = 0;
    int wakePipe[2] = {-1, -1};
    std::thread room;
};

#endif
