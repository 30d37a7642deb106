// A scriptable UPnP device for the control point's tests: an HTTP server whose
// answers can also stall, never end, be cut off or be garbage, and senders for
// SSDP announcements and GENA events, to the addresses the test gives only.
#ifndef TARN_TEST_FAKE_DEVICE_H
#define TARN_TEST_FAKE_DEVICE_H

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace fakedev {

struct Request {
    std::string method, path, head, body;
    std::string issuedSid;  // SUBSCRIBE: the subscription ID this server answered with

    // A header's value (name in any case), "" if absent.
    std::string Header(const char *name) const
    {
        size_t n = strlen(name);
        for (size_t pos = head.find("\r\n"); pos != std::string::npos; pos = head.find("\r\n", pos + 2))
            if (strncasecmp(head.c_str() + pos + 2, name, n) == 0 && head[pos + 2 + n] == ':') {
                size_t v = head.find_first_not_of(' ', pos + 3 + n);
                return head.substr(v, head.find("\r\n", v) - v);
            }
        return std::string();
    }
};

enum class Mode {
    Normal,   // headers with Content-Length, body
    Stall,    // the body's length promised, half of it sent, then nothing
    Endless,  // no length: filler until the client gives up (1 GB at most)
    Huge,     // Content-Length of 1 GB, then filler as for Endless
    Close,    // closed without an answer
    Garbage,  // bytes that are not HTTP
};

struct Route {
    std::string body;
    Mode mode = Mode::Normal;
};

// Sends all of text; false when the peer is gone.
inline bool SendAll(int fd, const std::string &text)
{
    ssize_t n = 0;
    for (size_t off = 0; off < text.size(); off += static_cast<size_t>(n))
        if ((n = send(fd, text.data() + off, text.size() - off, MSG_NOSIGNAL)) <= 0)
            return false;
    return true;
}

class FakeHttpServer {
public:
    ~FakeHttpServer() { Stop(); }

    // Listens on ip, any free port. Returns the port, or -1.
    int Start(const char *ip)
    {
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        socklen_t len = sizeof(addr);
        listenFd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (listenFd < 0 || inet_pton(AF_INET, ip, &addr.sin_addr) != 1 ||
            bind(listenFd, reinterpret_cast<sockaddr *>(&addr), len) != 0 || listen(listenFd, 64) != 0 ||
            getsockname(listenFd, reinterpret_cast<sockaddr *>(&addr), &len) != 0)
            return -1;
        base = std::string("http://") + ip + ":" + std::to_string(port = ntohs(addr.sin_port));
        acceptThread = std::thread([this] {
            for (pollfd p{listenFd, POLLIN, 0}; !stopping;) {
                int fd = poll(&p, 1, 50) > 0 ? accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC) : -1;
                if (fd >= 0)
                    connThreads.emplace_back([this, fd] { Serve(fd); });
            }
        });
        return port;
    }
    void Stop()
    {
        stopping = true;
        if (acceptThread.joinable())
            acceptThread.join();
        for (std::thread &t : connThreads)  // the accept thread, which adds them, has ended
            t.join();
        connThreads.clear();
        if (listenFd >= 0)
            close(listenFd);
        listenFd = -1;
    }

    const std::string &BaseUrl() const { return base; }
    void SetRoute(const std::string &path, const Route &route)
    {
        std::lock_guard<std::mutex> lock(mutex);
        routes[path] = route;
    }
    std::vector<Request> RequestsOf(const char *method, const char *path = nullptr)
    {
        std::lock_guard<std::mutex> lock(mutex);
        std::vector<Request> out;
        for (const Request &r : requests)
            if (r.method == method && (path == nullptr || r.path == path))
                out.push_back(r);
        return out;
    }
    bool WaitFor(const char *method, const char *path, size_t count, int timeoutMs)
    {
        for (int waited = 0; RequestsOf(method, path).size() < count; waited += 20) {
            if (waited >= timeoutMs)
                return false;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        return true;
    }

private:
    // Headers and body; false when the peer goes, the server stops or 10 s pass.
    bool ReadRequest(int fd, Request &req)
    {
        std::string data;
        char buf[4096];
        size_t headEnd = std::string::npos, bodyLen = 0;
        for (int waited = 0; waited < 10000 && !stopping;) {
            if (headEnd == std::string::npos && (headEnd = data.find("\r\n\r\n")) != std::string::npos) {
                req.head = data.substr(0, headEnd);
                bodyLen = strtoul(req.Header("CONTENT-LENGTH").c_str(), nullptr, 10);
            }
            if (headEnd != std::string::npos && data.size() >= headEnd + 4 + bodyLen) {
                req.body = data.substr(headEnd + 4, bodyLen);
                size_t sp1 = req.head.find(' '), sp2 = req.head.find(' ', sp1 + 1);
                req.method = req.head.substr(0, sp1);
                req.path = req.head.substr(sp1 + 1, sp2 - sp1 - 1);
                return true;
            }
            pollfd p{fd, POLLIN, 0};
            if (poll(&p, 1, 50) <= 0) {
                waited += 50;
                continue;
            }
            ssize_t n = recv(fd, buf, sizeof(buf), 0);
            if (n <= 0)
                return false;
            data.append(buf, static_cast<size_t>(n));
        }
        return false;
    }

    static std::string Head(int status, size_t length, const std::string &extra = std::string())
    {
        return "HTTP/1.1 " + std::to_string(status) + (status == 200 ? " OK" : " Not Found") +
               "\r\nCONTENT-TYPE: text/xml; charset=\"utf-8\"\r\nCONTENT-LENGTH: " + std::to_string(length) +
               "\r\nSERVER: Linux/1.0 UPnP/1.0 fakedevice/1.0\r\nCONNECTION: close\r\n" + extra + "\r\n";
    }

    void Serve(int fd)
    {
        Request req;
        if (ReadRequest(fd, req)) {
            std::unique_lock<std::mutex> lock(mutex);
            if (req.method == "SUBSCRIBE")
                req.issuedSid = "uuid:fake-sid-" + std::to_string(port) + "-" + std::to_string(requests.size());
            requests.push_back(req);
            bool found = routes.count(req.path) != 0;
            Route route = found ? routes[req.path] : Route();
            lock.unlock();
            std::string body = route.body, filler(16384, ' ');
            if (req.method == "SUBSCRIBE") {
                SendAll(fd, Head(200, 0, "SID: " + req.issuedSid + "\r\nTIMEOUT: Second-1800\r\n"));
            } else if (!found) {
                SendAll(fd, Head(404, 0));
            } else if (route.mode == Mode::Normal) {
                SendAll(fd, Head(200, body.size()) + body);
            } else if (route.mode == Mode::Stall) {
                SendAll(fd, Head(200, body.size()) + body.substr(0, body.size() / 2));
                while (!stopping)
                    std::this_thread::sleep_for(std::chrono::milliseconds(20));
            } else if (route.mode == Mode::Endless || route.mode == Mode::Huge) {
                SendAll(fd, (route.mode == Mode::Huge ? Head(200, 1000000000u)
                                                      : "HTTP/1.1 200 OK\r\nCONNECTION: close\r\n\r\n") + body);
                for (size_t sent = 0; !stopping && sent < 1000000000u && SendAll(fd, filler);)
                    sent += filler.size();
            } else if (route.mode == Mode::Garbage) {
                SendAll(fd, "\x01\x02 this is not http \xff\xfe\r\n\r\n" + body);
            }
        }
        shutdown(fd, SHUT_RDWR);
        close(fd);
    }

    int listenFd = -1, port = 0;
    std::string base;
    std::atomic<bool> stopping{false};
    std::thread acceptThread;
    std::vector<std::thread> connThreads;  // touched by the accept thread only, then by Stop
    std::mutex mutex;
    std::map<std::string, Route> routes;
    std::vector<Request> requests;
};

// Sends bytes by UDP (multicast out of fromIp's interface, looped back) or TCP
// from fromIp to ip:port: TCP gives the HTTP answer's status or -1, UDP 0 or -1.
inline int SendRaw(int type, const std::string &fromIp, const std::string &ip, int port, const std::string &bytes)
{
    int fd = socket(AF_INET, type | SOCK_CLOEXEC, 0), status = -1;
    sockaddr_in from{}, to{};
    from.sin_family = to.sin_family = AF_INET;
    to.sin_port = htons(static_cast<uint16_t>(port));
    inet_pton(AF_INET, fromIp.c_str(), &from.sin_addr);
    inet_pton(AF_INET, ip.c_str(), &to.sin_addr);
    unsigned char ttl = 2, loop = 1;
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &from.sin_addr, sizeof(from.sin_addr));
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof(ttl));
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_LOOP, &loop, sizeof(loop));
    bind(fd, reinterpret_cast<sockaddr *>(&from), sizeof(from));
    if (type == SOCK_DGRAM) {
        status = sendto(fd, bytes.data(), bytes.size(), 0, reinterpret_cast<sockaddr *>(&to), sizeof(to)) ==
                 static_cast<ssize_t>(bytes.size()) ? 0 : -1;
    } else if (connect(fd, reinterpret_cast<sockaddr *>(&to), sizeof(to)) == 0 && SendAll(fd, bytes)) {
        char buf[1024] = "";
        pollfd p{fd, POLLIN, 0};
        if (poll(&p, 1, 5000) > 0 && recv(fd, buf, sizeof(buf) - 1, 0) > 0 && strncmp(buf, "HTTP/", 5) == 0)
            status = atoi(strchr(buf, ' ') != nullptr ? strchr(buf, ' ') + 1 : "-1");
    }
    close(fd);
    return status;
}

