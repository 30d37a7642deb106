// A scriptable UPnP device for the control point's tests: a small HTTP
// server (descriptions, service descriptions, SOAP actions, GENA
// subscriptions) whose answers can also be slow, endless, cut off or
// malformed, plus senders for SSDP announcements and GENA events.
//
// Header only: each test program includes it directly. Everything here talks
// only to the addresses the test gives it (loopback or the test namespace's
// veth pair).
#ifndef TARN_TEST_FAKE_DEVICE_H
#define TARN_TEST_FAKE_DEVICE_H

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <strings.h>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace fakedev {

struct Request {
    std::string method;
    std::string path;
    std::string head;  // request line and headers
    std::string body;
    std::string issuedSid;  // SUBSCRIBE: the subscription ID this server answered with

    // Value of a header (name compared without regard to case), "" if absent.
    std::string Header(const char *name) const
    {
        size_t n = strlen(name);
        size_t pos = head.find("\r\n");
        while (pos != std::string::npos && pos + 2 < head.size()) {
            size_t start = pos + 2;
            size_t end = head.find("\r\n", start);
            std::string line = head.substr(start, end == std::string::npos ? std::string::npos
                                                                           : end - start);
            if (line.size() > n && strncasecmp(line.c_str(), name, n) == 0 && line[n] == ':') {
                size_t v = n + 1;
                while (v < line.size() && line[v] == ' ')
                    ++v;
                return line.substr(v);
            }
            pos = end;
        }
        return std::string();
    }
};

// How a route answers.
enum class Mode {
    Normal,    // status line, headers with Content-Length, body
    Stall,     // headers promise the body's length, half of it is sent, then nothing
    Endless,   // no length: filler is sent until the client gives up (1 GB at most)
    Huge,      // Content-Length of 1 GB announced, then filler as for Endless
    Close,     // the connection is closed without an answer
    Garbage,   // bytes that are not HTTP
    Trickle,   // the body, one byte every 200 ms
};

struct Route {
    int status = 200;
    std::string body;
    Mode mode = Mode::Normal;
    std::string contentType = "text/xml; charset=\"utf-8\"";
};

// Answer to a SOAP action: status and body.
using SoapHandler = std::function<void(const Request &, int &status, std::string &body)>;

class FakeHttpServer {
public:
    FakeHttpServer() = default;
    ~FakeHttpServer() { Stop(); }
    FakeHttpServer(const FakeHttpServer &) = delete;
    FakeHttpServer &operator=(const FakeHttpServer &) = delete;

    // Listens on ip:port (port 0: any free port). Returns the port, or -1.
    int Start(const char *ip, int port)
    {
        listenFd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (listenFd < 0)
            return -1;
        int one = 1;
        setsockopt(listenFd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_port = htons(static_cast<uint16_t>(port));
        if (inet_pton(AF_INET, ip, &addr.sin_addr) != 1 ||
            bind(listenFd, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) != 0 ||
            listen(listenFd, 64) != 0) {
            close(listenFd);
            listenFd = -1;
            return -1;
        }
        socklen_t len = sizeof(addr);
        getsockname(listenFd, reinterpret_cast<sockaddr *>(&addr), &len);
        host = ip;
        boundPort = ntohs(addr.sin_port);
        stopping = false;
        acceptThread = std::thread([this] { AcceptLoop(); });
        return boundPort;
    }

    void Stop()
    {
        if (listenFd < 0)
            return;
        stopping = true;
        if (acceptThread.joinable())
            acceptThread.join();
        std::vector<std::thread> workers;
        {
            std::lock_guard<std::mutex> lock(mutex);
            workers.swap(connThreads);
        }
        for (std::thread &t : workers)
            t.join();
        close(listenFd);
        listenFd = -1;
    }

    std::string BaseUrl() const { return "http://" + host + ":" + std::to_string(boundPort); }
    int Port() const { return boundPort; }

    void SetRoute(const std::string &path, const Route &route)
    {
        std::lock_guard<std::mutex> lock(mutex);
        routes[path] = route;
    }
    void SetSoapHandler(SoapHandler handler)
    {
        std::lock_guard<std::mutex> lock(mutex);
        soap = std::move(handler);
    }
    // When set, SUBSCRIBE requests are refused with this status.
    void SetSubscribeStatus(int status)
    {
        std::lock_guard<std::mutex> lock(mutex);
        subscribeStatus = status;
    }

    std::vector<Request> Requests()
    {
        std::lock_guard<std::mutex> lock(mutex);
        return requests;
    }
    // Requests whose method (and path, when given) match.
    std::vector<Request> RequestsOf(const char *method, const char *path = nullptr)
    {
        std::vector<Request> out;
        for (const Request &r : Requests())
            if (r.method == method && (path == nullptr || r.path == path))
                out.push_back(r);
        return out;
    }
    // Waits until at least count requests match; false on time-out.
    bool WaitFor(const char *method, const char *path, size_t count, int timeoutMs)
    {
        auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
        while (std::chrono::steady_clock::now() < deadline) {
            if (RequestsOf(method, path).size() >= count)
                return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        return RequestsOf(method, path).size() >= count;
    }

private:
    void AcceptLoop()
    {
        while (!stopping) {
            pollfd p{listenFd, POLLIN, 0};
            if (poll(&p, 1, 50) <= 0)
                continue;
            int fd = accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC);
            if (fd < 0)
                continue;
            std::lock_guard<std::mutex> lock(mutex);
            connThreads.emplace_back([this, fd] { Serve(fd); });
        }
    }

    // Reads until the headers and the announced body are in; false when the
    // peer goes away first or the server stops.
    bool ReadRequest(int fd, Request &req)
    {
        std::string data;
        char buf[4096];
        size_t headEnd = std::string::npos;
        size_t bodyLen = 0;
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        for (;;) {
            if (headEnd == std::string::npos) {
                headEnd = data.find("\r\n\r\n");
                if (headEnd != std::string::npos) {
                    req.head = data.substr(0, headEnd);
                    std::string cl = req.Header("CONTENT-LENGTH");
                    bodyLen = cl.empty() ? 0 : static_cast<size_t>(strtoul(cl.c_str(), nullptr, 10));
                }
            }
            if (headEnd != std::string::npos && data.size() >= headEnd + 4 + bodyLen)
                break;
            if (stopping || std::chrono::steady_clock::now() > deadline)
                return false;
            pollfd p{fd, POLLIN, 0};
            if (poll(&p, 1, 50) <= 0)
                continue;
            ssize_t n = recv(fd, buf, sizeof(buf), 0);
            if (n <= 0)
                return false;
            data.append(buf, static_cast<size_t>(n));
        }
        req.body = data.substr(headEnd + 4, bodyLen);
        size_t sp1 = req.head.find(' ');
        size_t sp2 = req.head.find(' ', sp1 + 1);
        req.method = req.head.substr(0, sp1);
        req.path = req.head.substr(sp1 + 1, sp2 - sp1 - 1);
        return true;
    }

    static bool SendAll(int fd, const std::string &text)
    {
        size_t off = 0;
        while (off < text.size()) {
            ssize_t n = send(fd, text.data() + off, text.size() - off, MSG_NOSIGNAL);
            if (n <= 0)
                return false;
            off += static_cast<size_t>(n);
        }
        return true;
    }

    static std::string Head(int status, const std::string &type, size_t length,
                            const std::string &extra = std::string())
    {
        return "HTTP/1.1 " + std::to_string(status) + (status == 200 ? " OK" : " Error") +
               "\r\nCONTENT-TYPE: " + type + "\r\nCONTENT-LENGTH: " + std::to_string(length) +
               "\r\nSERVER: Linux/1.0 UPnP/1.0 fakedevice/1.0\r\nCONNECTION: close\r\n" + extra +
               "\r\n";
    }

    // Sleeps in small steps; false when the server is stopping.
    bool Pause(int ms)
    {
        for (int waited = 0; waited < ms; waited += 20) {
            if (stopping)
                return false;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        return !stopping;
    }

    void Serve(int fd)
    {
        Request req;
        if (ReadRequest(fd, req)) {
            Route route;
            bool found = false;
            SoapHandler handler;
            int subStatus;
            int sidNumber;
            {
                std::lock_guard<std::mutex> lock(mutex);
                sidNumber = ++sidCounter;
                if (req.method == "SUBSCRIBE" && subscribeStatus == 0)
                    req.issuedSid = "uuid:fake-sid-" + std::to_string(boundPort) + "-" +
                                    std::to_string(sidNumber);
                requests.push_back(req);
                auto it = routes.find(req.path);
                if (it != routes.end()) {
                    route = it->second;
                    found = true;
                }
                handler = soap;
                subStatus = subscribeStatus;
            }
            if (req.method == "SUBSCRIBE") {
                if (subStatus != 0) {
                    SendAll(fd, Head(subStatus, "text/plain", 0));
                } else {
                    SendAll(fd, Head(200, "text/plain", 0,
                                     "SID: " + req.issuedSid + "\r\nTIMEOUT: Second-1800\r\n"));
                }
            } else if (req.method == "UNSUBSCRIBE") {
                SendAll(fd, Head(200, "text/plain", 0));
            } else if (req.method == "POST" && handler && !found) {
                int status = 200;
                std::string body;
                handler(req, status, body);
                SendAll(fd, Head(status, "text/xml; charset=\"utf-8\"", body.size(), "EXT:\r\n") +
                                body);
            } else if (!found) {
                SendAll(fd, Head(404, "text/plain", 0));
            } else {
                Answer(fd, route);
            }
        }
        shutdown(fd, SHUT_RDWR);
        close(fd);
    }

    void Answer(int fd, const Route &route)
    {
        switch (route.mode) {
        case Mode::Normal:
            SendAll(fd, Head(route.status, route.contentType, route.body.size()) + route.body);
            break;
        case Mode::Stall:
            SendAll(fd, Head(route.status, route.contentType, route.body.size()) +
                            route.body.substr(0, route.body.size() / 2));
            while (Pause(100)) {
            }
            break;
        case Mode::Endless:
        case Mode::Huge: {
            if (route.mode == Mode::Huge)
                SendAll(fd, Head(route.status, route.contentType, 1000000000u) + route.body);
            else
                SendAll(fd, "HTTP/1.1 200 OK\r\nCONTENT-TYPE: text/xml\r\nCONNECTION: close\r\n\r\n" +
                                route.body);
            std::string filler(16384, ' ');
            size_t sent = 0;
            while (!stopping && sent < 1000000000u && SendAll(fd, filler))
                sent += filler.size();
            break;
        }
        case Mode::Close:
            break;
        case Mode::Garbage: {
            static const char kJunk[] = "\x01\x02 this is not http \xff\xfe\r\n\r\n";
            SendAll(fd, std::string(kJunk, sizeof(kJunk) - 1) + route.body);
            break;
        }
        case Mode::Trickle:
            SendAll(fd, Head(route.status, route.contentType, route.body.size()));
            for (char c : route.body) {
                if (!SendAll(fd, std::string(1, c)) || !Pause(200))
                    break;
            }
            break;
        }
    }

    int listenFd = -1;
    int boundPort = 0;
    std::string host;
    std::atomic<bool> stopping{false};
    std::thread acceptThread;
    std::mutex mutex;
    std::vector<std::thread> connThreads;
    std::map<std::string, Route> routes;
    SoapHandler soap;
    std::vector<Request> requests;
    int subscribeStatus = 0;
    int sidCounter = 0;
};

// Sends one SSDP NOTIFY from fromIp to the SSDP group, out of the interface
// that holds fromIp (and looped back to this host). nts: "ssdp:alive" or
// "ssdp:byebye". Returns 0 or -1.
inline int SendSsdpNotify(const char *fromIp, const std::string &nts, const std::string &nt,
                          const std::string &usn, const std::string &location)
{
    int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return -1;
    in_addr iface{};
    inet_pton(AF_INET, fromIp, &iface);
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &iface, sizeof(iface));
    unsigned char ttl = 2, loop = 1;
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof(ttl));
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_LOOP, &loop, sizeof(loop));
    sockaddr_in from{};
    from.sin_family = AF_INET;
    from.sin_addr = iface;
    bind(fd, reinterpret_cast<sockaddr *>(&from), sizeof(from));
    std::string msg = "NOTIFY * HTTP/1.1\r\nHOST: 239.255.255.250:1900\r\n";
    if (nts == "ssdp:alive")
        msg += "CACHE-CONTROL: max-age=1800\r\nLOCATION: " + location +
               "\r\nSERVER: Linux/1.0 UPnP/1.0 fakedevice/1.0\r\n";
    msg += "NT: " + nt + "\r\nNTS: " + nts + "\r\nUSN: " + usn + "\r\n\r\n";
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(1900);
    inet_pton(AF_INET, "239.255.255.250", &to.sin_addr);
    ssize_t n = sendto(fd, msg.data(), msg.size(), 0, reinterpret_cast<sockaddr *>(&to), sizeof(to));
    close(fd);
    return n == static_cast<ssize_t>(msg.size()) ? 0 : -1;
}

