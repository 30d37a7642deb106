// A scriptable UPnP device for the control point's tests: a small HTTP server
// (descriptions, service descriptions, SOAP actions, GENA subscriptions) whose
// answers can also stall, never end, be cut off or be garbage, plus senders for
// SSDP announcements and GENA events. Header only. It talks only to the
// addresses the test gives it (loopback or the test namespace's veth pair).
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
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace fakedev {

struct Request {
    std::string method, path, head, body;
    std::string issuedSid;  // SUBSCRIBE: the subscription ID this server answered with

    // Value of a header (name without regard to case), "" if absent.
    std::string Header(const char *name) const
    {
        size_t n = strlen(name);
        for (size_t pos = head.find("\r\n"); pos != std::string::npos;) {
            size_t end = head.find("\r\n", pos + 2);
            std::string line = head.substr(pos + 2, end == std::string::npos ? end : end - pos - 2);
            if (line.size() > n && strncasecmp(line.c_str(), name, n) == 0 && line[n] == ':')
                return line.substr(line.find_first_not_of(' ', n + 1) == std::string::npos
                                       ? line.size() : line.find_first_not_of(' ', n + 1));
            pos = end;
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

using SoapHandler = std::function<void(const Request &, std::string &body)>;

class FakeHttpServer {
public:
    FakeHttpServer() = default;
    ~FakeHttpServer() { Stop(); }
    FakeHttpServer(const FakeHttpServer &) = delete;
    FakeHttpServer &operator=(const FakeHttpServer &) = delete;

    // Listens on ip:port (0: any free port). Returns the port, or -1.
    int Start(const char *ip, int port)
    {
        listenFd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        int one = 1;
        setsockopt(listenFd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
        sockaddr_in addr{};
        addr.sin_family = AF_INET;
        addr.sin_port = htons(static_cast<uint16_t>(port));
        socklen_t len = sizeof(addr);
        if (listenFd < 0 || inet_pton(AF_INET, ip, &addr.sin_addr) != 1 ||
            bind(listenFd, reinterpret_cast<sockaddr *>(&addr), len) != 0 || listen(listenFd, 64) != 0 ||
            getsockname(listenFd, reinterpret_cast<sockaddr *>(&addr), &len) != 0) {
            if (listenFd >= 0)
                close(listenFd);
            return listenFd = -1;
        }
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
        acceptThread.join();
        for (std::thread &t : connThreads)  // the accept thread, which adds them, has ended
            t.join();
        connThreads.clear();
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
    // Requests whose method (and path, when given) match.
    std::vector<Request> RequestsOf(const char *method, const char *path = nullptr)
    {
        std::lock_guard<std::mutex> lock(mutex);
        std::vector<Request> out;
        for (const Request &r : requests)
            if (r.method == method && (path == nullptr || r.path == path))
                out.push_back(r);
        return out;
    }
    // Waits until at least count requests match; false on time-out.
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
    void AcceptLoop()
    {
        while (!stopping) {
            pollfd p{listenFd, POLLIN, 0};
            int fd = poll(&p, 1, 50) > 0 ? accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC) : -1;
            if (fd >= 0)
                connThreads.emplace_back([this, fd] { Serve(fd); });
        }
    }

    // Reads the headers and the announced body; false when the peer goes away
    // first, the server stops or 10 s pass.
    bool ReadRequest(int fd, Request &req)
    {
        std::string data;
        char buf[4096];
        size_t headEnd = std::string::npos, bodyLen = 0;
        for (int waited = 0; waited < 10000;) {
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
            if (stopping)
                return false;
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

    static bool SendAll(int fd, const std::string &text)
    {
        for (size_t off = 0; off < text.size();) {
            ssize_t n = send(fd, text.data() + off, text.size() - off, MSG_NOSIGNAL);
            if (n <= 0)
                return false;
            off += static_cast<size_t>(n);
        }
        return true;
    }

    static std::string Head(int status, size_t length, const std::string &extra = std::string())
    {
        return "HTTP/1.1 " + std::to_string(status) + (status == 200 ? " OK" : " Not Found") +
               "\r\nCONTENT-TYPE: text/xml; charset=\"utf-8\"\r\nCONTENT-LENGTH: " +
               std::to_string(length) + "\r\nSERVER: Linux/1.0 UPnP/1.0 fakedevice/1.0\r\n"
               "CONNECTION: close\r\n" + extra + "\r\n";
    }

    void Serve(int fd)
    {
        Request req;
        if (ReadRequest(fd, req)) {
            std::unique_lock<std::mutex> lock(mutex);
            if (req.method == "SUBSCRIBE")
                req.issuedSid = "uuid:fake-sid-" + std::to_string(boundPort) + "-" +
                                std::to_string(requests.size());
            requests.push_back(req);
            auto it = routes.find(req.path);
            Route route = it == routes.end() ? Route() : it->second;
            SoapHandler handler = soap;
            lock.unlock();
            if (req.method == "SUBSCRIBE") {
                SendAll(fd, Head(200, 0, "SID: " + req.issuedSid + "\r\nTIMEOUT: Second-1800\r\n"));
            } else if (req.method == "POST" && handler) {
                std::string body;
                handler(req, body);
                SendAll(fd, Head(200, body.size(), "EXT:\r\n") + body);
            } else if (it == routes.end()) {
                SendAll(fd, Head(404, 0));
            } else {
                Answer(fd, route);
            }
        }
        shutdown(fd, SHUT_RDWR);
        close(fd);
    }

    void Answer(int fd, const Route &route)
    {
        const std::string &body = route.body;
        switch (route.mode) {
        case Mode::Normal:
            SendAll(fd, Head(200, body.size()) + body);
            break;
        case Mode::Stall:
            SendAll(fd, Head(200, body.size()) + body.substr(0, body.size() / 2));
            while (!stopping)
                std::this_thread::sleep_for(std::chrono::milliseconds(20));
            break;
        case Mode::Endless:
        case Mode::Huge: {
            SendAll(fd, (route.mode == Mode::Huge ? Head(200, 1000000000u)
                                                  : "HTTP/1.1 200 OK\r\nCONNECTION: close\r\n\r\n") + body);
            std::string filler(16384, ' ');
            for (size_t sent = 0; !stopping && sent < 1000000000u && SendAll(fd, filler);)
                sent += filler.size();
            break;
        }
        case Mode::Close:
            break;
        case Mode::Garbage:
            SendAll(fd, std::string("\x01\x02 this is not http \xff\xfe\r\n\r\n") + body);
            break;
        }
    }

    int listenFd = -1, boundPort = 0;
    std::string host;
    std::atomic<bool> stopping{false};
    std::thread acceptThread;
    std::vector<std::thread> connThreads;  // touched by the accept thread only, then by Stop
    std::mutex mutex;
    std::map<std::string, Route> routes;
    SoapHandler soap;
    std::vector<Request> requests;
};

// Announces (alive) or withdraws (bye-bye) a device's service by one SSDP
// NOTIFY from fromIp, out of the interface holding fromIp and looped back to
// this host; the USN is "<udn>::<service type>". Returns 0 or -1.
inline int AnnounceService(const char *fromIp, bool alive, const std::string &udn,
                           const std::string &serviceType, const std::string &location)
{
    int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return -1;
    sockaddr_in from{}, to{};
    from.sin_family = to.sin_family = AF_INET;
    inet_pton(AF_INET, fromIp, &from.sin_addr);
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &from.sin_addr, sizeof(from.sin_addr));
    unsigned char ttl = 2, loop = 1;
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof(ttl));
    setsockopt(fd, IPPROTO_IP, IP_MULTICAST_LOOP, &loop, sizeof(loop));
    bind(fd, reinterpret_cast<sockaddr *>(&from), sizeof(from));
    std::string msg = "NOTIFY * HTTP/1.1\r\nHOST: 239.255.255.250:1900\r\n";
    if (alive)
        msg += "CACHE-CONTROL: max-age=1800\r\nLOCATION: " + location +
               "\r\nSERVER: Linux/1.0 UPnP/1.0 fakedevice/1.0\r\n";
    msg += "NT: " + serviceType + "\r\nNTS: " + (alive ? "ssdp:alive" : "ssdp:byebye") +
           "\r\nUSN: " + udn + "::" + serviceType + "\r\n\r\n";
    to.sin_port = htons(1900);
    inet_pton(AF_INET, "239.255.255.250", &to.sin_addr);
    ssize_t n = sendto(fd, msg.data(), msg.size(), 0, reinterpret_cast<sockaddr *>(&to), sizeof(to));
    close(fd);
    return n == static_cast<ssize_t>(msg.size()) ? 0 : -1;
}

// The IPv4 address on which some process of this network namespace listens on
// a TCP port ("" when none): libupnp's HTTP server shows which address a
// control point chose.
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

// The namespace's two veth ends (scripts/netns-run): the one a control point at
// controlPointIp is not on, so that announcements cross the pair.
inline void PeerInterface(const std::string &controlPointIp, std::string &ip, std::string &iface)
{
    bool first = controlPointIp == "10.77.0.1";
    ip = first ? "10.77.0.2" : "10.77.0.1";
    iface = first ? "tveth1" : "tveth0";
}

// Sends one GENA NOTIFY to a subscriber's CALLBACK URL ("<http://ip:port/path>")
// and returns the HTTP status of its answer, or -1.
inline int SendGenaEvent(std::string url, const std::string &sid, int seq, const std::string &body)
{
    if (!url.empty() && url[0] == '<')
        url = url.substr(1, url.find('>') - 1);
    size_t slash = url.find('/', 7), colon = url.find(':', 7);
    if (url.compare(0, 7, "http://") != 0 || slash == std::string::npos || colon > slash)
        return -1;
    std::string host = url.substr(7, colon - 7);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<uint16_t>(atoi(url.c_str() + colon + 1)));
    inet_pton(AF_INET, host.c_str(), &addr.sin_addr);
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0 || connect(fd, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) != 0) {
        if (fd >= 0)
            close(fd);
        return -1;
    }
    std::string msg = "NOTIFY " + url.substr(slash) + " HTTP/1.1\r\nHOST: " + url.substr(7, slash - 7) +
                      "\r\nCONTENT-TYPE: text/xml; charset=\"utf-8\"\r\nNT: upnp:event\r\n"
                      "NTS: upnp:propchange\r\nSID: " + sid + "\r\nSEQ: " + std::to_string(seq) +
                      "\r\nCONTENT-LENGTH: " + std::to_string(body.size()) + "\r\n\r\n" + body;
    for (size_t off = 0; off < msg.size();) {
        ssize_t n = send(fd, msg.data() + off, msg.size() - off, MSG_NOSIGNAL);
        if (n <= 0)
            break;
        off += static_cast<size_t>(n);
    }
    std::string answer;
    char buf[1024];
    pollfd p{fd, POLLIN, 0};
    ssize_t n;
    while (answer.find("\r\n") == std::string::npos && poll(&p, 1, 5000) > 0 &&
           (n = recv(fd, buf, sizeof(buf), 0)) > 0)
        answer.append(buf, static_cast<size_t>(n));
    close(fd);
    return answer.compare(0, 5, "HTTP/") == 0 && answer.find(' ') != std::string::npos
               ? atoi(answer.c_str() + answer.find(' ') + 1) : -1;
}

// The body of a GENA event carrying one LastChange text (escaped here).
inline std::string LastChangeEvent(const std::string &lastChange)
{
    std::string escaped;
    for (char c : lastChange)
        escaped += c == '<' ? "&lt;" : c == '>' ? "&gt;" : c == '&' ? "&amp;" : c == '"' ? "&quot;"
                                                                                         : std::string(1, c);
    return "<e:propertyset xmlns:e=\"urn:schemas-upnp-org:event-1-0\"><e:property><LastChange>" +
           escaped + "</LastChange></e:property></e:propertyset>";
}

// A renderer description with the given services (type, base name) whose URLs
// are /<name>/scpd.xml, /<name>/control and /<name>/event.
inline std::string DeviceDescription(const std::string &udn, const std::string &name,
                                     const std::vector<std::pair<std::string, std::string>> &services)
{
    std::string xml = "<?xml version=\"1.0\"?>\n<root xmlns=\"urn:schemas-upnp-org:device-1-0\">"
                      "<specVersion><major>1</major><minor>0</minor></specVersion><device>"
                      "<deviceType>urn:schemas-upnp-org:device:MediaRenderer:1</deviceType>"
                      "<friendlyName>" + name + "</friendlyName><modelName>fake</modelName><UDN>" +
                      udn + "</UDN><serviceList>";
    for (const auto &s : services)
        xml += "<service><serviceType>" + s.first + "</serviceType><serviceId>urn:upnp-org:serviceId:" +
               s.second + "</serviceId><SCPDURL>/" + s.second + "/scpd.xml</SCPDURL><controlURL>/" +
               s.second + "/control</controlURL><eventSubURL>/" + s.second + "/event</eventSubURL></service>";
    return xml + "</serviceList></device></root>\n";
}

// Service descriptions as small as the capability probe accepts: AVTransport
// with Seek by REL_TIME, RenderingControl with SetVolume.
inline std::string AvtScpd()
{
    return "<?xml version=\"1.0\"?><scpd xmlns=\"urn:schemas-upnp-org:service-1-0\"><actionList>"
           "<action><name>Seek</name></action></actionList><serviceStateTable><stateVariable>"
           "<name>A_ARG_TYPE_SeekMode</name><dataType>string</dataType><allowedValueList>"
           "<allowedValue>ABS_TIME</allowedValue><allowedValue>REL_TIME</allowedValue>"
           "</allowedValueList></stateVariable></serviceStateTable></scpd>";
}
inline std::string RcsScpd()
{
    return "<?xml version=\"1.0\"?><scpd xmlns=\"urn:schemas-upnp-org:service-1-0\"><actionList>"
           "<action><name>SetVolume</name></action></actionList><serviceStateTable/></scpd>";
}

}  // namespace fakedev

#endif