// One SSDP NOTIFY (alive or bye-bye) for "<udn>::<service type>"; 0 or -1.
inline int AnnounceService(const std::string &fromIp, bool alive, const std::string &udn,
                           const std::string &serviceType, const std::string &location)
{
    return SendRaw(SOCK_DGRAM, fromIp, "239.255.255.250", 1900,
                   "NOTIFY * HTTP/1.1\r\nHOST: 239.255.255.250:1900\r\n" +
                       (alive ? "CACHE-CONTROL: max-age=1800\r\nLOCATION: " + location +
                                    "\r\nSERVER: Linux/1.0 UPnP/1.0 fakedevice/1.0\r\n"
                              : std::string()) +
                       "NT: " + serviceType + "\r\nNTS: " + (alive ? "ssdp:alive" : "ssdp:byebye") +
                       "\r\nUSN: " + udn + "::" + serviceType + "\r\n\r\n");
}

// One GENA NOTIFY to a CALLBACK ("<http://ip:port/path>"): the answer's status or -1.
inline int SendGenaEvent(const std::string &callback, const std::string &sid, int seq, const std::string &body)
{
    size_t colon = callback.find(':', 8), slash = callback.find('/', 8);
    if (callback.compare(0, 8, "<http://") != 0 || colon > slash || slash == std::string::npos)
        return -1;
    std::string host = callback.substr(8, colon - 8);
    return SendRaw(SOCK_STREAM, "0.0.0.0", host, atoi(callback.c_str() + colon + 1),
                   "NOTIFY " + callback.substr(slash, callback.find('>') - slash) + " HTTP/1.1\r\nHOST: " +
                       callback.substr(8, slash - 8) + "\r\nCONTENT-TYPE: text/xml; charset=\"utf-8\"\r\n"
                       "NT: upnp:event\r\nNTS: upnp:propchange\r\nSID: " + sid + "\r\nSEQ: " + std::to_string(seq) +
                       "\r\nCONTENT-LENGTH: " + std::to_string(body.size()) + "\r\n\r\n" + body);
}