// Announces (or withdraws) a device's service the way a device does: the
// USN is "<udn>::<service type>".
inline int AnnounceService(const char *fromIp, bool alive, const std::string &udn,
                           const std::string &serviceType, const std::string &location)
{
    return SendSsdpNotify(fromIp, alive ? "ssdp:alive" : "ssdp:byebye", serviceType,
                          udn + "::" + serviceType, location);
}

// The IPv4 address on which some process of this network namespace listens
// on a TCP port ("" when none): libupnp's HTTP server shows which address a
// control point chose.
inline std::string ListeningAddress(int port)
{
    FILE *f = fopen("/proc/net/tcp", "r");
    if (f == nullptr)
        return std::string();
    char line[512];
    std::string found;
    while (fgets(line, sizeof(line), f) != nullptr) {
        unsigned addr = 0, lport = 0, state = 0;
        if (sscanf(line, " %*d: %8X:%4X %*8X:%*4X %2X", &addr, &lport, &state) != 3)
            continue;
        if (static_cast<int>(lport) == port && state == 0x0A) {
            in_addr a;
            a.s_addr = addr;  // /proc shows the address in host order of the raw bytes
            char text[INET_ADDRSTRLEN];
            inet_ntop(AF_INET, &a, text, sizeof(text));
            found = text;
            break;
        }
    }
    fclose(f);
    return found;
}