// The body of a GENA event carrying one LastChange text (escaped here).
inline std::string LastChangeEvent(const std::string &lastChange)
{
    std::string escaped;
    for (char c : lastChange)
        escaped += c == '<' ? "&lt;" : c == '>' ? "&gt;" : c == '&' ? "&amp;" : std::string(1, c);
    return "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property><LastChange>" + escaped +
           "</LastChange></e:property></e:propertyset>";
}

// The IPv4 address some process here listens on at a TCP port ("" when none):
// libupnp's HTTP server shows which address a control point chose.
inline std::string ListeningAddress(int port)
{
    FILE *f = fopen("/proc/net/tcp", "r");
    if (f == nullptr)
        return std::string();
    char line[512], text[INET_ADDRSTRLEN] = "";
    unsigned addr = 0, lport = 0, state = 0;
    while (text[0] == '\0' && fgets(line, sizeof(line), f) != nullptr)
        if (sscanf(line, " %*d: %8X:%4X %*8X:%*4X %2X", &addr, &lport, &state) == 3 &&
            static_cast<int>(lport) == port && state == 0x0A)
            inet_ntop(AF_INET, &addr, text, sizeof(text));  // raw bytes, as /proc shows them
    fclose(f);
    return text;
}

// The veth end (scripts/netns-run) a control point at controlPointIp is not on.
inline void PeerInterface(const std::string &controlPointIp, std::string &ip, std::string &iface)
{
    bool first = controlPointIp == "10.77.0.1";
    ip = first ? "10.77.0.2" : "10.77.0.1";
    iface = first ? "tveth1" : "tveth0";
}

// A renderer description; each service (type, name) at /<name>/scpd.xml, control, event.
inline std::string DeviceDescription(const std::string &udn, const std::string &name,
                                     const std::vector<std::pair<std::string, std::string>> &services)
{
    std::string xml = "<?xml version=\"1.0\"?>\n<root xmlns=\"urn:schemas-upnp-org:device-1-0\"><device>"
                      "<deviceType>urn:schemas-upnp-org:device:MediaRenderer:1</deviceType><friendlyName>" +
                      name + "</friendlyName><modelName>fake</modelName><UDN>" + udn + "</UDN><serviceList>";
    for (const auto &s : services)
        xml += "<service><serviceType>" + s.first + "</serviceType><SCPDURL>/" + s.second + "/scpd.xml</SCPDURL>"
               "<controlURL>/" + s.second + "/control</controlURL><eventSubURL>/" + s.second +
               "/event</eventSubURL></service>";
    return xml + "</serviceList></device></root>\n";
}

// The smallest service descriptions the capability probe accepts.
inline std::string AvtScpd()
{
    return "<scpd><actionList><action><name>Seek</name></action></actionList><serviceStateTable>"
           "<stateVariable><name>A_ARG_TYPE_SeekMode</name><allowedValueList><allowedValue>ABS_TIME"
           "</allowedValue><allowedValue>REL_TIME</allowedValue></allowedValueList></stateVariable>"
           "</serviceStateTable></scpd>";
}
inline std::string RcsScpd()
{
    return "<scpd><actionList><action><name>SetVolume</name></action></actionList></scpd>";
}

}  // namespace fakedev

#endif