// The namespace's two veth ends (scripts/netns-run): the one a control point
// at controlPointIp is not on, so that announcements cross the pair.
inline void PeerInterface(const std::string &controlPointIp, std::string &ip, std::string &iface)
{
    if (controlPointIp == "10.77.0.1") {
        ip = "10.77.0.2";
        iface = "tveth1";
    } else {
        ip = "10.77.0.1";
        iface = "tveth0";
    }
}

// Splits "http://host:port/path" (as found in a GENA CALLBACK header, with or
// without the angle brackets) into its parts.
inline bool SplitUrl(std::string url, std::string &hostOut, int &portOut, std::string &pathOut)
{
    if (!url.empty() && url[0] == '<')
        url = url.substr(1, url.find('>') - 1);
    if (url.compare(0, 7, "http://") != 0)
        return false;
    size_t slash = url.find('/', 7);
    std::string hostPort = url.substr(7, slash == std::string::npos ? std::string::npos : slash - 7);
    pathOut = slash == std::string::npos ? "/" : url.substr(slash);
    size_t colon = hostPort.find(':');
    hostOut = hostPort.substr(0, colon);
    portOut = colon == std::string::npos ? 80 : atoi(hostPort.c_str() + colon + 1);
    return true;
}

// Sends one GENA NOTIFY (an event) to a subscriber's callback URL and
// returns the HTTP status of its answer, or -1.
inline int SendGenaEvent(const std::string &callback, const std::string &sid, int seq,
                         const std::string &body)
{
    std::string host, path;
    int port = 0;
    if (!SplitUrl(callback, host, port, path))
        return -1;
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return -1;
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<uint16_t>(port));
    inet_pton(AF_INET, host.c_str(), &addr.sin_addr);
    if (connect(fd, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) != 0) {
        close(fd);
        return -1;
    }
    std::string msg = "NOTIFY " + path + " HTTP/1.1\r\nHOST: " + host + ":" +
                      std::to_string(port) +
                      "\r\nCONTENT-TYPE: text/xml; charset=\"utf-8\"\r\nNT: upnp:event\r\n"
                      "NTS: upnp:propchange\r\nSID: " +
                      sid + "\r\nSEQ: " + std::to_string(seq) +
                      "\r\nCONTENT-LENGTH: " + std::to_string(body.size()) + "\r\n\r\n" + body;
    size_t off = 0;
    while (off < msg.size()) {
        ssize_t n = send(fd, msg.data() + off, msg.size() - off, MSG_NOSIGNAL);
        if (n <= 0)
            break;
        off += static_cast<size_t>(n);
    }
    std::string answer;
    char buf[1024];
    pollfd p{fd, POLLIN, 0};
    while (answer.find("\r\n") == std::string::npos && poll(&p, 1, 5000) > 0) {
        ssize_t n = recv(fd, buf, sizeof(buf), 0);
        if (n <= 0)
            break;
        answer.append(buf, static_cast<size_t>(n));
    }
    close(fd);
    if (answer.compare(0, 5, "HTTP/") != 0)
        return -1;
    size_t sp = answer.find(' ');
    return sp == std::string::npos ? -1 : atoi(answer.c_str() + sp + 1);
}

// The body of a GENA event carrying one LastChange text (escaped here).
inline std::string LastChangeEvent(const std::string &lastChange)
{
    std::string escaped;
    for (char c : lastChange) {
        switch (c) {
        case '<': escaped += "&lt;"; break;
        case '>': escaped += "&gt;"; break;
        case '&': escaped += "&amp;"; break;
        case '"': escaped += "&quot;"; break;
        default: escaped += c; break;
        }
    }
    return "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property><LastChange>" +
           escaped + "</LastChange></e:property></e:propertyset>";
}

// A device description with the given services (type, base name) whose
// URLs are /<name>/scpd.xml, /<name>/control and /<name>/event.
inline std::string DeviceDescription(const std::string &udn, const std::string &name,
                                     const std::string &modelName,
                                     const std::vector<std::pair<std::string, std::string>> &services)
{
    std::string xml = "<?xml version=\"1.0\"?>\n<root xmlns=\"urn:schemas-upnp-org:device-1-0\">"
                      "<specVersion><major>1</major><minor>0</minor></specVersion><device>"
                      "<deviceType>urn:schemas-upnp-org:device:MediaRenderer:1</deviceType>"
                      "<friendlyName>" +
                      name + "</friendlyName><modelName>" + modelName + "</modelName><UDN>" + udn +
                      "</UDN><serviceList>";
    for (const auto &s : services)
        xml += "<service><serviceType>" + s.first + "</serviceType><serviceId>urn:upnp-org:serviceId:" +
               s.second + "</serviceId><SCPDURL>/" + s.second + "/scpd.xml</SCPDURL><controlURL>/" +
               s.second + "/control</controlURL><eventSubURL>/" + s.second +
               "/event</eventSubURL></service>";
    xml += "</serviceList></device></root>\n";
    return xml;
}

}  // namespace fakedev

#endif
